"""Scripts and the life of the server: pace, places, time limits, stop, reset and sudden death."""

import os
import signal
import time

import pytest

from engines import (
    REPLY_500_SCRIPT,
    check_page,
    children,
    engines,
    output_files,
    script,
    use_player,
)
from harness import (
    SLOWDOWN,
    Background,
    Client,
    descriptors,
    is_listening,
    request_text,
    thread_count,
    wait_until,
)

STATUS, RESET, CHILD_END = 31, 16, 17
TIMED_OUT = r"Session 0x[0-9A-F]+ has timed-out -- removing\."


@pytest.fixture
def site(site):
    use_player(site)
    script(site, "page.pl", "write-output page\nexitmsg\n")
    script(site, "waits.pl", "touch held%4\nwait-file go\nwrite-output page\n")
    (site.root / "held.").mkdir()  # for "held" + "./.oxscript:1"
    return site


def held(site):
    return sorted(path.name for path in (site.root / "held.").iterdir() if path.suffix != ".new")


def started(site, count, url="/waits.pl"):
    """Clients whose scripts run."""
    clients = [Client(site.port) for _ in range(count)]
    before = len(engines(site))
    for client in clients:
        client.send(request_text(url))
    wait_until(lambda: len(engines(site)) == before + count, "the engines run")
    return clients


def expect_cut(site):
    """Lines that a request may leave which ends with its server."""
    site.allow("err", r"Reply error writing to socket - socket error = -?\d+")
    site.allow("err", r"Error reading request from socket - socket timed out\.")


# ------------------------------------------------------------------------------------------------------------ the pace


def test_a_script_is_answered_as_soon_as_its_engine_has_ended(site):
    """Nothing is looked at once a second only."""
    script(site, "late.pl", "write-output page\nexitmsg\nsleep 0.05\n")
    site.serve()
    for url in ("/page.pl", "/late.pl"):
        times = []
        for _ in range(11):
            before = time.monotonic()
            check_page(site.raw(request_text(url)), b"page")
            times.append(time.monotonic() - before)
        assert sorted(times)[5] < 0.5 * SLOWDOWN and min(times) < 0.2 * SLOWDOWN, times


def test_sixteen_scripts_run_at_once_and_the_seventeenth_waits(site):
    script(site, "turn.pl", "touch held%4\nwait-file go%4\nwrite-output %4\n")
    (site.root / "go.").mkdir()
    site.serve()
    pages = []
    load = Background(lambda _: pages.append(site.get("/turn.pl").body.decode()), 17)
    wait_until(lambda: len(held(site)) == 16, "sixteen scripts run")
    end = time.monotonic() + 1.5
    while time.monotonic() < end:
        assert len(held(site)) == 16 and len(engines(site)) == 16, "more than sixteen engines"
        assert site.get("/hello.htm").status == 200
        time.sleep(0.05)  # leaves the processor to the engines
    first = held(site)[0]
    (site.root / "go." / first).touch()
    released = time.monotonic()
    wait_until(lambda: len(held(site)) == 17, "the seventeenth has its turn")
    assert time.monotonic() - released < 1 * SLOWDOWN
    wait_until(lambda: pages, "the first page")
    assert pages == [f"./{first}"]
    for name in held(site):
        (site.root / "go." / name).touch()
    load.join()
    assert sorted(pages) == sorted(f"./.oxscript:{number:x}" for number in range(1, 18))


# ------------------------------------------------------------------------------------------------------------- signals


def test_the_ends_of_scripts_do_not_end_the_server(site):
    script(site, "dies.pl", "kill 11\n")
    server = site.serve(shell="ulimit -c 0")
    for _ in range(5):
        check_page(site.raw(request_text("/page.pl")), b"page")
        assert site.raw(request_text("/dies.pl")) == REPLY_500_SCRIPT
    before = site.status()
    code, _ = site.run("-status")
    assert code == 0
    wait_until(lambda: f"Remote interface server is active on port {site.port}." in site.status(), "the report")
    assert site.status()[: len(before)] == before
    server.signal(CHILD_END)
    assert server.wait_exit() == 0
    assert not site.pid_file.exists()


def test_ends_of_scripts_are_not_named_at_level_10(site):
    site.configure(audit={"debuglevel": 10})
    server = site.serve()
    check_page(site.raw(request_text("/page.pl")), b"page")
    server.signal(STATUS)
    wait_until(lambda: any("is active on port" in line for line in site.status()), "the report")
    assert not any("Child exited" in line for line in site.status())


# -------------------------------------------------------------------------------------------------------- time limits


