"""The server in the background. Each start takes the five seconds of the parent's pause, so each test looks at much."""

import errno
import fcntl
import os
import re
import resource
import select
import signal
import socket
import subprocess
import time

import pytest

from harness import (
    ALREADY_RUNNING,
    BANNER,
    DEAD_PID,
    INVALID,
    SANITIZER,
    SLOWDOWN,
    STATUS_NOTICE,
    USAGE,
    Daemon,
    descriptors,
    free_port,
    is_listening,
    mode_of,
    not_running,
    port_in_use_line,
    process_status,
    shown_host_name,
    wait_until,
)

pytestmark = pytest.mark.daemon


def start_lines(site, pid):
    return (
        f"Remote interface server available on http://{shown_host_name()}:{site.port}.\n"
        f"The remote configuration server has been started ({pid}).\n"
    )


def test_start_status_second_start_and_stop(site):
    started = time.monotonic()
    code, out, daemon = site.start_daemon(umask=0)
    elapsed = time.monotonic() - started
    assert 5 <= elapsed < 5 + 3 * SLOWDOWN, "the command returns after its five seconds, with its output closed"
    assert (code, out) == (0, BANNER + start_lines(site, daemon.pid))
    assert site.get("/hello.htm").status == 200

    fields = process_status(daemon.pid)
    assert int(fields["PPid"]) != os.getpid()
    assert os.getsid(daemon.pid) == daemon.pid
    assert fields["Umask"] == "0000"
    assert os.readlink(f"/proc/{daemon.pid}/cwd") == str(site.root)
    files = descriptors(daemon.pid)
    assert files[0] == files[1] == "/dev/null"
    assert files[2] == str(site.status_log)
    assert not site.startup_log.exists()
    assert site.pid_file.read_text() == f"{daemon.pid}\n"
    assert mode_of(site.pid_file) == 0o664
    for path in (site.status_log, site.access_log, site.error_log):
        assert mode_of(path) == 0o644, path
    assert mode_of(site.status_log.parent) == 0o755

    assert site.run("-start") == (1, BANNER + ALREADY_RUNNING)
    assert site.run("-status") == (0, BANNER + STATUS_NOTICE)
    wait_until(lambda: f"Remote interface server is active on port {site.port}." in site.status(), "the report")

    code, out = site.run("-stop")
    assert code == 0 and out.endswith("The server has been stopped.\n")
    daemon.wait_exit()
    assert not site.pid_file.exists() and not is_listening(site.port)
    assert site.status()[-1] == f"Process {daemon.pid} termination requested. Cleaning up..."
    assert site.run("-stop") == (1, BANNER + not_running(2))


def test_start_then_status_and_stop_then_start(site):
    """The daemon itself never goes on to the switches behind -start."""
    code, out, first = site.start_daemon("-start", "-status")
    assert (code, out) == (0, BANNER + start_lines(site, first.pid) + STATUS_NOTICE)
    wait_until(lambda: any("oxSIGSTATUS" in line for line in site.status()), "the report")
    code, out = site.run("-stop", "-start")
    first.wait_exit()
    second = wait_until(site.read_pid, "the pid of the second server")
    assert second != first.pid
    assert code == 0
    assert out.startswith(BANNER) and out.endswith("The server has been stopped.\n" + start_lines(site, second))
    assert site.get("/hello.htm").status == 200
    code, out = site.run("-stop")
    assert code == 0 and out.endswith("The server has been stopped.\n")
    assert sum("oxSIGSTATUS" in line for line in site.status()) == 1


def test_start_then_an_unknown_switch(site):
    """The server runs all the same; the exit status is that of the last switch."""
    code, out, daemon = site.start_daemon("-start", "-bogus")
    assert (code, out) == (1, BANNER + start_lines(site, daemon.pid) + INVALID + USAGE)
    assert site.get("/hello.htm").status == 200
    assert daemon.alive()


