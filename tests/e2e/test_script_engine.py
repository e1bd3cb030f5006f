"""Engines that are missing, die, hang or talk nonsense: the right page, the right line, and a server that goes on."""

import os
import re
import resource
import signal
import subprocess
import time

import pytest

from engines import (
    REPLY_500_SCRIPT,
    check_page,
    children,
    engines,
    install_engine,
    no_remote_service,
    output_files,
    post,
    script,
    use_python,
)
from harness import (
    SLOWDOWN,
    Background,
    Client,
    descriptors,
    is_alive,
    request_text,
    wait_until,
)

LOST_QUERY = r"Unable to transmit query to the scripting engine 32: Broken pipe"
PAGE = "output('page')\n"


@pytest.fixture
def site(site):
    use_python(site)
    script(site, "good.pl", "output('good')\n")
    return site


def run(site, text, body=None):
    """Runs a script in the server and makes sure that the next one runs as well: the raw answer to the first."""
    script(site, "a.pl", text)
    server = site.servers[-1] if site.servers else site.serve()
    raw = site.raw(request_text("/a.pl")) if body is None else post(site, "/a.pl", body).raw
    check_page(site.raw(request_text("/good.pl")), b"good")
    server.wait_idle()
    assert output_files(site) == [] and children(server.pid) == {}
    return raw


# ------------------------------------------------------------------------------------------ engines that do not start


def spoil_engine(site, kind):
    engine = site.root / "ox_script.bin"
    if kind == "missing":
        engine.unlink()
    elif kind == "not executable":
        engine.chmod(0o644)
    elif kind == "a directory":
        engine.unlink()
        engine.mkdir()
    elif kind == "no program":
        install_engine(site, b"neither a program nor a script\n")
    elif kind == "empty":
        install_engine(site, b"")
    elif kind == "without interpreter":
        install_engine(site, b"#!/nonexistent/interpreter\n")
    else:
        engine.unlink()
        engine.symlink_to("ox_script.bin")


@pytest.mark.parametrize(
    "kind,line",
    [
        ("missing", 'Couldn\'t launch "{}": No such file or directory (2)'),
        ("without interpreter", 'Couldn\'t launch "{}": No such file or directory (2)'),
        ("not executable", "execl error #13: Permission denied"),
        ("a directory", "execl error #13: Permission denied"),
        ("no program", "execl error #8: Exec format error"),
        ("empty", "execl error #8: Exec format error"),
        ("a link to itself", "execl error #40: Too many levels of symbolic links"),
    ],
)
@pytest.mark.parametrize("body", [b"", b"x" * 200_000], ids=["no input", "much input"])
def test_an_engine_that_cannot_be_started(site, kind, line, body):
    script(site, "a.pl", PAGE)
    server = site.serve()
    spoil_engine(site, kind)
    assert post(site, "/a.pl", body).raw == REPLY_500_SCRIPT
    line = line.format(site.root / "ox_script.bin")
    assert site.status().count(line) == 1
    site.expect("status", re.escape(line), times=1)
    site.expect("status", LOST_QUERY, times=1 if body else 0)
    assert site.get("/hello.htm").status == 200
    server.wait_idle()
    if kind == "a directory":
        (site.root / "ox_script.bin").rmdir()
    use_python(site)
    check_page(site.raw(request_text("/good.pl")), b"good")


