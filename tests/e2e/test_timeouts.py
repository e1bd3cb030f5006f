"""The session time-out: half a minute at least, so these tests take that long."""

import time

import pytest

from harness import (
    DEADLINE,
    SLOWDOWN,
    Background,
    Client,
    descriptors,
    request_text,
    wait_until,
)

TIMED_OUT = r"Session 0x[0-9A-F]+ has timed-out -- removing\."
READ_TIMED_OUT = r"Error reading request from socket - socket timed out\."


@pytest.mark.slow
def test_silent_and_dribbling_clients_are_dropped_without_an_answer(site):
    """A time-out of 10 seconds counts as 30. No other connection is needed; a session that has finished stays listed
    until the next one comes."""
    site.configure(web={"WebUserTimeout": 10}, audit={"debuglevel": 5})
    server = site.serve()
    silent, dribbling = Client(site.port), Client(site.port)
    started = time.monotonic()
    wait_until(lambda: sum("Adding user session" in line for line in site.err()) == 2, "two sessions")
    site.get("/hello.htm")
    ended = {}
    while len(ended) < 2:
        now = time.monotonic() - started
        assert now < 36 + DEADLINE, "the clients are not dropped"
        for name, client in (("silent", silent), ("dribbling", dribbling)):
            if name not in ended and client.at_end():
                ended[name] = now
        if "dribbling" not in ended and int(now * 10) % 20 == 0:
            try:
                dribbling.send(b"G")
            except OSError:
                pass
        time.sleep(0.1)  # the pace of the dribbling client
    for name, seconds in ended.items():
        assert 30 <= seconds <= 36 + SLOWDOWN, f"the {name} client was dropped after {seconds:.1f} s"
    server.wait_idle()
    wait_until(lambda: sum("timed-out" in line for line in site.err()) == 2, "both removals")
    assert not any("Removing user session" in line for line in site.err())
    assert len(site.access()) == 1
    texts = [line for line in site.err() if "timed" in line]
    assert "Error reading" in texts[0] and texts[-1].startswith("Session 0x")
    assert site.get("/hello.htm").status == 200
    wait_until(lambda: sum("Removing user session" in line for line in site.err()) == 1, "the finished session goes")
    site.expect("err", TIMED_OUT, times=2)
    site.expect("err", READ_TIMED_OUT, times=2)
    silent.close()
    dribbling.close()


@pytest.mark.slow
def test_a_client_that_never_reads_holds_nobody_up(site):
    """Also not at the moment when its session times out."""
    site.configure(web={"WebUserTimeout": 30}, audit={"debuglevel": 5})
    site.page("large.bin", b"x" * 50_000_000)
    server = site.serve()
    files = len(descriptors(server.pid))
    blocked = Client(site.port, receive_buffer=4096)
    blocked.send(request_text("/large.bin"))
    started = time.monotonic()
    slowest = 0.0
    while time.monotonic() - started < 36:
        before = time.monotonic()
        assert site.get("/hello.htm").status == 200
        slowest = max(slowest, time.monotonic() - before)
        time.sleep(0.2)  # the pace of the other clients
    assert slowest < 1.0 * SLOWDOWN, f"another client waited {slowest:.2f} s"
    wait_until(lambda: any("timed-out" in line for line in site.err()), "the time-out")
    server.wait_idle()
    wait_until(lambda: len(descriptors(server.pid)) <= files, "its descriptors are closed")
    site.expect("err", TIMED_OUT, times=1)
    site.expect("err", r"Reply error writing to socket - socket error = \d+", times=1)
    blocked.close()


@pytest.mark.slow
def test_a_slow_but_steady_reader_outlives_the_time_out(site):
    site.configure(web={"WebUserTimeout": 30})
    site.page("large.bin", b"x" * 40_000_000)
    site.serve()
    received = 0
    with Client(site.port, receive_buffer=65536) as client:
        client.send(request_text("/large.bin"))
        started = time.monotonic()
        while block := client.receive(65536):
            received += len(block)
            ahead = received / 1_050_000 - (time.monotonic() - started)
            if ahead > 0:
                time.sleep(ahead)  # the pace of the slow reader
        assert time.monotonic() - started > 36
    assert received > 40_000_000
    assert site.access()[0].endswith(" 200 40000000")


@pytest.mark.slow
def test_time_outs_while_others_are_served_close_no_foreign_connection(site):
    """Connections that time out free their descriptors just when others are taken: every answer must be whole."""
    site.configure(web={"WebUserTimeout": 30, "WebMaxConnectionsPerAddress": 0})
    server = site.serve()
    files = {f"/f{n}.txt": f"<{n:03}>".encode() * 9000 for n in range(40)}
    for name, content in files.items():
        site.page(name[1:], content)
    held = [Client(site.port) for _ in range(200)]
    started = time.monotonic()

    def load(number):
        turn = number
        while time.monotonic() - started < 36:
            name = f"/f{turn % 40}.txt"
            assert site.get(name).body == files[name]
            turn += 7
            time.sleep(0.01)  # leaves the processor to the other tests

    Background(load, 4).join(timeout=60 + DEADLINE)
    wait_until(lambda: all(client.at_end() for client in held), "all idle clients are dropped")
    site.expect("err", READ_TIMED_OUT, times=200)
    assert server.alive()
    for client in held:
        client.close()
