"""The signals that control a running server, and those that do not."""

import os
import re
import signal
import socket

import pytest

from harness import (
    Client,
    SANITIZER,
    SLOWDOWN,
    free_port,
    is_alive,
    is_listening,
    port_in_use_line,
    request_text,
    signals_in_mask,
    spoil_settings,
    stays_true,
    wait_until,
)

RESET = 16
CHILD_END = 17
STATUS = 31


def reports(site):
    return [line for line in site.status() if "oxSIGSTATUS" in line]


def ask_status(site, server):
    before = len(reports(site))
    server.signal(STATUS)
    wait_until(lambda: len(reports(site)) > before, "the status header")

    def answer():
        lines = site.status()
        last = max(n for n, line in enumerate(lines) if "oxSIGSTATUS" in line)
        return lines[last + 1 : last + 2]

    return wait_until(answer, "the line behind the status header")[0]


def resets(site):
    return len([line for line in site.err() if line.startswith("Starting server: ")])


@pytest.mark.parametrize(
    "number,line",
    [
        (signal.SIGINT, "Process {} cancelled - cleaning up..."),
        (signal.SIGABRT, "Process {} cancelled - cleaning up..."),
        (signal.SIGTERM, "Process {} termination requested. Cleaning up..."),
    ],
)
def test_a_stopping_signal_ends_the_server_with_its_line(site, server, number, line):
    server.signal(number)
    assert server.wait_exit() == 0
    assert site.status()[-1] == line.format(server.pid)
    assert not site.pid_file.exists()
    assert not is_listening(site.port)


def test_signal_17_sent_by_a_process_ends_the_server_without_a_word(site, server):
    before = site.status()
    server.signal(CHILD_END)
    assert server.wait_exit() == 0
    assert site.status() == before
    assert not site.pid_file.exists()


def test_the_status_report_names_the_port(site, server):
    assert ask_status(site, server) == f"Remote interface server is active on port {site.port}."
    assert reports(site) == [f"Process {server.pid}: oxSIGSTATUS received - current server status:"]


def test_a_reset_starts_the_server_again(site, server):
    server.signal(RESET)
    wait_until(lambda: resets(site) == 2 and is_listening(site.port), "the second start")
    assert site.get("/hello.htm").status == 200
    assert ask_status(site, server) == f"Remote interface server is active on port {site.port}."
    assert f"Process {server.pid}: oxSIGRESET received - resetting the server:" in site.status()
    assert server.alive()


@pytest.mark.parametrize("number", [1, 3, 4, 5, 7, 8, 10, 11, 12, 13, 14, 18, 20, 23, 28, 29, 30, 32, 33, 34, 50, 64])
def test_other_signals_change_nothing(site, server, number):
    before = site.status()
    server.signal(number)
    assert ask_status(site, server) == f"Remote interface server is active on port {site.port}."
    assert site.status()[: len(before)] == before
    assert len(site.status()) == len(before) + 2
    assert site.get("/hello.htm").status == 200


@pytest.mark.parametrize(
    "number,text",
    [
        (1, "Hangup"),
        (10, "User defined signal 1"),
        (16, "Stack fault"),
        (31, "Bad system call"),
        (34, "Real-time signal 0"),
        (64, "Real-time signal 30"),
        (17, "Child exited"),
        (2, "Interrupt"),
        (6, "Aborted"),
        (15, "Terminated"),
    ],
)
def test_each_signal_is_named_at_level_10(site, number, text):
    site.configure(audit={"debuglevel": 10})
    server = site.serve()
    server.signal(number)
    line = f"Signal received: {number} - {text}"
    wait_until(lambda: line in site.status(), line)
    if number in (2, 6, 15, 17):
        assert server.wait_exit() == 0
    assert site.status().count(line) == 1


def test_signals_are_not_named_at_level_9(site):
    site.configure(audit={"debuglevel": 9})
    server = site.serve()
    server.signal(1)
    ask_status(site, server)
    assert not any("Signal received" in line for line in site.status())


def test_all_signals_are_blocked_in_every_thread(site, server):
    with Client(site.port) as client:
        client.send(b"GET ")
        wait_until(lambda: len(os.listdir(f"/proc/{server.pid}/task")) > 2, "a session's thread")
        for task in set(os.listdir(f"/proc/{server.pid}/task")) - {str(server.pid)}:
            # The main thread waits for signals, and the kernel shows those it waits for as not blocked.
            text = open(f"/proc/{server.pid}/task/{task}/status").read()
            mask = signals_in_mask(re.search(r"^SigBlk:\s*(\w+)", text, re.M)[1])
            missing = set(range(1, 65)) - mask - {signal.SIGKILL, signal.SIGSTOP, 32, 33}
            if SANITIZER == "thread" and len(missing) > 1:
                continue  # the sanitizer's own thread
            assert not missing, f"thread {task} does not block {missing}"
        client.send(b"/hello.htm HTTP/1.0\r\n\r\n")
        assert client.read_all().startswith(b"HTTP/1.0 200")


