"""The command line: every form with its exit status and its exact output."""

import ctypes
import os
import re
import signal
import socket
import subprocess
import sys
import time

import pytest

from conftest import needs_root
from harness import (
    ALREADY_RUNNING,
    BANNER,
    DEAD_PID,
    DEBUG_NOTICE,
    INVALID,
    SLOWDOWN,
    STATUS_NOTICE,
    USAGE,
    not_running,
    process_status,
    shown_host_name,
    wait_until,
)


@pytest.mark.parametrize(
    "arguments",
    [[], ["start"], ["stop", "status"], ["a=b"], ["x:y"], ["-"], ["--"], [""], ["x" * 79 + "-stop"]],
    ids=["none", "plain", "plains", "equals", "colon", "dash", "dashes", "empty", "dash-behind-79-characters"],
)
def test_without_a_switch_the_usage_is_printed(site, arguments):
    assert site.run(*arguments) == (1, BANNER + USAGE)


@pytest.mark.parametrize(
    "argument",
    ["-update", "-bogus", "-s", "-sto", "-star", "-statu", "-debu", "-=", "foo-bar", "--Xstop", "x" * 78 + "-stop"],
)
def test_an_unknown_switch_is_an_invalid_argument(site, argument):
    assert site.run(argument) == (1, BANNER + INVALID + USAGE)


@pytest.mark.parametrize(
    "argument",
    ["-stop", "--stop", "-stop-now", "-STOP", "-Stopping", "---sToP", "stop-", "-status", "--STATUS", "-statusx"],
)
def test_stop_and_status_without_a_pid_file_name_error_2(site, argument):
    assert site.run(argument) == (1, BANNER + not_running(2))
    assert not site.pid_file.exists()


@pytest.mark.parametrize("argument", ["-stop", "-status"])
def test_stop_and_status_of_a_dead_process_name_error_3(site, argument):
    site.pid_file.write_text(f"{DEAD_PID}\n")
    assert site.run(argument) == (1, BANNER + not_running(3))


@pytest.mark.parametrize("argument", ["-stop", "-status"])
def test_stop_and_status_of_a_foreign_process_name_error_1(site, argument):
    site.use_ordinary_user()
    site.pid_file.write_text("1\n")
    assert site.run(argument) == (1, BANNER + not_running(1))


@pytest.mark.parametrize("argument", ["-start", "-STARTNOW", "--start", "start-up", "-Started"])
def test_every_switch_that_begins_with_start_is_start(site, argument):
    site.pid_file.write_text(f"{os.getpid()}\n")
    assert site.run(argument) == (1, BANNER + ALREADY_RUNNING)


@pytest.mark.parametrize("argument", ["-debug", "-DEBUGGER", "--debug-now"])
def test_every_switch_that_begins_with_debug_is_debug(site, argument):
    site.pid_file.write_text(f"{os.getpid()}\n")
    assert site.run(argument) == (1, BANNER + DEBUG_NOTICE + ALREADY_RUNNING)


def test_an_argument_may_stand_before_and_behind_the_switch(site):
    assert site.run("plain", "a=b", "-status", "x:y") == (1, BANNER + not_running(2))


def test_switches_run_in_order_and_the_last_one_gives_the_exit_status(site):
    assert site.run("-stop", "-status") == (1, BANNER + not_running(2) * 2)
    assert site.run("-status", "-bogus") == (1, BANNER + not_running(2) + INVALID + USAGE)
    assert site.run("-bogus", "-status") == (1, BANNER + INVALID + USAGE)
    server = site.serve()
    assert site.run("-bogus", "-stop") == (1, BANNER + INVALID + USAGE)
    assert server.alive()
    assert site.run("-status", "-bogus") == (1, BANNER + STATUS_NOTICE + INVALID + USAGE)
    code, out = site.run("-stop", "-status")
    assert code == 1
    assert out.startswith(BANNER) and out.endswith("The server has been stopped.\n" + not_running(2))
    assert server.wait_exit() == 0


def test_status_of_a_running_server(site, server):
    assert site.run("-status") == (0, BANNER + STATUS_NOTICE)
    wait_until(lambda: f"Remote interface server is active on port {site.port}." in site.status(), "the report")
    assert f"Process {server.pid}: oxSIGSTATUS received - current server status:" in site.status()


def test_status_twice_gives_two_notices(site, server):
    assert site.run("-status", "-status") == (0, BANNER + STATUS_NOTICE * 2)
    wait_until(lambda: f"Remote interface server is active on port {site.port}." in site.status(), "the report")
    assert server.alive()


