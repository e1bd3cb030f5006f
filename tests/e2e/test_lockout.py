"""Guessing of passwords: the fourth failure locks a name out for a minute."""

import multiprocessing
import re
import time

import pytest

from harness import (
    REPLY_401,
    REPLY_LOCKED_OUT,
    SANITIZER,
    SLOWDOWN,
    Background,
    Client,
    basic,
    request_text,
    resident_kib,
    wait_until,
)

RIGHT = basic("alice", "secret")
WRONG = basic("alice", "guess")
LINE = "User {} locked out for 1 minutes. Too many failed logins."
FAILED = r"Authentication failed: user .*\."


def serve(site):
    site.configure(audit={"debuglevel": 3})
    site.allow("err", FAILED)
    site.page("deep/page.htm", b"a deep page\n")
    site.add_user("alice")
    site.add_user("bob")
    return site.serve()


def fetch(site, *headers, path="/deep/page.htm"):
    """The kind of the answer, which must be that answer byte for byte."""
    raw = site.raw(request_text(path, *headers))
    if raw.startswith(b"HTTP/1.0 200 OK\r\n"):
        return 200
    kinds = {REPLY_401: 401, REPLY_LOCKED_OUT: 403}
    assert raw in kinds, raw
    return kinds[raw]


def checks(site, name="alice"):
    return site.err().count(f"Authenticating user {name}...")


def lock_out(site, name="alice"):
    assert [fetch(site, basic(name, "guess")) for _ in range(4)] == [401, 401, 401, 403]
    line = LINE.format(name)
    assert site.err()[-1] == line
    site.expect("err", re.escape(line), times=1)


def test_the_fourth_failure_gets_the_page_and_the_line(any_site):
    serve(any_site)
    lock_out(any_site)


def test_nothing_is_checked_while_a_name_is_locked_out(site):
    serve(site)
    lock_out(site)
    lines = site.err()
    for header in (WRONG, RIGHT, basic("alice", "")):
        for path in ("/deep/page.htm", "/images/x.gif", "/reports/sales/x.htm", "/cgi-bin/run.pl", "//"):
            assert fetch(site, header, path=path) == 403
    authenticated = [line for line in site.err()[len(lines) :] if "anonymous" not in line]
    assert authenticated == []


def test_what_needs_no_login_is_still_served(site):
    serve(site)
    lock_out(site)
    assert fetch(site, RIGHT, path="/hello.htm") == 200
    assert fetch(site) == 401


def test_others_are_not_harmed(site):
    site.add_user("Alice")
    site.add_user("alice2")
    serve(site)
    lock_out(site)
    for name in ("bob", "Alice", "alice2"):
        assert fetch(site, basic(name, "secret")) == 200
        assert fetch(site, basic(name, "guess")) == 401
    assert fetch(site, RIGHT) == 403


def test_a_name_that_nobody_has_is_locked_out_too(site):
    """The answers do not tell which names exist."""
    serve(site)
    lock_out(site, "nobody")
    assert fetch(site, basic("nobody", "secret")) == 403


def test_a_remembered_login_is_locked_out_as_well(site):
    serve(site)
    assert fetch(site, RIGHT) == 200
    lock_out(site)
    assert fetch(site, RIGHT) == 403


def test_a_success_does_not_clear_the_count(site):
    serve(site)
    site.expect("err", re.escape(LINE.format("alice")), times=1)
    for _ in range(3):
        assert fetch(site, WRONG) == 401
        assert fetch(site, RIGHT) == 200
    assert fetch(site, WRONG) == 403
    assert fetch(site, RIGHT) == 403


def test_three_failures_lock_nobody_out(site):
    serve(site)
    for name in ("alice", "bob", "nobody"):
        for _ in range(3):
            assert fetch(site, basic(name, "guess")) == 401
    assert fetch(site, RIGHT) == 200


def test_requests_without_a_name_are_not_counted(site):
    serve(site)
    for _ in range(6):
        assert fetch(site) == 401
        assert fetch(site, basic("", "guess")) == 401
    assert fetch(site, basic("", "x"), RIGHT) == 401
    assert fetch(site, RIGHT) == 200


def test_a_reset_releases_nobody(site):
    server = serve(site)
    lock_out(site)
    server.reset()
    assert fetch(site, RIGHT) == 403


def test_a_failure_on_a_report_is_checked_and_counted_once(site):
    serve(site)
    site.expect("err", re.escape(LINE.format("alice")), times=1)
    url = "/reports/sales/x.htm"
    for count, kind in [(1, 401), (2, 401), (3, 401), (4, 403)]:
        assert fetch(site, WRONG, path=url) == kind
        assert checks(site) == count
    assert fetch(site, RIGHT, path=url) == 403
    assert checks(site) == 4


