"""Static files and error answers, byte for byte."""

import hashlib
import os
import re
import time

import pytest

from harness import (
    DEADLINE,
    REPLY_400,
    REPLY_404,
    REPLY_413,
    Client,
    basic,
    http_time,
    parse_http_time,
    request_text,
    wait_until,
)

GIF = b"GIF89a\x01\0\x01\0\x80\0\0\0\0\0\xff\xff\xff!\xf9\x04\x01\0\0\0\0,\0\0\0\0\x01\0\x01\0\0\x02\x02D\x01\0;"
MTIME = 1700000000
LOGIN = basic("alice", "secret")  # what lies below the top directory asks for one
LAST_MODIFIED = "Tue, 14 Nov 2023 22:13:20 GMT"
THIRTY_DAYS = 2592000

DATE = rb"[A-Z][a-z]{2}, \d\d [A-Z][a-z]{2} \d{4} \d\d:\d\d:\d\d GMT"


def check_reply(raw, template, before):
    """The raw answer must equal the template, whose {date} and {expires} are the time of the answer and thirty days
    later."""
    pattern = re.escape(template).replace(rb"\{date\}", b"(" + DATE + b")").replace(rb"\{expires\}", b"(" + DATE + b")")
    match = re.fullmatch(pattern, raw, re.S)
    assert match, f"\n{raw[:600]!r}\nis not\n{template[:600]!r}"
    after = int(time.time())
    values = [parse_http_time(text.decode()) for text in match.groups()]
    assert before - 1 <= values[0] <= after  # the server may read a clock that lags by a tick
    if len(values) > 1:
        assert 0 <= values[1] - values[0] - THIRTY_DAYS <= 1


def ok_head(content_type, image=False, last_modified=LAST_MODIFIED):
    return (
        b"HTTP/1.0 200 OK\r\nServer: Orvex HTTP Server V3.5c\r\nAllow: GET, POST\r\nContent-Type: "
        + content_type.encode()
        + b"\r\nDate: {date}\r\n"
        + (b"Expires: {expires}\r\n" if image else b"")
        + b"Last-Modified: " + last_modified.encode() + b"\r\n\r\n"
    )


def check_file(site, name, content_type, *headers, url=None, image=False, content=b"some content\n", **how):
    site.page(name, content, MTIME)
    before = int(time.time())
    raw = site.raw(request_text(url or "/" + name, *headers, **how))
    check_reply(raw, ok_head(content_type, image) + content, before)


@pytest.mark.parametrize(
    "name,content_type,image",
    [
        ("a.htm", "text/html", False),
        ("a.gif", "image/gif", True),
        ("a.xls", "application/msexcel", False),
        ("a.doc", "application/msword", False),
        ("a.jar", "application/java-archive", False),
        ("a.oxw", "application/ox-docutil", False),
        ("a.html", "", False),
        ("a.HTM", "", False),
        ("a.Gif", "", False),
        ("a.jpg", "", False),
        ("a.css", "", False),
        ("a.js", "", False),
        ("a.txt", "", False),
        ("a", "", False),
        ("a.", "", False),
        ("a.gif.txt", "", False),
        ("a.txt.gif", "image/gif", True),
    ],
)
def test_the_extension_selects_the_content_type(site, server, name, content_type, image):
    check_file(site, name, content_type, image=image, content=GIF)


def test_an_empty_file_gets_the_whole_header_and_no_body(site, server):
    check_file(site, "empty.htm", "text/html", content=b"")
    check_file(site, "empty.gif", "image/gif", image=True, content=b"")
    check_file(site, "empty", "", content=b"")


def test_a_slash_at_the_end_means_the_default_file(site, server):
    check_file(site, "default.htm", "text/html", url="/")


def test_the_extension_is_that_of_the_file_and_not_of_a_directory(site):
    site.add_user("alice")
    site.serve()
    check_file(site, "a.gif/plain", "", LOGIN)


@pytest.mark.parametrize("method", ["GET", "HEAD", "POST"])
def test_every_method_gets_the_file(site, server, method):
    check_file(site, "a.htm", "text/html", method=method)


@pytest.mark.parametrize("size", [1, 20479, 20480, 20481, 40960, 65536, 1000003])
def test_files_around_the_block_size_arrive_whole(site, server, size):
    check_file(site, "a.gif", "image/gif", image=True, content=os.urandom(size))


META = b'<html><HEAD><title>x</title>%s</Head><body>y</body></html>\n'


@pytest.mark.parametrize(
    "tag,content_type",
    [
        (b'<meta http-equiv="Content-Type" content="text/html; charset=UTF-8">', "text/html; charset=utf-8"),
        (b'<META HTTP-EQUIV="CONTENT-TYPE" CONTENT="Text/HTML; charset=X-Y" />', "text/html; charset=x-y"),
        (b'<\t meta  http-equiv = "content-type"  content = " application/X"  >', "application/x"),
        (b'<meta http-equiv="Refresh" content="5">', "text/html"),
        (b'<meta name="a" content="b"><meta http-equiv="content-type" content="x/y">', "x/y"),
        (b'<meta http-equiv="content-type" content="a/b"><meta http-equiv="content-type" content="c/d">', "c/d"),
        (b'<meta http-equiv="content-type" content="">', "text/html"),
        (b'<meta http-equiv="content-type-x" content="a/b">', "a/b"),
        (b"<meta http-equiv='content-type' content='a/b'>", "text/html"),
        (b'<meta http-equiv="content-type" content="a/b', "text/html"),
        (b'<meta content="a/b" http-equiv="content-type">', "text/html"),
    ],
)
def test_a_page_declares_its_own_content_type(site, server, tag, content_type):
    check_file(site, "m.htm", content_type, content=META % tag)


