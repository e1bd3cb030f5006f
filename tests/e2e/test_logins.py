"""Logins with the product's own user files: who is asked, what is said in the logs, and what is remembered."""

import re
import time

import pytest

from harness import (
    B401,
    REPLY_401,
    SLOWDOWN,
    Background,
    basic,
    request_text,
    resident_kib,
)

LOGIN_LINE = re.compile(r"Authenticating user |Authentication failed: |User .* ([Aa]uthenticat|locked|requested)")
RIGHT = basic("alice", "secret")
WRONG = basic("alice", "Secret")


def login_lines(site):
    return [line for line in site.err() if LOGIN_LINE.match(line)]


def checks(site, name="alice"):
    return site.err().count(f"Authenticating user {name}...")


def serve(site, level=1, **web):
    """Starts a server with the user alice and a page that asks for a login."""
    site.configure(audit={"debuglevel": level}, web=web)
    site.page("deep/page.htm", b"a deep page\n")
    site.add_user("alice")
    return site.serve()


def fetch(site, *headers, path="/deep/page.htm"):
    reply = site.get(path, *headers)
    assert reply.status in (200, 401)
    assert reply.body == (b"a deep page\n" if reply.status == 200 else B401)
    return reply.status


# --------------------------------------------------------------------------------------------------- who is asked


@pytest.mark.parametrize(
    "path",
    [
        "/deep/page.htm",
        "/deep/",
        "/images/x.gif",
        "/images/",
        "/no/such/file",
        "/hello.htm/",
        "//hello.htm",
        "//",
        "/%2Fhello.htm",
        "/deep%2fpage.htm",
        "/reports/sales/x.htm",
        "/cgi-bin/run.pl",
        "/tools/run.pl",
        "/deep/page.htm?a=b",
    ],
)
def test_what_lies_below_the_top_directory_asks_for_a_login(site, path):
    serve(site)
    for method in ("GET", "POST", "HEAD"):
        assert site.raw(request_text(path, method=method)) == REPLY_401


@pytest.mark.parametrize("headers", [[], [RIGHT], [WRONG], [basic("nobody", "x")]])
def test_the_top_directory_asks_for_none_and_checks_none(site, headers):
    serve(site, level=3)
    assert site.get("/", *headers).status == 200
    assert site.get("/hello.htm?x=/a/b", *headers).status == 200
    assert site.get("/absent.htm", *headers).status == 404
    assert login_lines(site) == []


def test_an_asked_login_opens_what_lies_below(any_site):
    serve(any_site)
    assert any_site.raw(request_text("/deep/page.htm")) == REPLY_401
    assert any_site.raw(request_text("/deep/page.htm", WRONG)) == REPLY_401
    any_site.expect("err", r"Authentication failed: user alice\.", times=0)
    assert fetch(any_site, RIGHT) == 200
    assert any_site.raw(request_text("/deep/page.htm", basic("bob", "secret"))) == REPLY_401
    assert any_site.get("/no/such", RIGHT).status == 404


def test_the_access_log_names_the_user_as_the_browser_sent_it(site):
    serve(site)
    fetch(site, RIGHT)
    fetch(site, WRONG)
    fetch(site)
    fetch(site, basic('b"o\nb', "x"))
    site.get("/hello.htm", basic("somebody else", ""))
    users = [re.match(r"127\.0\.0\.1 - (.+) \[", line)[1] for line in site.access()]
    assert users == ["alice", "alice", "-", r"b\x22o\x0ab", "somebody else"]
    assert [line.rsplit(" ", 2)[1:] for line in site.access()[:3]] == [["200", "12"], ["401", "0"], ["401", "0"]]


LONG = basic("open", "p" * 250)  # 255 bytes with the colon
TOO_LONG = basic("open", "p" * 251)


