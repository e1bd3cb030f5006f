"""What the server reads out of a request, and what it refuses."""

import base64
import os
import signal
import time

import pytest

from harness import (
    DEADLINE,
    REPLY_400,
    REPLY_404,
    REPLY_413,
    SLOWDOWN,
    Client,
    Reply,
    cpu_seconds,
    request_text,
    wait_until,
)


def logged(site):
    """What stands in the last access line: (request, status)."""
    _, request, rest = site.access()[-1].split('"')
    return request, int(rest.split()[0])


# A request ended by the end of the connection, and what is logged for it.
WHOLE_REQUESTS = [
    (b"GET /hello.htm HTTP/1.0\r\n\r\n", "GET /hello.htm HTTP/1.0", 200),
    (b"get /hello.htm HTTP/1.0\r\n\r\n", "GET /hello.htm HTTP/1.0", 200),
    (b"GE /hello.htm HTTP/1.0\r\n\r\n", "GET /hello.htm HTTP/1.0", 200),
    (b"G /hello.htm HTTP/1.0\r\n\r\n", "GET /hello.htm HTTP/1.0", 200),
    (b"P /hello.htm HTTP/1.0\r\n\r\n", "POST /hello.htm HTTP/1.0", 200),
    (b"post /hello.htm HTTP/1.0\r\n\r\n", "POST /hello.htm HTTP/1.0", 200),
    (b"h /hello.htm HTTP/1.0\r\n\r\n", "HEAD /hello.htm HTTP/1.0", 200),
    (b"   GET    /hello.htm HTTP/1.0   \r\n\r\n", "GET /hello.htm HTTP/1.0", 200),
    (b"GET /hello.htm  HTTP/1.0\r\n\r\n", "GET /hello.htm ", 400),
    (b"GET /hello.htm http/1.1\r\n\r\n", "GET /hello.htm http/1.1", 200),
    (b"GET /hello.htm HTTP/9.9\r\n\r\n", "GET /hello.htm HTTP/9.9", 200),
    (b"GET /hello.htm HTTP/1.1x\r\n\r\n", "GET /hello.htm ", 200),
    (b"GET /hello.htm FTP\r\n\r\n", "GET /hello.htm ", 200),
    (b"GET /hello.htm \r\n\r\n", "GET /hello.htm ", 200),
    (b"GET /hello.htm", "GET /hello.htm ", 200),
    (b"GET /hello.htm ", "GET /hello.htm ", 200),
    (b"GET /hello.htm HTTP/1.0", "GET /hello.htm HTTP/1.0", 200),
    (b"GET /hello.htm HTTP/1.0\r\n", "GET /hello.htm HTTP/1.0", 200),
    (b"GET /hello.htm HTTP/1.0\r\nHost: x", "GET /hello.htm HTTP/1.0", 200),
    (b"GET /hello.htm?a=b HTTP/1.0\r\n\r\n", "GET /hello.htm HTTP/1.0", 200),
    (b"GET /hello.htm? HTTP/1.0\r\n\r\n", "GET /hello.htm HTTP/1.0", 200),
    (b"GET /hello.htm?a?b=/../x HTTP/1.0\r\n\r\n", "GET /hello.htm HTTP/1.0", 200),
    (b"GET /%68%65llo%2Ehtm HTTP/1.0\r\n\r\n", "GET /%68%65llo%2Ehtm HTTP/1.0", 200),
    (b"GET /hello.htm%00.pl HTTP/1.0\r\n\r\n", "GET /hello.htm%00.pl HTTP/1.0", 200),
    (b"GET /%00 HTTP/1.0\r\n\r\n", "GET /%00 HTTP/1.0", 200),
    (b"GET /hello.htm%3Fa HTTP/1.0\r\n\r\n", "GET /hello.htm%3Fa HTTP/1.0", 404),
    (b"GET /absent HTTP/1.0\r\n\r\n", "GET /absent HTTP/1.0", 404),
    (b"", "  ", 400),
    (b"\r\n\r\n", "  ", 400),
    (b"GET", "GET  ", 400),
    (b"GET ", "GET  ", 400),
    (b"GET /\r\n\r\n", None, 400),
    (b"GET /hello.htm\r\n", None, 400),
    (b"GET hello.htm HTTP/1.0\r\n\r\n", None, 400),
    (b"GET http://x/hello.htm HTTP/1.0\r\n\r\n", None, 400),
    (b"GET /hello.htm HTTP/1.0 more\r\n\r\n", "GET /hello.htm HTTP/1.0", 400),
    (b"GET /hello.htm HTTP/1.0\n\n", None, 400),
    (b"DELETE /hello.htm HTTP/1.0\r\n\r\n", None, 400),
    (b"GETX /hello.htm HTTP/1.0\r\n\r\n", None, 400),
    (b"garbage\r\n\r\n", "  ", 400),
]