def test_a_script_that_takes_too_long_is_ended(site):
    """It is interrupted, and killed five seconds later where it ignores that."""
    site.configure(web={"WebScriptTimeout": 2})
    script(site, "hangs.pl", "write-output half a page\nforever\n")
    script(site, "deaf.pl", "ignore 2\nforever\n")
    script(site, "sleeps.pl", "sleep 0.5\nwrite-output page\n")
    server = site.serve()
    before = time.monotonic()
    with Client(site.port) as deaf:
        deaf.send(request_text("/deaf.pl"))
        assert site.raw(request_text("/hangs.pl")) == REPLY_500_SCRIPT
        assert 2 <= time.monotonic() - before < 4 * SLOWDOWN
        check_page(site.raw(request_text("/sleeps.pl")), b"page")
        assert deaf.read_all() == REPLY_500_SCRIPT
        assert 7 <= time.monotonic() - before < 9 * SLOWDOWN
    server.wait_idle()
    assert engines(site) == [] and children(server.pid) == {} and output_files(site) == []


def test_the_time_limit_ends_the_wait_for_the_lock_too(site):
    site.configure(web={"WebScriptTimeout": 3})
    script(site, "holds.pl", "ignore 2\nsend 61 1\nexpect 0 OK\ntouch locked\nforever\n")
    script(site, "wants.pl", "send 61 1\nanswer\n")
    server = site.serve()
    before = time.monotonic()
    with Client(site.port) as client:
        client.send(request_text("/holds.pl"))
        wait_until(lambda: (site.root / "locked").exists(), "the lock is taken")
        assert site.raw(request_text("/wants.pl")) == REPLY_500_SCRIPT
        assert time.monotonic() - before < 6 * SLOWDOWN
        assert len(engines(site)) == 1, "the lock is still held"
        assert client.read_all() == REPLY_500_SCRIPT
    server.wait_idle()
    script(site, "free.pl", "send 61 2\nexpect 0 OK\nwrite-output page\n")
    check_page(site.raw(request_text("/free.pl")), b"page")


@pytest.mark.slow
def test_a_script_that_outlives_its_session_holds_nobody_up_and_reaches_nobody(site):
    site.configure(web={"WebUserTimeout": 30}, audit={"debuglevel": 5})
    script(site, "long.pl", "write-output the secret page\nsleep 60\n")
    server = site.serve()
    began = time.monotonic()
    late = Client(site.port)
    late.send(request_text("/long.pl"))
    wait_until(lambda: engines(site), "the script runs")
    slowest = 0.0
    bodies = set()
    while not any("timed-out" in line for line in site.err()):
        assert time.monotonic() - began < 40 + 5 * SLOWDOWN, "the session is not timed out"
        before = time.monotonic()
        bodies.add(site.get("/hello.htm").body)
        slowest = max(slowest, time.monotonic() - before)
        time.sleep(0.1)  # the pace of the other clients
    assert time.monotonic() - began >= 30
    for _ in range(20):
        before = time.monotonic()
        bodies.add(site.get("/hello.htm").body)
        slowest = max(slowest, time.monotonic() - before)
    assert bodies == {(site.web / "hello.htm").read_bytes()}
    assert slowest < 1.5 * SLOWDOWN, f"another client waited {slowest:.2f} s"
    assert late.read_all() == b""
    wait_until(lambda: engines(site) == [], "the engine is ended", timeout=8 * SLOWDOWN)
    server.wait_idle()
    assert output_files(site) == [] and children(server.pid) == {}
    site.expect("err", TIMED_OUT, times=1)
    late.close()


# -------------------------------------------------------------------------------------------------- stop, reset, death


@pytest.mark.parametrize("deaf", [False, True], ids=["obedient", "deaf"])
def test_a_stop_ends_the_scripts(site, deaf):
    head = "ignore 2\nignore 15\n" if deaf else ""
    script(site, "locks.pl", head + "send 61 1\nexpect 0 OK\ntouch locked\nsleep 100\n")
    script(site, "wants.pl", head + "touch asks\nsend 61 1\nanswer\nsleep 100\n")
    script(site, "sleeps.pl", head + "sleep 100\n")
    server = site.serve(shell="ulimit -c 0")
    clients = started(site, 1, "/locks.pl")
    wait_until(lambda: (site.root / "locked").exists(), "the lock is taken")
    clients += started(site, 1, "/wants.pl") + started(site, 1, "/sleeps.pl")
    wait_until(lambda: (site.root / "asks").exists(), "the lock is asked for")
    before = time.monotonic()
    code, out = site.run("-stop")
    assert code == 0 and out.endswith("The server has been stopped.\n")
    assert server.wait_exit() == 0
    assert time.monotonic() - before < (30 if SLOWDOWN > 1 else 14 if deaf else 6)
    assert engines(site) == []
    assert site.status()[-1] == f"Process {server.pid} termination requested. Cleaning up..."
    assert not site.pid_file.exists() and not is_listening(site.port)
    for client in clients:
        assert client.read_all() == b""
        client.close()
    expect_cut(site)