def test_stop_start_and_stop_in_one_call(site, server):
    tail = "The server has been stopped.\n"
    code, out = site.run("-stop", "-start", "-stop")
    assert server.wait_exit() == 0
    assert code == 0
    assert out.startswith(BANNER) and out.endswith(tail) and out.count(tail) == 2
    pids = re.findall(r"has been started \((\d+)\)\.", out)
    assert len(pids) == 1 and int(pids[0]) != server.pid
    assert start_lines(site, pids[0]) in out
    assert not site.pid_file.exists() and not is_listening(site.port)
    assert site.leftover_processes() == []
    assert site.status()[-1] == f"Process {pids[0]} termination requested. Cleaning up..."


def test_stop_start_and_stop_where_nothing_runs(site):
    """A failed switch does not keep the next ones from being carried out."""
    code, out = site.run("-stop", "-start", "-stop")
    pid = re.search(r"has been started \((\d+)\)\.", out)[1]
    assert code == 0
    assert out.startswith(BANNER + not_running(2) + start_lines(site, pid))
    assert out.endswith("The server has been stopped.\n")
    assert site.leftover_processes() == []
    assert not site.pid_file.exists()


@pytest.mark.parametrize("count", [2, 4])
def test_of_several_starts_at_once_exactly_one_serves(site, count):
    commands = [site.spawn("-start", stdout=subprocess.PIPE, stderr=subprocess.PIPE) for _ in range(count)]
    results = []
    for command in commands:
        out, err = command.communicate(timeout=60 * SLOWDOWN)
        results.append((command.returncode, out.decode("latin-1"), err.decode("latin-1")))
    daemon = Daemon(site, site.read_pid())
    site.servers.append(daemon)
    assert site.leftover_processes() == [daemon.pid]
    assert [path.name for path in site.root.glob("*.pid")] == ["ox_remote.pid"]
    assert site.pid_file.read_text() == f"{daemon.pid}\n"
    assert site.get("/hello.htm").status == 200
    assert sum("has been started" in line for line in site.status()) == 1
    assert len(site.err()) == 1, "only one has begun to serve"

    lost = [
        f"Error: Orvex Reporting UI is already running: {os.strerror(errno.EAGAIN)}",
        f"Error: Unable to create lock file, {site.pid_file}.",
    ]
    locked_out = (0, BANNER + "".join(f"{line}\n" for line in lost), "")
    refused = (1, BANNER + ALREADY_RUNNING, "")
    served = (0, BANNER + start_lines(site, daemon.pid), "")
    assert results.count(served) == 1, results
    assert results.count(locked_out) + results.count(refused) == count - 1, results
    for line in lost:
        site.expect("status", re.escape(line), times=results.count(locked_out))


def open_end(descriptor):
    """The other end of a pipe: None while it is silent and open, else what can be read; b"" is its end."""
    ready, _, _ = select.select([descriptor], [], [], 0)
    return os.read(descriptor, 100) if ready else None


def test_what_the_caller_left_open_is_closed_in_the_daemon(site):
    """A caller that waits for the end of a pipe is not held up for the life of the server."""
    near, far = os.pipe()
    high = fcntl.fcntl(far, fcntl.F_DUPFD, 300)
    with open(site.scratch / "left-open", "w") as file:
        _, _, daemon = site.start_daemon(pass_fds=(far, high, file.fileno()))
        left = str(site.scratch / "left-open")
    os.close(far)
    os.close(high)
    assert open_end(near) == b""
    os.close(near)
    assert daemon.alive()
    assert left not in descriptors(daemon.pid).values()
    assert site.get("/hello.htm").status == 200


def test_start_with_closed_standard_streams(site):
    """Neither the pid file with its lock nor a socket may land on the three descriptors that are replaced."""
    process = site.spawn("-start", redirect="<&- >&- 2>&-")
    assert process.wait(timeout=60 * SLOWDOWN) == 0
    daemon = Daemon(site, wait_until(site.read_pid, "the pid"))
    site.servers.append(daemon)
    assert site.get("/hello.htm").status == 200
    files = descriptors(daemon.pid)
    assert files[0] == files[1] == "/dev/null"
    assert files[2] == str(site.status_log)
    with open(site.pid_file, "r+") as file:
        file.write(f"{DEAD_PID}\n")
    code, out = site.run("-start")
    assert code == 0, "the parent does not learn what became of its child"
    assert "Error: Orvex Reporting UI is already running: " in out
    assert f"Error: Unable to create lock file, {site.pid_file}.\n" in out
    assert site.pid_file.exists()
    assert site.get("/hello.htm").status == 200
    site.expect("status", r"Error: Orvex Reporting UI is already running: .+", times=1)
    site.expect("status", rf"Error: Unable to create lock file, {re.escape(str(site.pid_file))}\.", times=1)