@pytest.mark.parametrize(
    "content,content_type",
    [
        (b'<html><body><meta http-equiv="content-type" content="a/b"></body></html>', "text/html"),
        (b'<head></head><meta http-equiv="content-type" content="a/b">', "text/html"),
        (b'<head><meta http-equiv="content-type" content="a/b">', "text/html"),
        (b"<head>" + b" " * 2000 + b'<meta http-equiv="content-type" content="a/b"></head>', "text/html"),
        (b"<head>" + b" " * 1900 + b'<meta http-equiv="content-type" content="a/b"></head>', "a/b"),
        (b'\0<head><meta http-equiv="content-type" content="a/b"></head>', "text/html"),
        (b'<head id="x"><meta http-equiv="content-type" content="a/b"></head>', "text/html"),
    ],
    ids=["no-head", "behind-the-head", "head-not-ended", "behind-2000-bytes", "within-2000", "behind-nul", "attribute"],
)
def test_where_the_content_type_may_be_declared(site, server, content, content_type):
    check_file(site, "m.htm", content_type, content=content)


def test_a_declared_content_type_replaces_any_type(site, server):
    check_file(site, "m.txt", "a/b", content=META % b'<meta http-equiv="content-type" content="a/b">')


@pytest.mark.parametrize(
    "path", ["/absent.htm", "/hello.htm/", "/ox_remote.log", "/ox_remote.ini", "/a%2e%2e%2fb", "/x" * 4000]
)
def test_what_does_not_exist_is_not_found(site, path):
    site.add_user("alice")
    site.serve()
    site.get("/hello.htm")  # so that the access log exists
    assert site.raw(request_text(path, LOGIN)) == REPLY_404


def test_a_file_without_read_permission_is_not_found(site):
    site.use_ordinary_user()
    site.serve()
    site.page("secret.htm", b"secret").chmod(0)
    assert site.raw(request_text("/secret.htm")) == REPLY_404


def test_a_bad_request_gets_400(site, server):
    assert site.raw(b"garbage\r\n\r\n") == REPLY_400


def test_a_header_of_40000_bytes_gets_the_whole_413_every_time(site, server):
    request = b"GET /hello.htm HTTP/1.0\r\nX: ".ljust(40000, b"x")
    for _ in range(10):
        assert site.raw(request) == REPLY_413
    assert len(site.access()) == 10


def test_a_post_of_3_megabytes_gets_the_whole_413_every_time(site, server):
    request = b"POST /hello.htm HTTP/1.0\r\nContent-Length: 3000000\r\n\r\n" + b"x" * 3000000
    for _ in range(10):
        assert site.raw(request) == REPLY_413
    assert all(line.endswith('"  " 413 0') for line in site.access())


def test_an_ordinary_http_client_reads_the_413(site, server):
    import http.client

    for _ in range(10):
        connection = http.client.HTTPConnection("127.0.0.1", site.port, timeout=DEADLINE)
        connection.request("POST", "/hello.htm", body=b"x" * 3000000)
        reply = connection.getresponse()
        assert (reply.status, reply.read()) == (413, REPLY_413.partition(b"\r\n\r\n")[2])
        connection.close()


# ------------------------------------------------------------------------------------------- conditional requests


def not_modified(image):
    return (
        b"HTTP/1.0 304 Not Modified\r\nDate: {date}\r\n"
        + (b"Expires: {expires}\r\n" if image else b"")
        + b"Server: Orvex HTTP Server V3.5c\r\n\r\n"
    )


@pytest.mark.parametrize("name,image", [("a.htm", False), ("a.gif", True), ("a.txt", False)])
@pytest.mark.parametrize(
    "value",
    [
        LAST_MODIFIED,
        http_time(MTIME + 1),
        "Tuesday, 14-Nov-23 22:13:20 GMT",
        "Tue Nov 14 22:13:20 2023",
        LAST_MODIFIED + "; length=33",
        "Fri, 01 Jan 2037 00:00:00 GMT",
    ],
)
def test_an_unchanged_file_gets_304(site, server, name, image, value):
    site.page(name, b"content", MTIME)
    before = int(time.time())
    raw = site.raw(request_text("/" + name, f"If-Modified-Since: {value}"))
    check_reply(raw, not_modified(image), before)


