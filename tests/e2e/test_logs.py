"""The access log and the message log: formats, switches, levels."""

import re
import time

import pytest

from harness import (
    BANNER,
    DEBUG_NOTICE,
    IS_ROOT,
    STAMP,
    ACCESS_LINE,
    Background,
    basic,
    request_text,
    shown_host_name,
    wait_until,
)

MONTHS = ["Jan", "Feb", "Mar", "Apr", "May", "Jun", "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"]
EQUAL_SOFT_LIMIT = "ulimit -S -n $(ulimit -H -n)"


@pytest.mark.parametrize(
    "zone,west,shown",
    [
        ("UTC", 0, "-0000"),
        ("EST5", 18000, "-0500"),
        ("XXX3:30", 12600, "-031800"),
        ("XXX-1", -3600, "+11930451696"),
        ("XXX-5:30", -19800, "+11930403496"),
        ("XXX11", 39600, "-1100"),
    ],
)
def test_the_access_line_in_each_zone(site, zone, west, shown):
    server = site.serve(env={"TZ": zone})
    size = (site.web / "hello.htm").stat().st_size
    before = int(time.time()) - 1
    site.get("/hello.htm?query=never&logged=1", "User-Agent: x")
    after = int(time.time())
    possible = []
    for moment in range(before, after + 1):
        t = time.gmtime(moment - west)
        possible.append(
            f"127.0.0.1 - - [{t.tm_mday}/{MONTHS[t.tm_mon - 1]}/{t.tm_year}:"
            f"{t.tm_hour}:{t.tm_min:02}:{t.tm_sec:02} {shown}] "
            f'"GET /hello.htm HTTP/1.0" 200 {size}'
        )
    (line,) = site.access()
    assert line in possible
    server.stop()
    stamp = site.error_log.read_text().split(": ")[0]
    local = [time.strftime("%b-%d-%Y %H:%M:%S", time.gmtime(moment - west)) for moment in range(before - 60, after + 1)]
    assert stamp in local


def test_the_byte_count_is_that_of_the_file_and_0_for_other_answers(site, server):
    site.page("a.gif", b"x" * 54321, 1700000000)
    site.page("empty", b"")
    site.get("/a.gif")
    site.get("/empty")
    site.get("/absent")
    site.get("/a.gif", "If-Modified-Since: Tue, 14 Nov 2023 22:13:20 GMT")
    site.raw(b"garbage\r\n\r\n")
    assert [line.rpartition('" ')[2] for line in site.access()] == ["200 54321", "200 0", "404 0", "304 0", "400 0"]


def test_the_peer_address_is_in_the_access_line(site, server):
    for source in ("127.0.0.1", "127.0.0.2", "127.1.2.3"):
        site.get("/hello.htm", source=source)
    assert [ACCESS_LINE.fullmatch(line)["peer"] for line in site.access()] == ["127.0.0.1", "127.0.0.2", "127.1.2.3"]


def test_the_access_log_is_appended_to(site):
    for count in (1, 2, 3):
        server = site.serve()
        site.get("/hello.htm")
        server.stop()
        assert len(site.access()) == count
        assert len(site.err()) == count


@pytest.mark.parametrize("value", ["0", "no", "off", "false"])
def test_without_access_logging_no_file_is_made(site, value):
    site.configure(web={"WebLogging": value}, audit={"debuglevel": 9})
    server = site.serve()
    assert site.get("/hello.htm").status == 200
    server.wait_idle()
    server.stop()
    assert not site.access_log.exists()
    assert not any("Logging server activity" in line or "Server log closed" in line for line in site.err())


@pytest.mark.parametrize("value", ["1", "yes", "TRUE", "on", "2"])
def test_the_ways_to_switch_access_logging_on(site, value):
    site.configure(web={"WebLogging": value})
    site.serve()
    site.get("/hello.htm")
    assert len(site.access()) == 1


def test_without_error_logging_no_file_is_made(site):
    site.configure(web={"WebLogErrors": 0})
    (site.web / "dir").mkdir()
    server = site.serve()
    assert site.raw(request_text("/dir")) == b""
    server.stop()
    assert not site.error_log.exists()


def test_logs_under_other_names(site):
    site.configure(web={"WebLogFileName": "visits", "WebErrorLog": "faults.err"})
    site.serve()
    site.get("/hello.htm")
    assert len((site.root / "visits").read_text().splitlines()) == 1
    assert len((site.root / "faults.err").read_text().splitlines()) == 1
    assert not (site.root / "ox_remote.log").exists() and not (site.root / "ox_remote.err").exists()


def test_the_log_files_are_not_served(site):
    site.add_user("alice")
    site.serve()
    site.get("/hello.htm")
    for name in ("ox_remote.log", "ox_remote.err", "ox_remote.ini", "ox_remote.pid", "oxm_oxx/oxm_oxx.ini"):
        assert site.get("/" + name, basic("alice", "secret")).status == 404


def masked(lines):
    return [re.sub(r"0x[0-9A-F]+", "0x?", line) for line in lines]