@pytest.mark.parametrize(
    "header,status",
    [
        (RIGHT, 200),
        (RIGHT.replace("Basic ", "Basic    "), 200),
        (RIGHT.replace("Basic ", "Basic"), 200),
        (RIGHT.replace("Authorization: ", "Authorization:"), 200),
        (RIGHT.rstrip("="), 200),
        ("X-" + RIGHT, 200),
        (RIGHT.replace("Basic", "basic"), 401),
        (RIGHT.replace("Basic", "Bearer"), 401),
        (RIGHT.replace("Authorization", "authorization"), 401),
        (RIGHT.replace("Authorization:", "Authorization :"), 401),
        ("Authorization: Basic", 401),
        ("Authorization: Basic !!!!", 401),
        pytest.param("Authorization: " + "A" * 2000, 401, id="2000-bytes"),
        (basic("", "secret"), 401),
        (basic("alice", ""), 401),
        (basic("alice", "secre"), 401),
        (basic("alice", "secret "), 401),
        (basic("Alice", "secret"), 401),
        (basic(" alice", "secret"), 401),
        (basic("alice", b"secret\0more"), 200),
        (basic(b"alice\0", "secret"), 401),
        ("Authorization: Basic YWxpY2U=", 401),
        ("Authorization: Basic b3Blbg==", 200),
        pytest.param(LONG, 200, id="255-bytes"),
        pytest.param(TOO_LONG, 401, id="256-bytes"),
    ],
)
def test_the_forms_of_the_header(site, header, status):
    site.add_user("open", None)
    serve(site)
    assert fetch(site, header) == status


def test_the_first_of_two_headers_counts(site):
    serve(site)
    assert fetch(site, RIGHT, WRONG) == 200
    assert fetch(site, WRONG, RIGHT) == 401


# ---------------------------------------------------------------------------------------------------- what is said

SUCCESS = [(3, "Authenticating user alice..."), (2, "User alice Authenticated")]
FAILURE = [(3, "Authenticating user {}..."), (2, "Authentication failed: user {}.")]


@pytest.mark.parametrize("level", [0, 1, 2, 3])
def test_each_login_has_its_lines(site, level):
    """The line of a success has no full stop, the others have."""
    serve(site, level=level)
    site.allow("err", r"Authentication failed: user (alice|bob)\.")
    assert fetch(site, RIGHT) == 200
    lines = [text for needed, text in SUCCESS if needed <= level]
    assert login_lines(site) == lines
    for name in ("alice", "bob"):
        assert fetch(site, basic(name, "no")) == 401
        lines += [text.format(name) for needed, text in FAILURE if needed <= level]
        assert login_lines(site) == lines
    assert fetch(site) == fetch(site, basic("", "x")) == 401
    assert login_lines(site) == lines, "without a name nothing is checked"


@pytest.mark.parametrize(
    "name,shown",
    [
        (b"a\nb", r"a\x0ab"),
        (b"a\r\nJan-01-2024 forged", r"a\x0d\x0aJan-01-2024 forged"),
        (b"a\tb\x1b[2J\x7f", r"a\x09b\x1b[2J\x7f"),
        (b"domain\\user", r"domain\user"),
        (b'"quoted"', '"quoted"'),
        (b"%s%n%d", "%s%n%d"),
        ("müller".encode(), "müller".encode().decode("latin-1")),
        (b"two words ", "two words "),
        pytest.param(b"x" * 254, "x" * 254, id="254-bytes"),
    ],
)
def test_a_name_from_outside_stays_within_its_line(site, name, shown):
    serve(site, level=3)
    site.expect("err", re.escape(f"Authentication failed: user {shown}."), times=1)
    assert fetch(site, basic(name, "")) == 401
    assert login_lines(site) == [f"Authenticating user {shown}...", f"Authentication failed: user {shown}."]


# ----------------------------------------------------------------------------------------------- what is remembered


def test_a_login_is_checked_once_and_remembered(site):
    serve(site, level=3)
    for _ in range(5):
        assert fetch(site, RIGHT) == 200
    assert login_lines(site) == ["Authenticating user alice...", "User alice Authenticated"]


def test_another_password_is_checked_and_does_not_end_the_remembered_login(site):
    serve(site, level=3)
    site.expect("err", r"Authentication failed: user alice\.", times=2)
    assert fetch(site, RIGHT) == 200
    assert fetch(site, WRONG) == fetch(site, basic("alice", "")) == 401
    assert checks(site) == 3
    assert fetch(site, RIGHT) == 200
    assert checks(site) == 3


def test_of_a_user_with_many_good_passwords_the_last_is_remembered(site):
    serve(site, level=3)
    site.add_user("open", None)
    site.servers[0].reset()
    for number, password in enumerate(["a", "b", "b", "a", "a", ""]):
        assert fetch(site, basic("open", password)) == 200
        assert checks(site, "open") == [1, 2, 2, 3, 3, 4][number]