def test_a_stop_ends_sixteen_scripts_and_those_that_wait_for_a_place(site):
    server = site.serve()
    clients = started(site, 16)
    waiting = [Client(site.port) for _ in range(20)]
    for client in waiting:
        client.send(request_text("/page.pl"))
    wait_until(lambda: thread_count(server.pid) >= server.threads + 36, "all sessions run")
    before = time.monotonic()
    server.stop()
    assert time.monotonic() - before < 12 * SLOWDOWN
    assert engines(site) == []
    for client in clients + waiting:
        client.close()
    expect_cut(site)


def test_the_engines_die_with_a_killed_server(site):
    script(site, "deaf.pl", "ignore 1\nignore 2\nignore 15\nsleep 1000\n")
    server = site.serve()
    clients = started(site, 3) + started(site, 2, "/deaf.pl")
    os.kill(server.pid, signal.SIGKILL)
    assert server.wait_exit() == -signal.SIGKILL
    wait_until(lambda: engines(site) == [], "no engine is left", timeout=5 * SLOWDOWN)
    for client in clients:
        client.close()
    left = output_files(site)
    assert left == [f".oxscript:{number}" for number in range(1, 6)]
    server = site.serve()
    check_page(site.raw(request_text("/page.pl")), b"page")
    # The new server's file takes the place of the old one, and goes.
    wait_until(lambda: output_files(site) == left[1:], "the file of the same number is gone")


@pytest.mark.parametrize("number", [signal.SIGINT, signal.SIGABRT, CHILD_END])
def test_every_end_of_the_server_ends_the_engines(site, number):
    server = site.serve()
    clients = started(site, 3)
    server.signal(number)
    assert server.wait_exit() == 0
    wait_until(lambda: engines(site) == [], "no engine is left")
    for client in clients:
        client.close()
    expect_cut(site)


def test_scripts_live_through_a_reset(site):
    server = site.serve()
    clients = started(site, 3)
    server.reset()
    check_page(site.raw(request_text("/page.pl")), b"page")
    (site.root / "go").touch()
    for client in clients:
        check_page(client.read_all(), b"page")
        client.close()


def test_resets_under_the_load_of_scripts(site):
    """A connection may be refused or dropped unanswered; a page that has begun is whole."""
    script(site, "big.pl", "repeat 20\nwrite-output " + "0123456789abcdef" * 200 + "\nend\n")
    page = b"0123456789abcdef" * 4000
    server = site.serve()
    outcomes = {"whole": 0, "lost": 0}
    ending = []

    def load(_):
        while not ending:
            raw = b""
            try:
                with Client(site.port) as client:
                    client.send(request_text("/big.pl"))
                    while block := client.receive():
                        raw += block
            except OSError:
                assert raw == b"", f"cut after {len(raw)} bytes"
                outcomes["lost"] += 1
                continue
            check_page(raw, page)
            outcomes["whole"] += 1

    clients = Background(load, 6)
    for _ in range(20):
        server.reset()
        goal = outcomes["whole"] + 10
        wait_until(lambda: outcomes["whole"] >= goal or clients.errors, "pages between the resets")
    ending.append(True)
    clients.join()
    server.wait_idle()
    assert children(server.pid) == {} and engines(site) == [] and output_files(site) == []


@pytest.mark.daemon
def test_a_daemon_runs_scripts_and_is_stopped_while_it_does(site):
    _, _, daemon = site.start_daemon()
    check_page(site.raw(request_text("/page.pl")), b"page")
    script(site, "status.pl", "log a word of the engine\nstatus\n")
    report = site.get("/status.pl").body.decode()
    assert f"descriptor 2 {site.status_log}\n" in report
    site.expect("status", "a word of the engine", times=1)
    clients = started(site, 3)
    code, out = site.run("-stop")
    assert code == 0 and out.endswith("The server has been stopped.\n")
    daemon.wait_exit()
    assert engines(site) == []
    for client in clients:
        client.close()
    expect_cut(site)


def test_script_runs_leave_nothing_behind(site):
    script(site, "fails.pl", "exit 3\n")
    server = site.serve()
    site.get("/page.pl")
    server.wait_idle()
    site.get("/hello.htm")
    server.wait_idle()
    files = len(descriptors(server.pid))

    def load(number):
        for turn in range(25):
            raw = site.raw(request_text("/fails.pl" if (number + turn) % 5 == 0 else "/page.pl"))
            assert raw == REPLY_500_SCRIPT or raw.endswith(b"\r\n\r\npage")

    Background(load, 20).join(timeout=60 * SLOWDOWN)
    server.wait_idle()
    site.get("/hello.htm")
    server.wait_idle()
    assert len(descriptors(server.pid)) == files
    assert children(server.pid) == {} and output_files(site) == []