@pytest.fixture(scope="module")
def table_site():
    import harness

    site = harness.Installation()
    site.serve()
    yield site
    faults = site.close()
    site.remove()
    assert not faults, "\n".join(faults)


@pytest.mark.parametrize("data,line,status", WHOLE_REQUESTS, ids=lambda value: repr(value)[:40])
def test_a_request_ended_by_the_client(table_site, data, line, status):
    count = len(table_site.access())
    raw = table_site.raw(data, end=True)
    assert Reply(raw).status == status
    if status == 400:
        assert raw == REPLY_400
    if status == 404:
        assert raw == REPLY_404
    assert len(table_site.access()) == count + 1
    if line is not None:
        assert logged(table_site) == (line, status)


@pytest.mark.parametrize("cut", range(1, 27))
def test_a_request_in_two_pieces_is_the_same_request(table_site, cut):
    data = b"GET /hello.htm HTTP/1.0\r\n\r\n"
    with Client(table_site.port) as client:
        client.send(data[:cut])
        time.sleep(0.002)  # so that the pieces are received apart
        client.send(data[cut:])
        assert Reply(client.read_all()).status == 200


@pytest.mark.parametrize(
    "name,url",
    [
        ("a b.htm", "/a%20b.htm"),
        ("a+b.htm", "/a+b.htm"),
        ("a%zz.htm", "/a%zz.htm"),
        ("a%4.htm", "/a%4.htm"),
        ("a%.htm", "/a%.htm"),
        ("a%41.htm", "/a%2541.htm"),
        ("\xfc.htm", "/%c3%BC.htm"),
        ("a\x01b.htm", "/a%01b.htm"),
    ],
)
def test_escapes_in_the_path(site, server, name, url):
    site.page(name, b"found")
    assert site.get(url).body == b"found"


def test_the_longest_path_is_8191_characters(site, server):
    assert site.get("/" * 8191).status == 401
    assert site.raw(request_text("/" + "a" * 8190)) == REPLY_404
    assert site.raw(request_text("/" + "a" * 8191)) == REPLY_400
    assert site.raw(request_text("/hello.htm?" + "a" * 9000)).startswith(b"HTTP/1.0 200 OK\r\n")


@pytest.mark.parametrize("size", [32766, 32767, 32770, 33000])
def test_a_header_block_that_does_not_end_within_the_limit_gets_413(site, server, size):
    data = b"GET /hello.htm HTTP/1.0\r\nX: ".ljust(size, b"x")
    assert site.raw(data, end=True) == REPLY_413


def test_a_header_block_that_just_fits_is_read(site, server):
    data = b"GET /hello.htm HTTP/1.0\r\nX: ".ljust(32766 - 4, b"x") + b"\r\n\r\n"
    assert Reply(site.raw(data)).status == 200
    data = b"GET /hello.htm HTTP/1.0\r\nX: ".ljust(32767 - 4, b"x") + b"\r\n\r\n"
    assert site.raw(data) == REPLY_413


def test_a_header_block_sent_byte_by_byte_costs_little(site, server):
    data = b"GET /hello.htm HTTP/1.0\r\nX: ".ljust(32700, b"x") + b"\r\n\r\n"
    with Client(site.port) as client:
        before = cpu_seconds(server.pid)
        for position in range(len(data)):
            client.send(data[position : position + 1])
        assert Reply(client.read_all()).status == 200
        assert cpu_seconds(server.pid) - before < 1.0 * SLOWDOWN


# ------------------------------------------------------------------------------------------------------- bodies


def post(length, body):
    return f"POST /hello.htm HTTP/1.0\r\nContent-Length: {length}\r\n\r\n".encode() + body