def test_a_status_request_as_soon_as_the_pid_file_appears_does_no_harm(site):
    for number in range(1, 51):
        server = site.serve(ready=False)
        wait_until(lambda: site.pid_file.exists() or not server.alive(), "the pid file")
        server.signal(STATUS)
        server.wait_ready()
        wait_until(lambda: len(reports(site)) == number, "the report")
        server.stop()
    assert site.status().count(f"Remote interface server is active on port {site.port}.") == 50


def test_a_stop_as_soon_as_the_pid_file_appears_ends_the_server_in_order(site):
    for _ in range(20):
        server = site.serve(ready=False)
        wait_until(lambda: site.pid_file.exists() or not server.alive(), "the pid file")
        server.signal(signal.SIGTERM)
        assert server.wait_exit() == 0
        assert site.status()[-1] == f"Process {server.pid} termination requested. Cleaning up..."
        assert not site.pid_file.exists()


@pytest.mark.parametrize("pause", [0, 0.001, 0.01, 0.05])
def test_more_stop_signals_during_the_end_do_no_harm(site, server, pause):
    for _ in range(20):
        server.signal(signal.SIGTERM)
        server.signal(signal.SIGINT)
        server.signal(STATUS)
        if pause:
            stays_true(lambda: True, pause, "")
    assert server.wait_exit() == 0
    assert not site.pid_file.exists()


def test_a_reset_takes_changed_settings(site, server):
    old_port = site.port
    site.get("/hello.htm")
    new_port = free_port()
    site.configure(web={"WebPort": new_port, "WebLogFileName": "second.log", "WebErrorLog": "second.err"})
    server.signal(RESET)
    wait_until(lambda: is_listening(new_port), "the new port")
    wait_until(lambda: not is_listening(old_port), "the old port is closed")
    site.port = new_port
    assert site.get("/default.htm").status == 200
    assert ask_status(site, server) == f"Remote interface server is active on port {new_port}."
    assert [line.split('"')[1] for line in site.access(site.root / "ox_remote.log")] == ["GET /hello.htm HTTP/1.0"]
    assert [line.split('"')[1] for line in site.access()] == ["GET /default.htm HTTP/1.0"]
    assert site.err() == [f"Starting server: connecting to 127.0.0.1 on port {new_port}."]


def test_a_reset_can_close_both_logs(site, server):
    (site.web / "dir").mkdir()
    before = site.err()
    port = free_port()
    site.configure(web={"WebPort": port, "WebLogging": 0, "WebLogErrors": 0})
    server.signal(RESET)
    wait_until(lambda: is_listening(port), "the new port")
    site.port = port
    assert site.raw(request_text("/dir")) == b""
    assert site.get("/hello.htm").status == 200
    server.stop()
    assert site.err() == before
    assert site.access() == []


def test_a_reset_can_open_both_logs(site):
    site.configure(web={"WebLogging": 0, "WebLogErrors": 0})
    server = site.serve()
    site.get("/hello.htm")
    assert not site.error_log.exists() and not site.access_log.exists()
    site.configure(web={"WebLogging": 1, "WebLogErrors": 1})
    server.signal(RESET)
    wait_until(lambda: resets(site) == 1 and is_listening(site.port), "the second start")
    site.get("/default.htm")
    assert [line.split('"')[1] for line in site.access()] == ["GET /default.htm HTTP/1.0"]


def test_the_lines_of_a_reset(site):
    """The second start names the log by the relative path: the server already is in its directory."""
    site.configure(audit={"debuglevel": 3})
    server = site.serve()
    assert site.err() == [
        *site.setup_lines(),
        f"Logging server activity to {site.root}/ox_remote.log.",
        f"Starting server: connecting to 127.0.0.1 on port {site.port}.",
    ]
    server.signal(RESET)
    wait_until(lambda: resets(site) == 2 and is_listening(site.port), "the second start")
    assert site.err()[5:] == [
        "Server stopping...",
        "Server log closed.",
        *site.setup_lines(),
        "Logging server activity to ./ox_remote.log.",
        f"Starting server: connecting to 127.0.0.1 on port {site.port}.",
    ]
    assert site.get("/hello.htm").status == 200
    assert len(site.access()) == 1