def test_a_start_that_fails_in_the_background(site):
    with socket.socket() as holder:
        port = free_port()
        holder.bind(("127.0.0.1", port))
        holder.listen()
        site.configure(web={"WebPort": port})
        code, out = site.run("-start")
    failed = [
        "Error: The remote interface server failed to initialize.",
        'Refer to "ox_remote.err" for more information.',
    ]
    assert (code, out) == (0, BANNER + "".join(f"{line}\n" for line in failed))
    assert site.leftover_processes() == []
    assert not site.pid_file.exists()
    for line in failed:
        site.expect("status", re.escape(line), times=1)
    site.expect("err", r"Socket bind failed: Address already in use \(98\)", times=1)
    site.expect("err", re.escape(port_in_use_line(port)), times=1)


@pytest.mark.skipif(SANITIZER != "", reason="a sanitizer needs a thread of its own")
def test_a_system_that_gives_no_process_fails_the_start_without_a_word(site):
    """And at once; the next switch is carried out."""
    site.use_ordinary_user()
    limits = {"preexec_fn": lambda: resource.setrlimit(resource.RLIMIT_NPROC, (1, 1))}
    assert site.run("-start", **limits) == (1, BANNER)
    assert site.run("-start", "-stop", **limits) == (1, BANNER + not_running(2))
    assert site.leftover_processes() == []
    assert site.status() == [] and site.err() == []
    assert not site.pid_file.exists()


def test_signals_reach_the_daemon(site):
    site.configure(audit={"debuglevel": 10})
    _, _, daemon = site.start_daemon()
    daemon.signal(16)
    wait_until(lambda: sum(line.startswith("Starting server") for line in site.err()) == 2, "the reset")
    wait_until(lambda: is_listening(site.port), "the port")
    assert site.get("/hello.htm").status == 200
    for number in (1, 10, 34):
        daemon.signal(number)
        wait_until(lambda: any(f"Signal received: {number} - " in line for line in site.status()), "the signal's line")
    daemon.signal(signal.SIGINT)
    daemon.wait_exit()
    assert site.status()[-1] == f"Process {daemon.pid} cancelled - cleaning up..."
    assert not site.pid_file.exists()


def test_the_terminal_of_the_command_is_given_up(site):
    """The daemon outlives the end of the session that started it."""
    leader = subprocess.Popen(
        ["/bin/sh", "-c", '"$0" -start >/dev/null; echo $?', str(site.exe)],
        cwd=site.root, env=site.environment(), stdout=subprocess.PIPE, stderr=subprocess.DEVNULL,
        stdin=subprocess.DEVNULL, start_new_session=True, umask=0o022,
        **({"user": site.user, "group": site.user, "extra_groups": []} if site.user is not None else {}),
    )
    out, _ = leader.communicate(timeout=60 * SLOWDOWN)
    assert out == b"0\n"
    daemon = Daemon(site, wait_until(site.read_pid, "the pid"))
    site.servers.append(daemon)
    assert os.getsid(daemon.pid) != leader.pid
    assert site.get("/hello.htm").status == 200


def test_a_reader_that_leaves_after_the_banner_does_not_end_the_daemon(site):
    """The daemon's lines then go to a pipe that nobody reads."""
    user = {"user": site.user, "group": site.user, "extra_groups": []} if site.user is not None else {}
    subprocess.run(
        ["/bin/sh", "-c", '"$0" -start | head -n 2 >/dev/null', str(site.exe)],
        cwd=site.root, env=site.environment(), stdin=subprocess.DEVNULL, stderr=subprocess.DEVNULL,
        start_new_session=True, umask=0o022, timeout=60 * SLOWDOWN, check=True, **user,
    )
    daemon = Daemon(site, wait_until(site.read_pid, "the pid"))
    site.servers.append(daemon)
    assert site.get("/hello.htm").status == 200
    assert daemon.alive()