def test_names_of_128_characters_share_one_count(site):
    serve(site)
    names = [letter * 128 for letter in "abcd"]
    assert [fetch(site, basic(name, "guess")) for name in names] == [401, 401, 401, 403]
    site.expect("err", re.escape(LINE.format(names[3])), times=1)
    assert fetch(site, basic("e" * 200, "guess")) == 403
    assert [fetch(site, basic(letter * 127, "guess")) for letter in "abcd"] == [401] * 4
    assert fetch(site, RIGHT) == 200


@pytest.mark.parametrize("path", ["/deep/page.htm", "/reports/sales/x.htm"])
def test_of_20_guesses_at_once_four_reach_the_check(site, path):
    serve(site)
    site.expect("err", re.escape(LINE.format("alice")), times=1)
    clients = [Client(site.port) for _ in range(20)]
    for client in clients:
        client.send(request_text(path, WRONG)[:-2])
    answers = []

    def finish(number):
        clients[number].send(b"\r\n")
        answers.append(clients[number].read_all())

    Background(finish, 20).join()
    for client in clients:
        client.close()
    assert (answers.count(REPLY_401), answers.count(REPLY_LOCKED_OUT)) == (3, 17)
    assert checks(site) == 4
    assert fetch(site, basic("bob", "secret")) == 200


# ----------------------------------------------------------------------------------------------------- the minute


@pytest.mark.slow
def test_the_lock_ends_a_minute_after_the_failure_that_set_it(site):
    """Tries during the minute do not lengthen it, and an old failure does not add to a new one."""
    serve(site)
    for _ in range(3):
        assert fetch(site, basic("bob", "guess")) == 401
    for _ in range(3):
        assert fetch(site, WRONG) == 401
    before = time.monotonic()
    assert fetch(site, WRONG) == 403
    after = time.monotonic()
    while fetch(site, RIGHT) == 403:
        assert time.monotonic() - after < 62 + SLOWDOWN, "the lock does not end"
        time.sleep(0.2)  # the pace of the user
    released = time.monotonic()
    assert released - before > 59, f"released after {released - after:.1f} s"  # whole seconds are counted
    assert fetch(site, basic("bob", "guess")) == 401, "the count has started again"
    assert [fetch(site, WRONG) for _ in range(4)] == [401, 401, 401, 403]
    site.expect("err", re.escape(LINE.format("alice")), times=2)


@pytest.mark.slow
def test_failures_further_apart_than_a_minute_never_lock_out(site):
    serve(site)
    for turn in range(2):
        assert [fetch(site, WRONG) for _ in range(3)] == [401] * 3
        if turn == 0:
            time.sleep(61)  # the minute after which a failure counts no more
    assert fetch(site, RIGHT) == 200


# --------------------------------------------------------------------------------------------------- a long attack


def _guess(port, prefix, count, failures):
    """The clients are processes, so that they do not wait for each other."""
    bad = 0
    for number in range(count):
        try:
            with Client(port, timeout=120) as client:
                client.send(request_text("/deep/page.htm", basic(f"{prefix}{number}", "guess")))
                bad += client.read_all() != REPLY_401
        except OSError:
            bad += 1
    failures.value += bad


def guess(site, prefix, count, workers=8):
    context = multiprocessing.get_context("fork")
    failures = [context.Value("i", 0) for _ in range(workers)]
    processes = [
        context.Process(target=_guess, args=(site.port, f"{prefix}-{number}-", count // workers, failures[number]))
        for number in range(workers)
    ]
    for process in processes:
        process.start()
    for process in processes:
        process.join()
        assert process.exitcode == 0
    assert sum(value.value for value in failures) == 0


@pytest.mark.soak
def test_100000_failures_of_different_names_keep_the_memory_flat(site):
    site.page("deep/page.htm", b"a deep page\n")
    site.add_user("alice")
    server = site.serve()
    server_lines = len(site.err())
    guess(site, "first", 40_000)  # until the registry is as large as it gets
    server.wait_idle()
    before, started = resident_kib(server.pid), time.monotonic()
    guess(site, "n", 100_000)
    elapsed = time.monotonic() - started
    server.wait_idle()
    after = resident_kib(server.pid)
    print(f"\n100000 failed logins in {elapsed:.1f} s, {100_000 / elapsed:.0f}/s, RSS {before} -> {after} KiB")
    assert len(site.err()) == server_lines
    if not SANITIZER:
        assert after - before < 2048
    assert [fetch(site, WRONG) for _ in range(4)] == [401, 401, 401, 403], "the registry still counts"
    site.expect("err", re.escape(LINE.format("alice")), times=1)
    wait_until(lambda: fetch(site, RIGHT) == 200, "the lock ends", timeout=65)