def test_the_whole_message_log_of_one_request_at_level_9(site):
    site.configure(audit={"debuglevel": 9})
    server = site.serve()
    wait_until(lambda: site.err()[-1] == "HttpDaemon thread: accepting connection:", "the listener waits")
    site.get("/hello.htm")
    server.wait_idle()
    wait_until(lambda: len(site.err()) == 12, "the listener waits again")
    server.stop()
    assert masked(site.err()) == [
        "Debug level is now 9.",
        *site.setup_lines(),
        f"Logging server activity to {site.root}/ox_remote.log.",
        f"Starting server: connecting to 127.0.0.1 on port {site.port}.",
        "Daemon thread started. Thread id = 0x?",
        "HttpDaemon thread: waiting on 128 connections.",
        "HttpDaemon thread: accepting connection:",
        "HttpDaemon thread: connected to 127.0.0.1.",
        "Adding user session 0x?.",
        "HttpDaemon thread: accepting connection:",
        "Server stopping...",
        "Daemon thread exiting normally.",
        "session thread 0x? exiting.",
        "Removing user session 0x?.",
        "Server log closed.",
    ]
    text = "\n".join(site.err())
    listener = re.search(r"Thread id = 0x([0-9A-F]+)", text)[1]
    assert re.search(r"Adding user session 0x([0-9A-F]+)", text)[1] == listener
    assert re.search(r"session thread 0x([0-9A-F]+) exiting", text)[1] == listener
    assert re.search(r"Removing user session 0x([0-9A-F]+)", text)[1] == f"{server.pid:X}"


def test_a_finished_session_is_removed_by_the_next_connection(site):
    site.configure(audit={"debuglevel": 5})
    server = site.serve()
    for number in range(1, 6):
        site.get("/hello.htm")
        server.wait_idle()
        wait_until(lambda: sum("Adding" in line for line in site.err()) == number, "the session is listed")
        assert sum("Removing" in line for line in site.err()) == number - 1
    listener = re.search(r"Thread id = (0x[0-9A-F]+)", "\n".join(site.err()))[1]
    assert all(listener in line for line in site.err() if "user session" in line)


LEVELS = {
    1: ["Starting server"],
    3: ["Starting server", "Logging server activity", "Server stopping", "Server log closed"],
    5: ["Starting server", "Logging server activity", "Server stopping", "Daemon thread started", "Adding user"],
    7: ["Starting server", "Server stopping", "Daemon thread started", "HttpDaemon thread: connected"],
    9: ["Debug level is now 9.", "Starting server", "HttpDaemon thread: connected"],
}
LEVELS |= {level + 1: LEVELS[level] for level in (1, 3, 5, 7)}


@pytest.mark.parametrize("level", sorted(LEVELS))
def test_each_level_has_its_lines_in_the_message_log(site, level):
    """That no line of a higher level is there is part of the check behind every test."""
    site.configure(audit={"debuglevel": level})
    server = site.serve()
    assert site.get("/hello.htm").status == 200
    server.wait_idle()
    server.stop()
    for text in LEVELS[level]:
        assert sum(line.startswith(text) for line in site.err()) == 1, text
    if level == 1:
        assert len(site.err()) == 1


def test_level_0_silences_all_but_the_access_log(site):
    site.configure(audit={"debuglevel": 0})
    (site.web / "dir").mkdir()
    server = site.serve()
    assert site.get("/hello.htm").status == 200
    assert site.raw(request_text("/dir")) == b""
    site.run("-status")
    server.stop()
    assert len(site.access()) == 2
    assert site.error_log.read_bytes() == b""
    assert site.status_log.read_bytes() == b""
    assert site.startup_log.read_bytes() == b""
    assert server.stdout() == BANNER + DEBUG_NOTICE


def test_the_screen_and_the_status_log_at_level_10(site):
    site.configure(audit={"debuglevel": 10})
    server = site.serve(shell=EQUAL_SOFT_LIMIT)
    server.stop()
    host = shown_host_name()
    lines = [
        f"Changing dir to {site.root};",
        *(["gid=0 egid=0", "uid=0 euid=0"] if IS_ROOT else []),
        f"Remote interface server available on http://{host}:{site.port}.",
        f"The remote configuration server has been started ({server.pid}).",
        "Signal received: 15 - Terminated",
        f"Process {server.pid} termination requested. Cleaning up...",
    ]
    assert site.status() == ["Debug level is now 10.", *lines]
    assert server.stdout() == BANNER + DEBUG_NOTICE + "".join(f"{line}\n" for line in lines)
    for line in site.status_log.read_text().splitlines():
        assert STAMP.match(line)


def test_the_screen_at_the_usual_level(site, server):
    server.stop()
    host = shown_host_name()
    assert server.stdout() == (
        BANNER + DEBUG_NOTICE + f"Remote interface server available on http://{host}:{site.port}.\n"
        f"The remote configuration server has been started ({server.pid}).\n"
        f"Process {server.pid} termination requested. Cleaning up...\n"
    )
    assert not site.startup_log.exists()


def test_the_status_log_is_appended_to_across_runs(site):
    for count in (1, 2, 3):
        site.serve().stop()
        assert sum("has been started" in line for line in site.status()) == count


@pytest.mark.parametrize("level,shown", [(1, False), (3, False), (5, True)])
def test_an_access_log_that_cannot_be_opened_does_not_stop_the_server(site, level, shown):
    site.configure(audit={"debuglevel": level})
    site.access_log.mkdir()
    site.serve()
    assert site.get("/hello.htm").status == 200
    line = f"Log file open failed: {site.root}/ox_remote.log."
    assert (line in site.err()) == shown
    site.allow("err", re.escape(line))
    site.expect("status", "oxAuditFile error: Is a directory", times=1)
    site.access = lambda path=None: []


def test_a_message_log_that_cannot_be_opened_does_not_stop_the_server(site):
    site.error_log.mkdir()
    site.serve()
    assert site.get("/hello.htm").status == 200
    assert len(site.access()) == 1
    site.expect("status", "oxAuditFile error: Is a directory", times=1)


def test_a_log_under_load_holds_whole_lines(site):
    site.configure(audit={"debuglevel": 9})
    site.serve()
    Background(lambda number: [site.get(f"/hello.htm?{number}") for _ in range(50)], 8).join()
    assert len(site.access()) == 400
    wait_until(lambda: sum("Adding user session" in line for line in site.err()) == 400, "all session lines")