def test_failures_leave_nothing_behind(site):
    """Two hundred engines that fail, two hundred that are killed, four hundred that cannot be started."""
    script(site, "fails.pl", "os._exit(3)\n")
    script(site, "dies.pl", "os.kill(os.getpid(), 9)\n")
    server = site.serve()
    site.get("/good.pl")
    server.wait_idle()
    site.get("/hello.htm")
    server.wait_idle()
    before = len(descriptors(server.pid))

    def load(*urls):
        def fetch(_):
            for url in urls * (100 // len(urls)):
                assert site.raw(request_text(url)) == REPLY_500_SCRIPT

        Background(fetch, 4).join(timeout=60 * SLOWDOWN)

    load("/fails.pl", "/dies.pl")
    (site.root / "ox_script.bin").unlink()
    load("/good.pl")
    server.wait_idle()
    site.get("/hello.htm")
    server.wait_idle()
    assert len(descriptors(server.pid)) == before
    assert children(server.pid) == {} and output_files(site) == []
    site.expect("status", r"Couldn't launch .*", times=400)


def test_a_system_without_room_for_a_process(site):
    """The connections are there when the limit falls; so only the engines cannot be made."""
    script(site, "a.pl", PAGE)
    site.configure(audit={"debuglevel": 7})
    site.use_ordinary_user()
    server = site.serve()
    clients = [Client(site.port) for _ in range(20)]
    for client in clients:
        client.send(b"GET /a.pl HTTP")
    wait_until(lambda: sum("connected to" in line for line in site.err()) == 20, "twenty sessions")
    before = len(descriptors(server.pid))
    hard = resource.getrlimit(resource.RLIMIT_NPROC)[1]

    def limit_processes(soft):
        identity = {"user": site.user, "group": site.user} if site.user is not None else {}
        subprocess.run(["prlimit", f"--pid={server.pid}", f"--nproc={soft}:"], check=True, **identity)

    limit_processes(0)
    started = time.monotonic()
    for client in clients:
        client.send(b"/1.0\r\n\r\n")
        assert client.read_all() == REPLY_500_SCRIPT
        client.close()
    assert time.monotonic() - started < 5 * SLOWDOWN
    limit_processes("unlimited" if hard == resource.RLIM_INFINITY else hard)
    server.wait_idle()
    assert len(descriptors(server.pid)) <= before
    check_page(site.raw(request_text("/good.pl")), b"good")
    site.expect("status", r"Fork\(\) error 11: Resource temporarily unavailable\.", times=20)


# --------------------------------------------------------------------------------------------------- how engines end


@pytest.mark.parametrize(
    "text",
    [
        "os._exit(3)",
        "output('half a page')\nos._exit(1)",
        "output('half a page')\nsay_exit()\nos._exit(255)",
        "os.kill(os.getpid(), signal.SIGKILL)",
        "os.kill(os.getpid(), signal.SIGTERM)",
        "signal.signal(signal.SIGPIPE, signal.SIG_DFL)\nos.kill(os.getpid(), signal.SIGPIPE)",
        "resource = __import__('resource')\nresource.setrlimit(resource.RLIMIT_CORE, (0, 0))\n"
        "os.kill(os.getpid(), signal.SIGSEGV)",
        "say_exit()\nos.kill(os.getpid(), signal.SIGKILL)",
    ],
)
def test_an_engine_that_fails(site, text):
    assert run(site, text) == REPLY_500_SCRIPT


@pytest.mark.parametrize(
    "text,page",
    [
        ("", b""),
        ("say_exit()", b""),
        ("raw('EXIT and more')", b""),
        ("output('page')\nos._exit(0)", b"page"),
        ("os.close(1)\ntime.sleep(0.3)\noutput('page')", b"page"),
        ("os.close(0)\ntime.sleep(0.3)\noutput('page')", b"page"),
        ("os.close(0)\nos.close(1)\nos.close(2)\ntime.sleep(0.3)\noutput('page')", b"page"),
        ("say_exit()\ntime.sleep(0.3)\noutput('page')", b"page"),
        ("os.kill(os.getppid(), 0)\noutput('page')", b"page"),
    ],
)
def test_an_engine_that_ends_well(site, text, page):
    check_page(run(site, text), page)


def test_an_engine_that_never_reads_its_input(site):
    check_page(run(site, PAGE, body=b"x" * (1 << 20)), b"page")
    site.expect("status", LOST_QUERY, times=1)


def test_an_engine_that_closes_its_input_early(site):
    script_text = "body(1000)\nos.close(0)\ntime.sleep(0.3)\n" + PAGE
    check_page(run(site, script_text, body=b"x" * (1 << 20)), b"page")
    site.expect("status", LOST_QUERY, times=1)


def test_an_engine_that_fails_without_reading_its_input(site):
    assert run(site, "os._exit(4)", body=b"x" * (1 << 20)) == REPLY_500_SCRIPT
    site.expect("status", LOST_QUERY, times=1)


@pytest.mark.slow
@pytest.mark.parametrize("text", ["os.close(1)\n", "say_exit()\n", "os.close(0)\nos.close(1)\n"])
def test_an_engine_that_has_said_its_last_word_and_does_not_end_is_killed(site, text):
    text = "for number in (1, 2, 15): signal.signal(number, signal.SIG_IGN)\n" + text
    started = time.monotonic()
    assert run(site, text + "while True: time.sleep(1)\n") == REPLY_500_SCRIPT
    assert 10 <= time.monotonic() - started < 12 + 3 * SLOWDOWN


@pytest.mark.parametrize("streams", ["both pipes", "the output pipe only"])
def test_a_child_that_the_engine_leaves_behind_holds_nobody_up(site, streams):
    text = (
        "if os.fork() == 0:\n"
        + ("" if streams == "both pipes" else "    os.close(0)\n")
        + "    open('child', 'w').write(str(os.getpid()) + ' ')\n    time.sleep(1000)\n"
        "while not os.path.exists('child') or not open('child').read().endswith(' '): time.sleep(0.005)\n"
        "output('page')\nos._exit(0)\n"
    )
    started = time.monotonic()
    check_page(run(site, text), b"page")
    assert time.monotonic() - started < 2 * SLOWDOWN
    child = int((site.root / "child").read_text())
    assert is_alive(child)
    os.kill(child, signal.SIGKILL)


# ------------------------------------------------------------------------------------------------- what engines write


def test_garbage_on_the_output_is_taken_for_messages(site):
    """It becomes a command that nobody knows, which the remote service would get."""
    no_remote_service(site)
    text = "raw('Hello, world\\n')\nassert answer() == (-2, b''), 'the answer'\n" + PAGE
    check_page(run(site, text), b"page")


def test_much_garbage_on_the_output_is_swallowed(site):
    no_remote_service(site)
    text = "os.write(1, b'x' * 200_000)\n" + PAGE
    check_page(run(site, text), b"page")
    site.allow("status", r"A message of the scripting engine \(\d+ bytes\) is not answered: .*")


def test_an_engine_that_fills_its_output_before_it_reads_its_input(site):
    """Neither side waits for the other for ever, though both pipes are full."""
    no_remote_service(site)
    text = (
        "for _ in range(200): os.write(1, struct.pack('=i', 99).ljust(4096, b'\\0'))\n"
        "data = body()\nanswers = [answer() for _ in range(200)]\n"
        "output('%d %d' % (len(data), answers.count((-2, b''))))\n"
    )
    check_page(run(site, text, body=b"x" * (1 << 20)), b"1048576 200")


def test_an_engine_that_never_reads_the_answers(site):
    no_remote_service(site)
    text = "for _ in range(30_000): os.write(1, struct.pack('=i', 22).ljust(4096, b'\\0'))\n" + PAGE
    check_page(run(site, text), b"page")


def test_what_an_engine_writes_to_its_standard_error_is_in_the_status_log(site):
    run(site, "os.write(2, b'a word of the engine\\n')\n")
    assert site.status().count("a word of the engine") == 1
    site.expect("status", "a word of the engine", times=1)


def test_a_started_engine_is_not_changed_by_a_new_one(site):
    script(site, "wait.pl", "open('runs', 'w').close()\nwhile os.path.exists('runs'): time.sleep(0.005)\n" + PAGE)
    site.serve()
    with Client(site.port) as client:
        client.send(request_text("/wait.pl"))
        wait_until(lambda: (site.root / "runs").exists(), "the script runs")
        install_engine(site, b"#!/usr/bin/python3 -IS\nraise SystemExit(3)\n")
        assert site.raw(request_text("/good.pl")) == REPLY_500_SCRIPT
        assert len(engines(site)) == 1
        (site.root / "runs").unlink()
        check_page(client.read_all(), b"page")