def occupied_port():
    port = free_port()
    holder = socket.socket()
    holder.bind(("127.0.0.1", port))
    holder.listen()
    return holder, port


def test_a_reset_that_fails_leaves_the_server_stopped_and_waiting(site, server):
    old_port = site.port
    holder, port = occupied_port()
    site.configure(web={"WebPort": port})
    server.signal(RESET)
    wait_until(lambda: site.err()[-1].endswith(f"({port}) is already in use."), "the failed start")
    assert ask_status(site, server) == "Remote interface server is stopped."
    assert not is_listening(old_port)
    assert server.alive()
    holder.close()
    server.signal(RESET)
    wait_until(lambda: is_listening(port), "the third start")
    site.port = port
    assert site.get("/hello.htm").status == 200
    assert ask_status(site, server) == f"Remote interface server is active on port {port}."
    site.expect("err", r"Socket bind failed: Address already in use \(98\)", times=1)
    site.expect("err", re.escape(port_in_use_line(port)), times=1)
    site.expect("status", r"Remote interface server is stopped\.", times=1)


def test_a_server_stopped_by_a_failed_reset_can_be_stopped(site, server):
    holder, port = occupied_port()
    site.configure(web={"WebPort": port})
    server.signal(RESET)
    wait_until(lambda: site.err()[-1].endswith(f"({port}) is already in use."), "the failed start")
    code, out = site.run("-stop")
    assert code == 0 and out.endswith("The server has been stopped.\n")
    assert server.wait_exit() == 0
    holder.close()
    site.expect("err", r"Socket bind failed: Address already in use \(98\)", times=1)
    site.expect("err", re.escape(port_in_use_line(port)), times=1)


@pytest.mark.parametrize("kind", ["missing", "directory", "nul", "pipe", "device"])
def test_a_reset_without_settings_that_load_leaves_the_server_stopped(site, server, kind):
    """It waits for the next reset, answers status requests and can be ended."""

    def spoil(times):
        reason = spoil_settings(site.ini, kind)
        line = f"Error: can't read ./ox_remote.ini: {reason}"
        server.signal(RESET)
        wait_until(lambda: site.status().count(line) == times, "the line of the failed reset", timeout=5 * SLOWDOWN)
        assert not is_listening(site.port)
        assert ask_status(site, server) == "Remote interface server is stopped."
        if kind == "directory":
            site.ini.rmdir()
        return line

    spoil(times=1)
    site.configure()
    server.signal(RESET)
    wait_until(lambda: is_listening(site.port), "the next good start")
    assert site.get("/hello.htm").status == 200
    assert ask_status(site, server) == f"Remote interface server is active on port {site.port}."

    line = spoil(times=2)
    server.signal(signal.SIGTERM)
    assert server.wait_exit() == 0
    assert not site.pid_file.exists()
    site.expect("status", re.escape(line), times=2)
    site.expect("status", r"Remote interface server is stopped\.", times=2)


def test_connections_that_were_accepted_live_through_resets(site):
    site.configure(audit={"debuglevel": 7})
    server = site.serve()
    clients = [Client(site.port) for _ in range(20)]
    for client in clients:
        client.send(b"GET /hello.htm HT")
    wait_until(
        lambda: sum(line.startswith("HttpDaemon thread: connected") for line in site.err()) == 20,
        "all connections are accepted",
    )
    for number in (2, 3, 4):
        server.signal(RESET)
        wait_until(lambda: resets(site) == number and is_listening(site.port), "the next start")
    content = (site.web / "hello.htm").read_bytes()
    for client in clients:
        client.send(b"TP/1.0\r\n\r\n")
        assert client.read_all().endswith(b"\r\n\r\n" + content)
        client.close()
    assert site.get("/default.htm").status == 200


def test_a_download_lives_through_a_reset(site, server):
    content = os.urandom(1 << 16) * 320
    site.page("large.bin", content)
    with Client(site.port, receive_buffer=8192) as client:
        client.send(request_text("/large.bin"))
        head = client.receive_exactly(100)
        server.signal(RESET)
        wait_until(lambda: resets(site) == 2 and is_listening(site.port), "the second start")
        assert site.get("/hello.htm").status == 200
        rest = client.read_all()
    assert (head + rest).endswith(b"\r\n\r\n" + content)


def test_the_loop_goes_on_when_no_signal_comes(site, server):
    before = site.status()
    stays_true(lambda: is_alive(server.pid), 11, "the server lives")
    assert site.status() == before
    assert ask_status(site, server) == f"Remote interface server is active on port {site.port}."
