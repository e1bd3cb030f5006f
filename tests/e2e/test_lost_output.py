"""Output that nobody takes: a screen that goes away, files that may not grow. The server goes on and can be stopped."""

import contextlib
import os
import resource
import signal

import pytest

from harness import BANNER, DEBUG_NOTICE, SLOWDOWN, cpu_seconds, stays_true, wait_until

REAL_TIME = 34
IDLE_SECONDS = 1.5
FILE_LIMIT = 3000


def signal_lines(site, number):
    return [line for line in site.status() if line.startswith(f"Signal received: {number} - ")]


def check_idle(site, server):
    """No processor time and no growing log while nothing happens."""
    sizes = [path.stat().st_size for path in (site.status_log, site.error_log)]
    used = cpu_seconds(server.pid)
    stays_true(server.alive, IDLE_SECONDS, "the server lives")
    assert cpu_seconds(server.pid) - used < 0.2 * SLOWDOWN
    assert [path.stat().st_size for path in (site.status_log, site.error_log)] == sizes


def check_stop(site, server):
    server.signal(signal.SIGTERM)
    server.wait_exit()
    assert not site.pid_file.exists()


@pytest.fixture
def screen():
    """A pipe; the test reads the one end, the server's standard output is the other."""
    near, far = os.pipe()
    with contextlib.ExitStack() as ends:
        ends.callback(os.close, near)
        yield near, far, ends


def serve_on(site, screen):
    near, far, ends = screen
    server = site.serve(preexec_fn=lambda: os.dup2(far, 1))
    os.close(far)
    text = b""
    while f"started ({server.pid}).".encode() not in text:
        text += os.read(near, 4096)
    assert text.decode().startswith(BANNER + DEBUG_NOTICE)
    return server, ends.close


def test_a_screen_that_goes_away_costs_nothing(site, screen):
    site.configure(audit={"debuglevel": 10})
    server, leave = serve_on(site, screen)
    leave()
    for number, text in ((10, "User defined signal 1"), (REAL_TIME, "Real-time signal 0"), (12, "User defined signal 2")):
        server.signal(number)
        wait_until(lambda: signal_lines(site, number), f"the line of signal {number}")
        assert signal_lines(site, number) == [f"Signal received: {number} - {text}"]
    check_idle(site, server)
    assert not signal_lines(site, signal.SIGPIPE), "the server's own notice is no command"
    server.signal(signal.SIGPIPE)
    wait_until(lambda: signal_lines(site, signal.SIGPIPE), "the signal of somebody else is")
    assert site.get("/hello.htm").status == 200
    code, out = site.run("-stop")
    assert code == 0 and out.endswith("The server has been stopped.\n")
    assert server.wait_exit() == 0
    assert site.status()[-1] == f"Process {server.pid} termination requested. Cleaning up..."
    assert not site.pid_file.exists()


def test_a_screen_that_goes_away_is_no_hindrance_to_resets_and_reports(site, screen):
    server, leave = serve_on(site, screen)
    leave()
    for number in (1, 2, 3):
        server.signal(16)
        wait_until(lambda: len(site.err()) == number + 1, "the next start")
        server.signal(31)
        wait_until(lambda: sum("is active on port" in line for line in site.status()) == number, "the report")
        assert site.get("/hello.htm").status == 200
    check_idle(site, server)
    check_stop(site, server)


def limit_files():
    resource.setrlimit(resource.RLIMIT_FSIZE, (FILE_LIMIT, FILE_LIMIT))


def check_full_logs(site, server):
    """Fills the status log up to the limit and looks at what the server does then."""
    sent = 0
    while site.status_log.stat().st_size < FILE_LIMIT:
        server.signal(REAL_TIME)
        sent += 1
        assert sent < FILE_LIMIT, "every signal writes a line"
        stays_true(server.alive, 0.01 * SLOWDOWN, "the server lives")
    for _ in range(20):
        server.signal(REAL_TIME)
    check_idle(site, server)
    assert site.status_log.stat().st_size == FILE_LIMIT
    assert sent >= len(signal_lines(site, REAL_TIME)) > 3
    assert not signal_lines(site, signal.SIGXFSZ)
    while site.access_log.stat().st_size < FILE_LIMIT:
        assert site.get("/hello.htm").status == 200
    for _ in range(3):
        assert site.get("/hello.htm").status == 200
    assert site.access_log.stat().st_size == FILE_LIMIT
    check_idle(site, server)


def forget_cut_lines(site):
    """The limit has cut the last line of each full log."""
    for path in (site.status_log, site.access_log, site.error_log):
        assert path.stat().st_size == FILE_LIMIT
        path.write_bytes(path.read_bytes().rpartition(b"\n")[0] + b"\n")


def test_logs_that_may_not_grow_cost_nothing_in_the_foreground(site):
    site.configure(audit={"debuglevel": 10})
    server = site.serve(preexec_fn=limit_files)
    check_full_logs(site, server)
    check_stop(site, server)
    assert server.out_file.stat().st_size <= FILE_LIMIT
    forget_cut_lines(site)


@pytest.mark.daemon
def test_logs_that_may_not_grow_cost_nothing_in_the_background(site):
    site.configure(audit={"debuglevel": 10})
    code, _, daemon = site.start_daemon(preexec_fn=limit_files)
    assert code == 0
    check_full_logs(site, daemon)
    code, out = site.run("-stop")
    assert code == 0 and out.endswith("The server has been stopped.\n")
    daemon.wait_exit()
    assert not site.pid_file.exists()
    forget_cut_lines(site)