@pytest.mark.parametrize(
    "length,body,status",
    [
        ("5", b"x=1&y", 200),
        ("0", b"", 200),
        ("", b"", 200),
        ("-5", b"abc", 200),
        ("abc", b"abc", 200),
        ("40000", b"x" * 40000, 200),
        ("2064384", b"x" * 2064384, 200),
        ("2064385", b"x" * 2064385, 413),
        ("4294967301", b"x" * 40000, 413),
        ("18446744073709551617", b"x" * 40000, 413),
        ("99999999999999999999999999", b"x" * 40000, 413),
    ],
    ids=lambda value: repr(value)[:30],
)
def test_the_announced_length_of_a_body(site, server, length, body, status):
    raw = site.raw(post(length, body))
    assert Reply(raw).status == status
    if status == 413:
        assert raw == REPLY_413


def test_the_second_spelling_of_the_length_is_known(site, server):
    with Client(site.port) as client:
        client.send(b"POST /hello.htm HTTP/1.0\r\nContent-length: 10\r\n\r\n12345")
        time.sleep(0.1)
        assert not client.at_end()
        client.send(b"67890")
        assert Reply(client.read_all()).status == 200


def test_the_answer_waits_for_the_whole_body(site, server):
    with Client(site.port) as client:
        client.send(post(50000, b""))
        for _ in range(5):
            client.send(b"x" * 9999)
            time.sleep(0.02)
            assert not client.at_end()
        client.send(b"x" * 5)
        assert Reply(client.read_all()).status == 200


def test_a_body_cut_short_by_the_client_still_gets_an_answer(site, server):
    assert Reply(site.raw(post(50000, b"x" * 100), end=True)).status == 200


@pytest.mark.parametrize("unread", [1, 65534, 65535, 65536, 2 * 65535, 200_000, 700_000, 2_000_000])
def test_an_unannounced_body_is_dropped_and_the_answer_arrives_whole(site, server, unread):
    """The server is held while all that fits is sent, so that it finds the bytes waiting. It takes 32,766 bytes with
    the first receive; exactly 65,535 more must not make it wait for another byte."""
    data = b"POST /hello.htm HTTP/1.0\r\n\r\n".ljust(32766 + unread, b"x")
    content = (site.web / "hello.htm").read_bytes()
    server.signal(signal.SIGSTOP)
    try:
        with Client(site.port) as client:
            client.socket.setblocking(False)
            sent = 0
            try:
                while sent < len(data):
                    sent += client.socket.send(data[sent:])
            except BlockingIOError:
                pass
            client.socket.settimeout(DEADLINE)
            server.signal(signal.SIGCONT)
            started = time.monotonic()
            client.send(data[sent:])
            assert client.read_all().endswith(b"\r\n\r\n" + content)
            assert time.monotonic() - started < 5 * SLOWDOWN
    finally:
        server.signal(signal.SIGCONT)


@pytest.mark.parametrize("head", [b"POST /hello.htm HTTP/1.0\r\ncontent-length: 8\r\n\r\n",
                                  b"POST /hello.htm HTTP/1.1\r\nTransfer-Encoding: chunked\r\n\r\n"])
def test_a_body_that_is_not_announced_and_comes_late_costs_nobody_the_answer(site, server, head):
    """The answer is under way when the body arrives; closing the connection at that moment would reset it."""
    content = (site.web / "hello.htm").read_bytes()
    for _ in range(10):
        with Client(site.port) as client:
            client.send(head)
            first = client.socket.recv(1)
            client.send(b"3\r\na=b\r\n")
            assert (first + client.read_all()).endswith(b"\r\n\r\n" + content)


@pytest.mark.parametrize("request_line", [b"GET /hello.htm\0zz HTTP/1.0", b"GET /hello.htm HTTP/1\0.0"])
def test_a_nul_in_the_request_line_is_a_bad_request(site, server, request_line):
    with Client(site.port) as client:
        client.send(request_line + b"\r\n\r\n")
        assert client.read_all().startswith(b"HTTP/1.0 400 Bad Request\r\n")