@pytest.mark.parametrize(
    "logdir,logfile,shown",
    [
        ("./var//log/./deep/", "my.audit", "./var/log/deep/my.audit"),
        (".\\var\\log", "my.audit", "./var/log/my.audit"),
        ("var/log", "my.audit", "var/log/my.audit"),
    ],
)
def test_status_names_the_configured_log_and_its_directory_is_made(site, logdir, logfile, shown):
    site.configure(audit={"logdir": logdir, "logfile": logfile})
    server = site.serve(ready=False)
    log = site.root / shown
    line = f"The remote configuration server has been started ({server.pid})."
    wait_until(lambda: log.exists() and line in log.read_text(), "the start line")
    code, out = site.run("-status")
    assert (code, out) == (
        0,
        BANNER + f"Status request sent to the server.\nRefer to {shown} for results.\n\n",
    )
    wait_until(lambda: f"active on port {site.port}." in log.read_text(), "the report")


SPINNER_STEP = re.compile(r"\r(.) (Server stopping\.\.\. {59})\r")


def spinner_marks(text):
    """The marks of the spinner steps that the text consists of."""
    marks = ""
    while text:
        match = SPINNER_STEP.match(text)
        assert match, f"not a spinner step: {text[:90]!r}"
        marks += match[1]
        text = text[match.end() :]
    return marks


def test_stop_draws_the_spinner_until_the_server_has_ended(site, server):
    code, out = site.run("-stop")
    assert code == 0
    tail = "The server has been stopped.\n"
    assert out.startswith(BANNER) and out.endswith(tail)
    marks = spinner_marks(out[len(BANNER) : -len(tail)])
    assert ("|/-\\" * 10).startswith(marks)
    assert server.wait_exit() == 0
    assert not site.pid_file.exists()


@pytest.mark.slow
def test_stop_of_a_server_that_outlives_thirty_seconds_is_still_in_progress(site, server):
    server.signal(signal.SIGSTOP)
    code, out = site.run("-stop")
    tail = "The server stop is still in progress.\n"
    assert code == 0
    assert out.startswith(BANNER) and out.endswith(tail)
    marks = spinner_marks(out[len(BANNER) : -len(tail)])
    assert 28 <= len(marks) <= 31
    assert ("|/-\\" * 10).startswith(marks)
    server.signal(signal.SIGCONT)
    assert server.wait_exit() == 0


def test_stop_of_a_server_that_nobody_has_reaped_yet_ends_at_once(site, server):
    """The child of the test stays a zombie, which still answers signal 0."""
    started = time.monotonic()
    code, out = site.run("-stop")
    assert time.monotonic() - started < 5 * SLOWDOWN
    assert code == 0 and out.endswith("The server has been stopped.\n")
    assert process_status(server.pid)["State"].startswith("Z")
    assert server.wait_exit() == 0


def test_a_second_start_is_refused_while_the_server_runs(site, server):
    assert site.run("-start") == (1, BANNER + ALREADY_RUNNING)
    assert site.run("-debug") == (1, BANNER + DEBUG_NOTICE + ALREADY_RUNNING)
    assert site.get("/hello.htm").status == 200
    assert site.read_pid() == server.pid


def test_an_existing_file_in_place_of_the_status_directory_ends_the_program(site):
    (site.root / "blocker").write_text("a file\n")
    site.configure(audit={"logdir": "./blocker/logs"})
    for option in ("-status", "-stop", "-start", "-debug"):
        assert site.run(option) == (1, "Could not create the status logs directory - ./blocker/logs.")


def test_the_status_directory_is_made_by_every_command(site):
    directory = site.root / "oxm_oxx" / "datfiles" / "statuslogs"
    assert not directory.exists()
    site.run("-status")
    assert directory.is_dir()
    assert directory.stat().st_mode & 0o777 == 0o755


def test_a_pid_file_that_gets_descriptor_0_is_reported(site):
    site.pid_file.write_text(f"{os.getpid()}\n")
    code, out = site.run("-status", redirect="0<&-")
    assert code == 1
    path = re.escape(str(site.pid_file))
    assert re.fullmatch(
        re.escape(BANNER) + rf"Error: can't open {path}: .*\nError: The server is not running \(\d+\)\.\n\n", out
    ), out
    site.expect("startup", rf"Error: can't open {path}: .*", times=1)


def test_the_level_line_is_in_the_start_up_log_and_not_on_the_screen(site):
    site.configure(audit={"debuglevel": 9})
    hard = "ulimit -S -n $(ulimit -H -n)"
    assert site.run("-status", shell=hard) == (1, BANNER + not_running(2))
    assert site.startup() == ["Debug level is now 9."]


def test_each_command_starts_its_log_afresh(site):
    site.configure(audit={"debuglevel": 9})
    for _ in range(3):
        site.run("-status", shell="ulimit -S -n $(ulimit -H -n)")
    assert site.startup() == ["Debug level is now 9."]


def test_the_open_files_limit_is_raised_to_the_hard_limit_when_none_is_set(site):
    site.configure(audit={"debuglevel": 5})
    assert site.run("-status", shell="ulimit -S -n 100; ulimit -H -n 200") == (
        1,
        "RLIMIT_NOFILE set to 200.\n" + BANNER + not_running(2),
    )
    assert site.startup() == ["RLIMIT_NOFILE set to 200."]


