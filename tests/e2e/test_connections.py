"""Many clients at once, the limit per address, and what is left after them."""

import hashlib
import os
import random
import re
import resource
import time
from pathlib import Path

import pytest

from harness import (
    DEADLINE,
    REPLY_413,
    SANITIZER,
    SLOWDOWN,
    Background,
    Client,
    ResetLoad,
    cpu_seconds,
    descriptors,
    has_symbol,
    request_text,
    resident_kib,
    thread_count,
    wait_until,
)

REFUSED = "HttpServer: connection refused from address: {}. Too many active connections from this address"


def connected(site):
    return sum(line.startswith("HttpDaemon thread: connected to") for line in site.err())


def refused(site):
    return sum("connection refused from address" in line for line in site.err())


def hold(site, count, source=None):
    """Opens connections that the server has accepted, one after the other."""
    clients = []
    for _ in range(count):
        before = connected(site)
        clients.append(Client(site.port, source=source))
        wait_until(lambda: connected(site) == before + 1, "the connection is accepted")
    return clients


@pytest.mark.parametrize("limit", [1, 2, 5])
def test_the_connection_beyond_the_limit_is_closed_without_an_answer(site, limit):
    site.configure(web={"WebMaxConnectionsPerAddress": limit}, audit={"debuglevel": 7})
    site.serve()
    held = hold(site, limit)
    for number in range(1, 4):
        with Client(site.port) as client:
            assert client.read_all() == b""
        assert refused(site) == number
    assert REFUSED.format("127.0.0.1") in site.err()
    site.expect("err", re.escape(REFUSED.format("127.0.0.1")), times=3)
    assert site.get("/hello.htm", source="127.0.0.2").status == 200
    held[0].send(request_text("/hello.htm"))
    assert held[0].read_all().startswith(b"HTTP/1.0 200 OK")
    with Client(site.port) as client:
        client.send(request_text("/hello.htm"))
        assert client.read_all().startswith(b"HTTP/1.0 200 OK")
    for client in held:
        client.close()


def test_each_address_has_its_own_count(site):
    site.configure(web={"WebMaxConnectionsPerAddress": 1}, audit={"debuglevel": 7})
    site.serve()
    held = [hold(site, 1, source=f"127.0.0.{n}")[0] for n in range(1, 11)]
    with Client(site.port, source="127.0.0.7") as client:
        assert client.read_all() == b""
    site.expect("err", re.escape(REFUSED.format("127.0.0.7")), times=1)
    for client in held:
        client.send(request_text("/hello.htm"))
        assert client.read_all().startswith(b"HTTP/1.0 200 OK")
        client.close()


@pytest.mark.parametrize("limit", [0, -1])
def test_without_a_limit_all_are_admitted(site, limit):
    site.configure(web={"WebMaxConnectionsPerAddress": limit}, audit={"debuglevel": 7})
    site.serve()
    held = hold(site, 300)
    assert site.get("/hello.htm").status == 200
    for client in held:
        client.close()


def test_the_limit_is_256_when_none_is_set(site):
    site.configure(audit={"debuglevel": 7})
    site.serve()
    held = hold(site, 256)
    with Client(site.port) as client:
        assert client.read_all() == b""
    site.expect("err", re.escape(REFUSED.format("127.0.0.1")), times=1)
    for client in held:
        client.close()


def test_with_a_limit_of_1_a_quick_client_is_never_refused(site):
    site.configure(web={"WebMaxConnectionsPerAddress": 1})
    site.serve()
    count = 500 if SANITIZER != "thread" else 150
    for _ in range(count):
        assert site.get("/hello.htm").status == 200
    assert len(site.access()) == count


def test_clients_at_once_get_their_own_file_and_no_foreign_byte(site, server):
    files = {}
    for number in range(16):
        marker = f"<file {number:02} of sixteen>".encode()
        files[f"/f{number}.txt"] = marker * random.randrange(1, 8000)
    for name, content in files.items():
        site.page(name[1:], content)

    def client(number):
        order = random.Random(number)
        for _ in range(30):
            name = order.choice(sorted(files))
            assert site.get(name).body == files[name]

    Background(client, 16).join()
    assert len(site.access()) == 16 * 30


def test_fast_and_broken_clients_side_by_side(site, server):
    """Half of the clients reset, leave or send rubbish; the others must not notice."""
    content = os.urandom(100_000)
    site.page("a.bin", content)

    def client(number):
        for turn in range(20):
            if number % 2 == 0:
                assert site.get("/a.bin").body == content
                continue
            broken = Client(site.port, receive_buffer=4096)
            if turn % 4 == 0:
                broken.reset()
            elif turn % 4 == 1:
                broken.send(b"GET /a.bin")
                broken.reset()
            elif turn % 4 == 2:
                broken.send(b"rubbish\r\n\r\n")
                broken.close()
            else:
                broken.send(request_text("/a.bin"))
                broken.reset()

    Background(client, 8).join()
    site.allow("err", r"Reply error writing to socket - socket error = (32|104)")


