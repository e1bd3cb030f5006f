"""What an engine is started with, shown from inside it: identity, signals, descriptors, limits."""

import os
import signal

import pytest

from conftest import needs_root
from engines import (
    REPLY_500_SCRIPT,
    call,
    check_page,
    install_engine,
    process_fields,
    report_lines,
    script,
    use_player,
    use_python,
    use_steps,
)
from harness import NOBODY, Background, Client, IS_ROOT, mode_of, request_text, wait_until

STATUS = "status\n"


@pytest.fixture
def site(site):
    use_player(site)
    script(site, "status.pl", STATUS)
    return site


def report(site):
    reply = site.get("/status.pl")
    assert reply.status == 200, reply.raw
    return reply.body


def lowered(site):
    """The server is started by root and runs as another user."""
    site.configure(unix={"uid": 1, "gid": 1})
    site.give_to(1)


# ------------------------------------------------------------------------------------------------------------ identity


@needs_root
def test_the_engine_of_a_lowered_server_is_not_root_in_any_way(site):
    lowered(site)
    site.serve(extra_groups=[4, 24, 27])
    fields = process_fields(report(site))
    assert fields["Uid"].split() == ["1"] * 4
    assert fields["Gid"].split() == ["1"] * 4
    assert fields["Groups"] == ""
    assert {int(fields[name], 16) for name in ("CapInh", "CapPrm", "CapEff", "CapAmb")} == {0}


@needs_root
def test_the_engine_of_a_lowered_server_cannot_become_root_again(site):
    lowered(site)
    use_python(site)
    script(site, "root.pl", """
import subprocess
for step in (lambda: os.seteuid(0), lambda: os.setuid(0), lambda: os.setresuid(0, 0, 0), lambda: os.setgid(0),
             lambda: os.setgroups([0])):
    try:
        step()
        output("again root ")
    except PermissionError:
        output("refused ")
output(subprocess.run(["id", "-u"], stdout=subprocess.PIPE).stdout)
output(subprocess.run(["bash", "-c", "id -u; id -g; id -G"], stdout=subprocess.PIPE).stdout)
""")
    site.serve()
    check_page(site.raw(request_text("/root.pl")), b"refused " * 5 + b"1\n1\n1\n1\n")


@needs_root
def test_a_perl_engine_of_a_lowered_server_cannot_become_root_again(site):
    lowered(site)
    install_engine(site, b"""#!/usr/bin/perl
open(OUT, '>>', $ARGV[3]) or exit 7;
$> = 0;
$< = 0;
print OUT "$< $> ", ($( + 0), " ", ($) + 0), " taint ", ${^TAINT}, " ", `id -u`;
close(OUT);
""")
    site.serve()
    check_page(site.raw(request_text("/status.pl")), b"1 1 1 1 taint 0 1\n")


@needs_root
def test_a_lowered_server_serves_scripts_and_users_with_files_of_its_user(site):
    """The output file, the user file and the key belong to the user that the server runs as."""
    lowered(site)
    use_steps(site)
    script(site, "owner.pl", "status = os.stat(args[4])\noutput(f'{status.st_uid} {status.st_gid} {os.getuid()}')\n")
    site.serve()
    check_page(site.raw(request_text("/owner.pl")), b"1 1 1")
    assert call(site, 20, "", "username=bob&password=x") == (0, "")
    for path in (site.users / "bob.usr", site.data / "ox_remote.key"):
        assert (path.stat().st_uid, path.stat().st_gid, mode_of(path)) == (1, 1, 0o600)
    server = site.servers[-1]
    for task in os.listdir(f"/proc/{server.pid}/task"):
        lines = open(f"/proc/{server.pid}/task/{task}/status").read().splitlines()
        assert "Uid:\t0\t1\t0\t1" in lines, "no thread of the server stays root"


@needs_root
def test_a_script_that_the_lowered_user_may_not_read(site):
    lowered(site)
    use_python(site)
    secret = script(site, "secret.pl", "output('secret')\n")
    os.chown(secret, 0, 0)
    secret.chmod(0o600)
    site.serve()
    assert site.raw(request_text("/secret.pl")) == REPLY_500_SCRIPT
    site.expect("status", "(Traceback .*|  .*|PermissionError: .*)")


@needs_root
def test_the_engine_of_a_server_that_stays_root_is_root(site):
    site.serve()
    assert process_fields(report(site))["Uid"].split() == ["0"] * 4


def test_the_engine_of_an_ordinary_user(site):
    site.use_ordinary_user()
    site.serve()
    uid = str(NOBODY if IS_ROOT else os.getuid())
    assert process_fields(report(site))["Uid"].split() == [uid] * 4


# ------------------------------------------------------------------------------------------------- signals and the rest