def test_the_configured_open_files_limit_is_set(site):
    site.configure(audit={"debuglevel": 5}, unix={"handles": 150})
    assert site.run("-status", shell="ulimit -S -n 100; ulimit -H -n 200") == (
        1,
        "RLIMIT_NOFILE set to 150.\n" + BANNER + not_running(2),
    )


def test_a_soft_limit_above_the_configured_one_is_left_alone(site):
    site.configure(audit={"debuglevel": 9}, unix={"handles": 50})
    assert site.run("-status", shell="ulimit -S -n 100; ulimit -H -n 200") == (1, BANNER + not_running(2))


def test_an_ordinary_user_cannot_go_beyond_the_hard_limit(site):
    site.configure(audit={"debuglevel": 5}, unix={"handles": 300})
    site.use_ordinary_user()
    warning = "Warning: Non-root users cannot set RLIMIT_NOFILE to greater than 200 handles. (handles=300)"
    assert site.run("-status", shell="ulimit -S -n 100; ulimit -H -n 200") == (
        1,
        f"{warning}\nRLIMIT_NOFILE set to 200.\n" + BANNER + not_running(2),
    )
    site.expect("startup", re.escape(warning), times=1)


NAMELESS_USAGE = USAGE.replace("ox_remote", "")


def test_an_empty_program_name_counts_as_one_in_the_working_directory(site):
    assert site.run("-status", argv0="") == (1, BANNER + not_running(2))
    assert site.run(argv0="") == (1, BANNER + NAMELESS_USAGE)
    assert (site.root / ".startup").exists()


def test_without_even_a_program_name_the_usage_is_printed(site):
    """Newer kernels hand an empty program name to a program that is started without arguments."""
    start = "import ctypes, sys; ctypes.CDLL(None).execv(sys.argv[1].encode(), (ctypes.c_char_p * 1)()); sys.exit(99)"
    code, out = site.run("-c", start, str(site.exe), program=sys.executable, timeout=5 * SLOWDOWN)
    assert code == 1
    kernel = tuple(int(number) for number in re.match(r"(\d+)\.(\d+)", os.uname().release).groups())
    assert out == (BANNER if kernel >= (5, 18) else "") + NAMELESS_USAGE
    assert site.leftover_processes() == []
    assert not list(site.root.glob("*.pid"))


@needs_root
@pytest.mark.parametrize("name,shown", [("h" * 63, "h" * 63), ("h" * 64, "local")], ids=["63", "64"])
def test_a_host_name_that_does_not_fit_is_shown_as_local(site, name, shown):
    libc = ctypes.CDLL(None, use_errno=True)
    new_names = 0x04000000  # CLONE_NEWUTS: the name is changed for the server alone
    if subprocess.run(["unshare", "--uts", "true"], stderr=subprocess.DEVNULL).returncode != 0:
        pytest.skip("namespaces are not allowed here")

    def rename_machine():
        if libc.unshare(new_names) != 0:
            raise OSError(ctypes.get_errno(), "unshare")
        socket.sethostname(name)

    server = site.serve(preexec_fn=rename_machine)
    assert shown_host_name(name) == shown
    assert f"Remote interface server available on http://{shown}:{site.port}." in site.status()
    assert site.get("/hello.htm").status == 200
    server.stop()


@needs_root
def test_ids_that_cannot_be_taken_are_reported_and_the_command_goes_on(site):
    site.configure(unix={"uid": -1, "gid": -1})
    assert site.run("-status", stderr="setgid: Invalid argumentseteuid: Invalid argument") == (
        1,
        BANNER + not_running(2),
    )


@needs_root
def test_the_default_ids_are_1(site):
    site.configure(unix={"uid": None, "gid": None})
    site.give_to(1)
    server = site.serve()
    status = open(f"/proc/{server.pid}/status").read()
    assert re.search(r"^Uid:\t0\t1\t", status, re.M), status
    assert re.search(r"^Gid:\t1\t1\t1\t1$", status, re.M), status


def test_a_command_opens_no_socket_and_starts_no_server(site):
    """A look at the system calls: a status request must not build the server object with its look-ups."""
    strace = next((p for p in ("/usr/bin/strace", "/usr/local/bin/strace") if os.access(p, os.X_OK)), None)
    if strace is None:
        pytest.skip("needs strace")
    trace = site.scratch / "trace"
    process = site.spawn(
        "-f", "-o", str(trace), "-e", "trace=socket,connect,clone,clone3,fork,vfork", str(site.exe), "-status",
        argv0="strace", program=strace, stdout=subprocess.PIPE, stderr=subprocess.PIPE,
        env={"ASAN_OPTIONS": "detect_leaks=0"},
    )
    out, _ = process.communicate(timeout=60)
    if not trace.exists() or "exited" not in trace.read_text():
        pytest.skip("tracing is not allowed here")
    assert out.decode() == BANNER + not_running(2)
    calls = [line for line in trace.read_text().splitlines() if re.search(r"\b(socket|connect)\(", line)]
    assert calls == []