@pytest.mark.parametrize(
    "value",
    [
        http_time(MTIME - 1),
        "Tuesday, 14-Nov-23 22:13:19 GMT",
        "Tue Nov 14 22:13:19 2023",
        "Tue, 14 Xyz 2023 22:13:20 GMT",
        "yesterday",
        "Tue, 14 Nov 2023 22:13:20 GM",
        "Tue, 14 Nov 2023 24:00:00 GMT",
        "0",
    ],
)
def test_a_changed_file_or_a_date_that_is_none_gets_200(site, server, value):
    site.page("a.htm", b"content", MTIME)
    before = int(time.time())
    raw = site.raw(request_text("/a.htm", f"If-Modified-Since: {value}"))
    check_reply(raw, ok_head("text/html") + b"content", before)


def test_a_conditional_request_for_an_absent_file_gets_404(site, server):
    assert site.raw(request_text("/absent.gif", f"If-Modified-Since: {LAST_MODIFIED}")) == REPLY_404


def test_the_condition_is_found_only_in_its_exact_spelling(site, server):
    site.page("a.htm", b"content", MTIME)
    assert site.get("/a.htm", f"if-modified-since: {LAST_MODIFIED}").status == 200
    assert site.get("/a.htm", f"If-Modified-Since : {LAST_MODIFIED}").status == 200
    assert site.get("/a.htm", f"X-If-Modified-Since:{LAST_MODIFIED}").status == 304


def test_the_last_modified_text_of_a_reply_gives_304_when_sent_back(site, server):
    for name in ("hello.htm", "default.htm"):
        value = site.get("/" + name).header("Last-Modified")
        assert site.get("/" + name, f"If-Modified-Since: {value}").status == 304


def test_without_caching_a_condition_is_ignored(site):
    site.configure(web={"WebNoCache": 1})
    site.serve()
    site.page("a.gif", b"content", MTIME)
    before = int(time.time())
    raw = site.raw(request_text("/a.gif", f"If-Modified-Since: {LAST_MODIFIED}"))
    check_reply(raw, ok_head("image/gif", image=True) + b"content", before)
    assert site.raw(request_text("/absent.gif", f"If-Modified-Since: {LAST_MODIFIED}")) == REPLY_404


# -------------------------------------------------------------------------------------------- not plain files, sizes


def test_a_directory_without_a_slash_gets_an_empty_answer_and_a_line(site, server):
    (site.web / "dir").mkdir()
    assert site.raw(request_text("/dir")) == b""
    assert site.get("/hello.htm").status == 200
    site.expect("err", r"Reply error reading file - handle = \d+", times=1)


def test_a_directory_without_a_default_file_is_not_found(site):
    site.add_user("alice")
    site.serve()
    (site.web / "dir").mkdir()
    assert site.raw(request_text("/dir/", LOGIN)) == REPLY_404


def test_a_fifo_holds_nobody_up(site, server):
    os.mkfifo(site.web / "fifo.htm", 0o644)
    os.utime(site.web / "fifo.htm", (MTIME, MTIME))
    before = int(time.time())
    check_reply(site.raw(request_text("/fifo.htm"), timeout=DEADLINE), ok_head("text/html"), before)
    assert site.get("/hello.htm").status == 200


def test_a_sparse_file_of_3_gigabytes_is_served(site, server):
    path = site.page("huge.gif", b"first bytes", MTIME)
    os.truncate(path, 3 << 30)
    os.utime(path, (MTIME, MTIME))
    before = int(time.time())
    with Client(site.port) as client:
        client.send(request_text("/huge.gif"))
        data = client.receive_exactly(300000)
    head, _, body = data.partition(b"\r\n\r\n")
    check_reply(head + b"\r\n\r\n", ok_head("image/gif", image=True), before)
    assert body == b"first bytes" + b"\0" * (len(body) - 11)
    wait_until(lambda: len(site.access()) == 1, "the end of the session")
    assert site.get("/hello.htm").status == 200
    site.expect("err", r"Reply error writing to socket - socket error = (32|104)", times=1)


def test_a_large_file_reaches_a_slow_reader_whole(site, server):
    content = os.urandom(1 << 20) * 24
    site.page("large.bin", content, MTIME)
    digest = hashlib.sha256()
    count = 0
    with Client(site.port, receive_buffer=8192) as client:
        client.send(request_text("/large.bin"))
        head = b""
        while b"\r\n\r\n" not in head:
            block = client.receive(100)
            assert block
            head += block
        body = head.partition(b"\r\n\r\n")[2]
        while body:
            digest.update(body)
            count += len(body)
            body = client.receive(7777)
            if count % 64 == 0:
                time.sleep(0.001)  # the slowness of the reader is the point
    assert count == len(content)
    assert digest.digest() == hashlib.sha256(content).digest()
    assert site.access()[0].endswith(f'"GET /large.bin HTTP/1.0" 200 {len(content)}')


def test_a_client_that_leaves_in_the_middle_harms_nobody(site, server):
    site.page("large.bin", b"x" * 30_000_000)
    for reset in (True, False):
        client = Client(site.port, receive_buffer=8192)
        client.send(request_text("/large.bin"))
        client.receive_exactly(1000)
        client.reset() if reset else client.close()
    wait_until(lambda: len(site.access()) == 2, "the end of both sessions")
    assert site.get("/hello.htm").status == 200
    site.expect("err", r"Reply error writing to socket - socket error = (32|104)", times=2)
