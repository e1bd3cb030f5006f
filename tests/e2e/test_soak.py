"""Long load runs. They run only when OX_SOAK=1, because they take minutes:

    OX_SOAK=1 OX_REMOTE=.../ox_remote pytest -s -m soak

100,000 requests at 64 clients: no failed request, flat memory, no descriptor and no thread left over; and 100 resets
under load: no error line, no answer cut short, and no connection lost that the server had accepted. The figures are
printed.
"""

import multiprocessing
import os
import time

import pytest

from harness import (
    SANITIZER,
    Client,
    ResetLoad,
    cpu_seconds,
    descriptors,
    is_listening,
    request_text,
    resident_kib,
    thread_count,
    wait_until,
)

pytestmark = pytest.mark.soak

CLIENTS = 64
REQUESTS = 100_000


def _client(port, expected, count, failures):
    """The clients are processes, so that they do not wait for each other."""
    bad = 0
    for _ in range(count):
        try:
            with Client(port, timeout=120) as client:
                client.send(request_text("/hello.htm"))
                bad += not client.read_all().endswith(expected)
        except OSError:
            bad += 1
    failures.value += bad


def run_clients(site, requests):
    expected = b"\r\n\r\n" + (site.web / "hello.htm").read_bytes()
    context = multiprocessing.get_context("fork")
    failures = [context.Value("i", 0) for _ in range(CLIENTS)]
    share = [requests // CLIENTS + (number < requests % CLIENTS) for number in range(CLIENTS)]
    workers = [
        context.Process(target=_client, args=(site.port, expected, share[number], failures[number]))
        for number in range(CLIENTS)
    ]
    for worker in workers:
        worker.start()
    for worker in workers:
        worker.join()
        assert worker.exitcode == 0
    return sum(value.value for value in failures)


def test_100000_requests_at_64_clients(site):
    site.page("hello.htm", b"x" * 1024)
    server = site.serve()
    assert run_clients(site, 5000) == 0
    server.wait_idle()
    site.get("/hello.htm")
    server.wait_idle()
    files, memory = len(descriptors(server.pid)), resident_kib(server.pid)
    cpu, started = cpu_seconds(server.pid), time.monotonic()
    failed = run_clients(site, REQUESTS)
    elapsed, cpu = time.monotonic() - started, cpu_seconds(server.pid) - cpu
    server.wait_idle()
    site.get("/hello.htm")
    server.wait_idle()
    files_after, memory_after = len(descriptors(server.pid)), resident_kib(server.pid)
    print(
        f"\n{REQUESTS} requests at {CLIENTS} clients in {elapsed:.1f} s, {REQUESTS / elapsed:.0f}/s, failed {failed}, "
        f"server CPU {cpu / REQUESTS * 1e6:.0f} us each, RSS {memory} -> {memory_after} KiB, "
        f"descriptors {files} -> {files_after}, threads {server.threads} -> {thread_count(server.pid)}"
    )
    assert failed == 0
    assert files_after == files
    assert thread_count(server.pid) == server.threads
    assert len(site.access()) == REQUESTS + 5000 + 2
    if not SANITIZER:
        assert memory_after - memory < 2048


def test_100_resets_under_load(site):
    site.configure(audit={"debuglevel": 7})
    content = os.urandom(40_000)
    site.page("a.bin", content)
    server = site.serve()
    def accepted():
        return site.error_log.read_bytes().count(b"HttpDaemon thread: connected to 127.0.0.77.")

    def starts():
        return site.error_log.read_bytes().count(b": Starting server: ")

    memory = descriptors_before = None
    clients = ResetLoad(site.port, "/a.bin", content, 8)
    for number in range(1, 101):
        held = Client(site.port, source="127.0.0.77")
        held.send(b"GET /a.bin HTTP")
        wait_until(lambda: accepted() == number, "the held connection is accepted")
        server.signal(16)
        wait_until(lambda: starts() == number + 1 and is_listening(site.port), "the next start")
        held.send(b"/1.0\r\n\r\n")
        assert held.read_all().endswith(content), "an accepted connection is lost"
        held.close()
        if number == 20:
            memory, descriptors_before = resident_kib(server.pid), len(descriptors(server.pid))
        goal = clients.outcomes["whole"] + 20
        wait_until(lambda: clients.outcomes["whole"] >= goal or clients.errors, "answers between the resets")
    clients.stop()
    server.wait_idle()
    site.get("/hello.htm")
    server.wait_idle()
    print(
        f"\n100 resets: {clients.outcomes}, RSS {memory} -> {resident_kib(server.pid)} KiB, "
        f"descriptors {descriptors_before} -> {len(descriptors(server.pid))}"
    )
    assert thread_count(server.pid) == server.threads
    if not SANITIZER:
        assert resident_kib(server.pid) - memory < 4096