@pytest.mark.parametrize("prologue", ["", "trap '' INT QUIT CHLD PIPE TERM USR1"], ids=["plain", "ignored signals"])
def test_no_signal_is_blocked_or_ignored_in_an_engine(site, prologue):
    site.serve(**({"shell": prologue} if prologue else {}))
    fields = process_fields(report(site))
    for name in ("SigBlk", "SigIgn", "SigCgt", "SigPnd", "ShdPnd"):
        assert int(fields[name], 16) == 0, f"{name} {fields[name]}"


def test_a_blocked_signal_mask_of_the_starter_is_not_handed_on(site):
    before = signal.pthread_sigmask(signal.SIG_BLOCK, {signal.SIGINT, signal.SIGTERM, signal.SIGCHLD})
    try:
        server = site.serve()
    finally:
        signal.pthread_sigmask(signal.SIG_SETMASK, before)
    assert int(process_fields(report(site))["SigBlk"], 16) == 0
    server.stop()


@pytest.mark.parametrize("signals", ["CHLD", "INT", "CHLD INT PIPE"])
def test_a_server_that_was_started_with_ignored_signals_knows_how_its_engines_end(site, signals):
    script(site, "fails.pl", "exit 3\n")
    script(site, "dies.pl", "kill 2\n")
    script(site, "page.pl", "write-output page\n")
    server = site.serve(shell=f"trap '' {signals}")
    for _ in range(3):
        assert site.raw(request_text("/fails.pl")) == REPLY_500_SCRIPT
        assert site.raw(request_text("/dies.pl")) == REPLY_500_SCRIPT
        check_page(site.raw(request_text("/page.pl")), b"page")
    server.stop()


@pytest.mark.parametrize("umask", [0, 0o077])
def test_the_file_creation_mask_of_an_engine(site, umask):
    script(site, "touch.pl", "touch made-by-the-engine\n")
    site.serve(umask=umask)
    assert report_lines(report(site), "umask") == ["022"]
    site.get("/touch.pl")
    assert mode_of(site.root / "made-by-the-engine") == 0o644


def test_an_engine_works_in_the_installation_directory(site):
    site.serve()
    assert report_lines(report(site), "directory") == [str(site.root)]


def test_an_engine_gets_the_open_files_limit_that_the_server_was_started_with(site):
    """The server raises its own."""
    server = site.serve(shell="ulimit -S -n 300; ulimit -H -n 4000")
    assert report_lines(report(site), "files") == ["300 4000"]
    limits = [line.split() for line in open(f"/proc/{server.pid}/limits") if line.startswith("Max open files")]
    assert limits[0][3:5] == ["4000", "4000"]


def test_an_engine_has_its_three_streams_and_no_other_descriptor(site):
    script(site, "waits.pl", "touch runs\nwait-file go\nwrite-output page\n")
    site.page("large.bin", b"x" * 20_000_000)
    site.configure(audit={"debuglevel": 7})
    site.serve()
    clients = [Client(site.port) for _ in range(50)]
    for number, client in enumerate(clients):
        client.send(request_text("/large.bin") if number < 10 else b"GET ")
    wait_until(lambda: sum("connected to" in line for line in site.err()) == 50, "fifty sessions")
    with Client(site.port) as other:
        other.send(request_text("/waits.pl"))
        wait_until(lambda: (site.root / "runs").exists(), "another script runs")
        reports = []
        Background(lambda _: reports.append(report(site)), 5).join()
        (site.root / "go").touch()
        check_page(other.read_all(), b"page")
    assert len(reports) == 5
    for text in reports:
        lines = report_lines(text, "descriptor")
        assert [line.split()[0] for line in lines] == ["0", "1", "2"], lines
        targets = [line.split()[1] for line in lines]
        assert targets[0].startswith("pipe:") and targets[1].startswith("pipe:") and targets[0] != targets[1]
        assert targets[2] == str(site.status_log)
    for client in clients:
        client.reset()
    site.allow("err", r"Reply error writing to socket - socket error = \d+")


@pytest.mark.parametrize("redirect", ["<&-", "<&- >&-", ">&-", "2>&-", "<&- >&- 2>&-"])
def test_scripts_run_where_the_server_was_started_without_standard_streams(site, redirect):
    script(site, "echo.pl", "read length\nwrite-body\nlog a word of the engine\n")
    site.serve(redirect=redirect)
    for _ in range(3):
        check_page(site.raw(request_text("/echo.pl?some=data")), b"some=data")
    lines = report_lines(report(site), "descriptor")
    assert [line.split()[0] for line in lines] == ["0", "1", "2"], lines
    assert [line.split()[1][:5] for line in lines[:2]] == ["pipe:", "pipe:"]
    site.expect("status", "a word of the engine", times=3)


def test_an_engine_is_not_slowed_down(site):
    site.serve()
    assert report_lines(report(site), "nice") == [str(os.nice(0))]