def test_1500_idle_connections_and_new_clients_are_answered_at_once(site):
    count = {"": 1500, "address": 1500, "thread": 1100}[SANITIZER]
    soft, _ = resource.getrlimit(resource.RLIMIT_NOFILE)
    if soft < count + 200:
        pytest.skip(f"needs {count + 200} open files, {soft} are allowed")
    site.configure(web={"WebMaxConnectionsPerAddress": 0})
    server = site.serve()
    files = len(descriptors(server.pid))
    held = [Client(site.port) for _ in range(count)]
    wait_until(lambda: thread_count(server.pid) >= server.threads + count, "all sessions run", timeout=3 * DEADLINE)
    for _ in range(10):
        started = time.monotonic()
        assert site.get("/hello.htm").status == 200
        assert time.monotonic() - started < 1 * SLOWDOWN
    raw = site.raw(b"POST /hello.htm HTTP/1.0\r\nContent-Length: 40000\r\n\r\n" + b"x" * 40000)
    assert raw.startswith(b"HTTP/1.0 200 OK")
    before = cpu_seconds(server.pid)
    time.sleep(3)  # the measured interval
    assert cpu_seconds(server.pid) - before <= 0.15 * SLOWDOWN
    for client in held[:: count // 50]:
        client.send(request_text("/hello.htm"))
        assert client.read_all().startswith(b"HTTP/1.0 200 OK")
    for client in held:
        client.close()
    server.wait_idle()
    wait_until(lambda: len(descriptors(server.pid)) <= files, "all descriptors are closed")
    assert site.get("/hello.htm").status == 200


def wake_ups(pid):
    """How often any thread of the process has waited for something and got it."""
    return sum(
        int(line.split()[1])
        for status in Path(f"/proc/{pid}/task").glob("*/status")
        for line in status.read_text().splitlines()
        if line.startswith("voluntary_ctxt_switches:")
    )


@pytest.mark.slow
@pytest.mark.skipif(SANITIZER == "thread", reason="a thread of the sanitizer's own wakes up ten times a second")
def test_an_idle_server_has_no_periodic_work(site, server):
    def asleep():
        before = wake_ups(server.pid)
        time.sleep(0.3)
        return wake_ups(server.pid) == before

    wait_until(asleep, "the start is over")
    before = wake_ups(server.pid)
    time.sleep(7)  # the measured interval; work every two seconds would show three times
    assert wake_ups(server.pid) - before < 3


# The check of object types opens a pipe for each look at memory and takes its failure for a fault of the program.
needs_no_spare_descriptors = pytest.mark.skipif(
    has_symbol("__ubsan_handle_dynamic_type_cache_miss"),
    reason="the sanitizer's object type check itself fails without a free descriptor",
)


@needs_no_spare_descriptors
def test_more_connections_than_descriptors(site):
    """The listener must not spin while there is no descriptor, and must serve again when some are free."""
    site.configure(unix={"handles": 40})
    server = site.serve(shell="ulimit -S -n 20")
    limits = open(f"/proc/{server.pid}/limits").read()
    assert re.search(r"^Max open files\s+40\s+40\s", limits, re.M), limits
    held = [Client(site.port) for _ in range(60)]

    def failures():
        return sum(line == "Socket::Accept error: Too many open files (24)." for line in site.err())

    wait_until(failures, "accepting fails")
    cpu, lines = cpu_seconds(server.pid), failures()
    time.sleep(4)  # the measured interval
    assert cpu_seconds(server.pid) - cpu <= 0.4 * SLOWDOWN
    assert failures() - lines <= 2 * 4 + 1
    for client in held:
        client.close()
    started = time.monotonic()
    assert site.get("/hello.htm").status == 200
    assert time.monotonic() - started < 5 * SLOWDOWN
    site.expect("err", r"Socket::Accept error: Too many open files \(24\)\.")


@needs_no_spare_descriptors
def test_a_stop_ends_a_server_that_has_no_descriptors_left(site):
    site.configure(unix={"handles": 40})
    server = site.serve(shell="ulimit -S -n 20")
    held = [Client(site.port) for _ in range(60)]
    wait_until(lambda: any("Accept error" in line for line in site.err()), "accepting fails")
    started = time.monotonic()
    server.stop()
    assert time.monotonic() - started < 12 * SLOWDOWN
    for client in held:
        client.close()
    site.expect("err", r"Socket::Accept error: Too many open files \(24\)\.")
    site.allow("err", r"Error reading request from socket - socket timed out\.")


def test_nothing_is_left_over_after_2000_requests(site, server):
    site.page("large.bin", os.urandom(200_000))
    count = 2000 if SANITIZER != "thread" else 600

    def load(number):
        for turn in range(count // 8):
            kind = turn % 10
            if kind == 0:
                assert len(site.get("/large.bin").body) == 200_000
            elif kind == 1:
                assert site.get("/absent").status == 404
            elif kind == 2:
                assert site.raw(b"rubbish\r\n\r\n").startswith(b"HTTP/1.0 400 ")
            elif kind == 3 and turn % 50 == 3:
                assert site.raw(b"POST / HTTP/1.0\r\nContent-Length: 3000000\r\n\r\n" + b"x" * 40000) == REPLY_413
            else:
                assert site.get("/hello.htm").status == 200

    def rest():
        server.wait_idle()
        assert site.get("/hello.htm").status == 200  # the accept that sweeps the finished sessions
        server.wait_idle()
        return descriptors(server.pid), resident_kib(server.pid)

    Background(load, 8).join()
    files, memory = rest()
    for _ in range(2):
        Background(load, 8).join()
    files_after, memory_after = rest()
    assert len(files_after) == len(files), files_after
    assert thread_count(server.pid) == server.threads
    if not SANITIZER:
        assert memory_after - memory < 2048, f"{memory} KiB have become {memory_after} KiB"


def test_every_descriptor_is_close_on_exec(site, server):
    with Client(site.port) as client:
        client.send(b"GET ")
        wait_until(lambda: thread_count(server.pid) > 2, "a session")
        for number in sorted(descriptors(server.pid)):
            if number > 2:
                info = open(f"/proc/{server.pid}/fdinfo/{number}").read()
                flags = int(re.search(r"^flags:\s*(\d+)", info, re.M)[1], 8)
                assert flags & 0o2000000, (number, descriptors(server.pid)[number])
        client.end_of_request()
        client.read_all()


# ----------------------------------------------------------------------------------------------- stop and downloads


def blocked_download(site):
    """A client that reads the first bytes of a large file and no more."""
    client = Client(site.port, receive_buffer=4096)
    client.send(request_text("/large.bin"))
    client.receive_exactly(100)
    return client


@pytest.mark.parametrize("count", [1, 3])
def test_a_stop_cuts_running_sessions_and_counts_them(site, count):
    site.configure(audit={"debuglevel": 9})
    site.page("large.bin", b"x" * 50_000_000)
    server = site.serve()
    site.get("/hello.htm")
    server.wait_idle()
    clients = [blocked_download(site) for _ in range(count)]
    started = time.monotonic()
    code, out = site.run("-stop")
    assert code == 0 and out.endswith("The server has been stopped.\n")
    assert server.wait_exit() == 0
    assert time.monotonic() - started < 12 * SLOWDOWN
    assert f"{count} sessions not cleaned up on exit." in site.err()
    site.expect("err", rf"{count} sessions not cleaned up on exit\.", times=1)
    site.allow("err", r"Reply error writing to socket - socket error = \d+")
    for client in clients:
        client.close()


def test_a_stop_cuts_idle_connections(site):
    site.configure(audit={"debuglevel": 7})
    server = site.serve()
    held = hold(site, 20)
    started = time.monotonic()
    server.stop()
    assert time.monotonic() - started < 12 * SLOWDOWN
    for client in held:
        assert client.at_end()
        client.close()
    assert site.access() == []
    site.expect("err", r"20 sessions not cleaned up on exit\.", times=1)
    site.allow("err", r"Error reading request from socket - socket timed out\.")


def test_resets_under_load_cut_no_answer_short(site, server):
    """While the server is down for a moment clients are refused, and those that wait in the queue of the listening
    socket are reset without a byte; an answer that has begun is always whole."""
    content = hashlib.sha256(b"seed").digest() * 3000
    site.page("a.bin", content)
    clients = ResetLoad(site.port, "/a.bin", content, 6)
    rounds = 12 if not SANITIZER else 6
    for number in range(2, rounds + 2):
        goal = clients.outcomes["whole"] + 30
        wait_until(lambda: clients.outcomes["whole"] >= goal or clients.errors, "answers between the resets")
        server.signal(16)
        wait_until(
            lambda: sum(line.startswith("Starting server") for line in site.err()) == number, "the next start"
        )
    clients.stop()
    assert site.get("/hello.htm").status == 200
    # A session that ends while the server is down finds no access log; each client has one session at a time.
    lines = sum('"GET /a.bin HTTP/1.0" 200' in line for line in site.access())
    assert lines >= clients.outcomes["whole"] - 6 * rounds