def test_more_body_than_announced_beyond_the_buffer_gets_400(site, server):
    """20,000 bytes of header and an announced body of 14,000 grow the buffer to 46,766 bytes; all of the 50,000 bytes
    are waiting when the server reads, so the buffer fills up before the body's end is looked at."""
    head = b"POST /hello.htm HTTP/1.0\r\nContent-Length: 14000\r\nX: ".ljust(19996, b"x") + b"\r\n\r\n"
    server.signal(signal.SIGSTOP)
    with Client(site.port) as client:
        try:
            client.send(head.ljust(50000, b"y"))
        finally:
            server.signal(signal.SIGCONT)
        assert client.read_all() == REPLY_400
    assert logged(site) == ("  ", 400)


# --------------------------------------------------------------------------------------------- user names in the log


def user_in_log(site, *headers):
    assert site.get("/hello.htm", *headers).status == 200
    return site.access()[-1].split(" - ", 1)[1].split(" [")[0]


def basic(text):
    return "Authorization: Basic " + base64.b64encode(text).decode()


@pytest.mark.parametrize(
    "header,user",
    [
        (basic(b"ann:pw"), "ann"),
        (basic(b"ann"), "ann"),
        (basic(b"ann:p:w"), "ann"),
        (basic(b":pw"), "-"),
        (basic(b"domain\\ann:pw"), "domain\\ann"),
        (basic(b"x\n1.2.3.4 - root:pw"), "x\\x0a1.2.3.4 - root"),
        (basic(b"x\r\n\x01\x7f:pw"), "x\\x0d\\x0a\\x01\\x7f"),
        (basic(b'a"b:pw'), "a\\x22b"),
        (basic(b"ann\0x:pw"), "ann"),
        (basic(b"%s%n:pw"), "%s%n"),
        (basic(b"a" * 300 + b":pw"), "-"),
        ("Authorization:Basic " + base64.b64encode(b"ann:pw").decode(), "ann"),
        ("Authorization: Basic    " + base64.b64encode(b"ann:pw").decode(), "ann"),
        ("Authorization: basic " + base64.b64encode(b"ann:pw").decode(), "-"),
        ("authorization: Basic " + base64.b64encode(b"ann:pw").decode(), "-"),
        ("Authorization: Digest " + base64.b64encode(b"ann:pw").decode(), "-"),
        ("Proxy-Authorization: Basic " + base64.b64encode(b"pat:pw").decode(), "pat"),
        ("Authorization: Basic", "-"),
    ],
    ids=lambda value: str(value)[:50],
)
def test_the_user_in_the_access_log(site, server, header, user):
    assert user_in_log(site, header) == user


def test_a_body_is_never_searched_for_headers(site, server):
    condition = b"\r\nIf-Modified-Since: Fri, 01 Jan 2037 00:00:00 GMT\r\n"
    body = b"a=Authorization: Basic " + base64.b64encode(b"ann:pw") + condition
    assert Reply(site.raw(post(len(body), body))).status == 200
    assert " - - [" in site.access()[-1]


def test_a_url_cannot_forge_a_line(site, server):
    site.raw(b'GET /a\x01"b\x7f\t\\ HTTP/1.0\r\n\r\n')
    request = site.access()[-1].partition("] ")[2]
    assert request in (
        '"GET /a\\x01\\x22b\\x7f\\x09\\ HTTP/1.0" 404 0',
        '"GET /a\\x01\\x22b\\x7f\t\\ HTTP/1.0" 404 0',
    )
    site.raw(b'GET /hello.htm HTTP/1"0\r\n\r\n')
    size = os.path.getsize(site.web / "hello.htm")
    assert site.access()[-1].endswith(f'] "GET /hello.htm HTTP/1\\x220" 200 {size}')
    assert len(site.access()) == 2


@pytest.mark.parametrize("length,version,status", [(4095, "HTTP/1.0", 404), (8000, "HTTP/1.0", 404), (20000, "", 400)])
def test_a_long_url_is_logged_whole(site, server, length, version, status):
    """A path that is too long is refused before the version is looked at."""
    url = "/" + "u" * (length - 1)
    assert site.get(url).status == status
    assert site.access()[-1].endswith(f'] "GET {url} {version}" {status} 0')


def test_a_client_that_resets_before_sending_leaves_no_trace(site):
    site.configure(audit={"debuglevel": 7})
    server = site.serve()
    for _ in range(5):
        Client(site.port).reset()
    wait_until(lambda: sum("connected to" in line for line in site.err()) == 5, "five connections")
    with Client(site.port) as client:
        client.send(b"GET /hel")
        client.reset()
    server.wait_idle()
    assert site.access() == []