def test_many_first_requests_at_once_are_checked_once(site):
    """Those with one name wait for each other, and the first one's success is remembered for all."""
    serve(site, level=3)
    Background(lambda _: [fetch(site, RIGHT) for _ in range(5)], 12).join()
    assert checks(site) == 1


def test_users_do_not_get_each_others_logins(site):
    names = [f"user{number}" for number in range(8)]
    for name in names:
        site.add_user(name, f"password of {name}")
    serve(site)

    def load(number):
        other = names[(number + 1) % len(names)]
        for _ in range(20):
            assert fetch(site, basic(names[number], f"password of {names[number]}")) == 200
        assert fetch(site, basic(other, f"password of {names[number]}")) == 401

    Background(load, len(names)).join()


def test_a_reset_forgets_the_logins(site):
    server = serve(site, level=3)
    assert fetch(site, RIGHT) == 200
    server.reset()
    assert fetch(site, RIGHT) == 200
    assert checks(site) == 2


def test_a_password_changed_by_hand_counts_from_the_next_reset(any_site):
    site = any_site
    server = serve(site)
    assert fetch(site, RIGHT) == 200
    site.add_user("alice", "changed")
    assert fetch(site, RIGHT) == 200
    assert fetch(site, basic("alice", "changed")) == 401
    server.reset()
    assert fetch(site, RIGHT) == 401
    assert fetch(site, basic("alice", "changed")) == 200


def test_a_user_deleted_by_hand_is_gone_with_the_next_reset(site):
    server = serve(site)
    site.add_user("bob")
    (site.users / "bob.usr").unlink()
    assert fetch(site, RIGHT) == 200
    (site.users / "alice.usr").unlink()
    assert fetch(site, RIGHT) == 200
    server.reset()
    assert fetch(site, RIGHT) == 401
    site.add_user("alice")
    server.reset()
    assert fetch(site, RIGHT) == 200


def test_permissions_changed_by_hand_count_from_the_next_reset(site):
    site.add_report("sales/page.htm")
    server = serve(site)
    url = "/reports/sales/page.htm"
    assert site.get(url, RIGHT).status == 403
    for permissions, before, after in [(1, 403, 200), (0, 200, 403)]:
        site.add_user("alice", permissions=permissions)
        assert site.get(url, RIGHT).status == before
        server.reset()
        assert site.get(url, RIGHT).status == after


# The time-out is 30 seconds and the idle logins are dropped every 15.
IDLE_SECONDS = 50


@pytest.mark.slow
def test_an_idle_login_is_forgotten_and_a_used_one_is_not(site):
    site.add_user("bob")
    serve(site, level=3, WebUserTimeout=30)
    bob = basic("bob", "secret")
    assert fetch(site, RIGHT) == fetch(site, bob) == 200
    started = time.monotonic()
    while time.monotonic() - started < IDLE_SECONDS:
        assert fetch(site, bob) == 200
        time.sleep(3)  # the pace of the user
    assert (checks(site, "alice"), checks(site, "bob")) == (1, 1)
    assert fetch(site, RIGHT) == fetch(site, bob) == 200
    assert (checks(site, "alice"), checks(site, "bob")) == (2, 1)


@pytest.mark.slow
def test_a_login_after_the_last_one_was_forgotten_is_forgotten_too(site):
    """The thread that forgets them sleeps when nobody is logged in."""
    serve(site, level=3, WebUserTimeout=30)
    time.sleep(20)  # beyond a first sweep
    for count in (1, 2, 3):
        assert fetch(site, RIGHT) == fetch(site, RIGHT) == 200
        assert checks(site) == count
        if count < 3:
            time.sleep(IDLE_SECONDS)  # nobody comes


@pytest.mark.soak
def test_100000_passwords_of_one_user_are_not_all_remembered(site):
    site.add_user("open", None)
    server = serve(site)

    def load(count):
        def one(number):
            for turn in range(count // 8):
                assert fetch(site, basic("open", f"{number} {turn}")) == 200

        Background(one, 8).join(timeout=900 * SLOWDOWN)
        server.wait_idle()

    load(8000)
    before = resident_kib(server.pid)
    load(100_000)
    print(f"\n100000 passwords of one user: RSS {before} -> {resident_kib(server.pid)} KiB")
    assert resident_kib(server.pid) - before < 2048 * SLOWDOWN
