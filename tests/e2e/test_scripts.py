"""From the URL of a script to its page: what the engine is given, and what the browser gets."""

import hashlib
import os
import re

import pytest

from engines import (
    REPLY_500,
    REPLY_500_SCRIPT,
    check_page,
    output_files,
    post,
    script,
    use_python,
)
from harness import REPLY_401, REPLY_404, Background, Client, basic, mode_of, request_text, wait_until

DUMP = "output(repr(args))\n"
ECHO = "output(b'%s|' % args[7].encode() + body())\n"


@pytest.fixture
def site(site):
    use_python(site)
    return site


def arguments(site, number, path, parameters, length=0):
    """The whole command line of the engine for the number-th script request."""
    return [
        f"{site.root}/ox_script.bin",
        "OX_WEBSERVER",
        f"{site.root}/{path}",
        "NULL",
        f"./.oxscript:{number}",
        f"{site.root}/ox_script",
        f"{site.root}",
        str(length),
        parameters,
    ]


def dumped(site, url, *headers):
    reply = site.get(url, *headers)
    assert reply.status == 200, reply.raw
    return eval(reply.body)  # what the test's own script wrote


# --------------------------------------------------------------------------------------------------- the arguments


def test_a_script_at_the_top_gets_no_parameters_also_with_a_login(site):
    script(site, "dump.pl", DUMP)
    site.add_user("alice", "secret", 3)
    site.serve()
    assert dumped(site, "/dump.pl") == arguments(site, 1, "wwwroot/dump.pl", "NULL")
    assert dumped(site, "/dump.pl", basic("alice", "secret")) == arguments(site, 2, "wwwroot/dump.pl", "NULL")
    assert dumped(site, "/dump.pl", basic("nobody", "x")) == arguments(site, 3, "wwwroot/dump.pl", "NULL")


def test_a_script_below_the_top_gets_the_user_and_the_permissions(site):
    script(site, "tools/dump.pl", DUMP)
    site.add_user("alice", "secret", 3)
    site.serve()
    assert site.raw(request_text("/tools/dump.pl")) == REPLY_401
    assert site.get("/tools/dump.pl", basic("alice", "wrong")).status == 401
    expected = arguments(site, 1, "wwwroot/tools/dump.pl", "username=alice&permissions=3")
    assert dumped(site, "/tools/dump.pl", basic("alice", "secret")) == expected


def test_the_query_is_never_mixed_into_the_parameters(site):
    script(site, "tools/dump.pl", DUMP)
    site.add_user("alice", "secret", 0)
    site.serve()
    query = "username=admin&permissions=1"
    got = dumped(site, "/tools/dump.pl?" + query, basic("alice", "secret"))
    parameters = "username=alice&permissions=0"
    assert got == arguments(site, 1, "wwwroot/tools/dump.pl", parameters, length=len(query))


def test_a_name_that_would_come_apart_is_escaped(site):
    """Such names are only found in user files written by hand."""
    script(site, "tools/dump.pl", DUMP)
    site.add_user("bob smith&permissions=1", "secret", 0, file="x.usr")
    site.serve()
    got = dumped(site, "/tools/dump.pl", basic("bob smith&permissions=1", "secret"))
    assert got[8:] == ["username=bob%20smith%26permissions%3D1&permissions=0"]


def test_cgi_bin_leads_to_the_scripts_directory(site):
    site.add_user("alice", "secret", 1)
    for name in ("run.pl", "sub/run.pl"):
        path = site.root / "scripts" / name
        path.parent.mkdir(exist_ok=True)
        path.write_text(DUMP)
    script(site, "cgi-bin/run.pl", "raise SystemExit(5)\n")
    site.serve()
    assert site.get("/cgi-bin/run.pl").status == 401
    parameters = "username=alice&permissions=1"
    login = basic("alice", "secret")
    assert dumped(site, "/cgi-bin/run.pl", login) == arguments(site, 1, "scripts/run.pl", parameters)
    assert dumped(site, "/cgi-bin/sub/run.pl", login) == arguments(site, 2, "scripts/sub/run.pl", parameters)


@pytest.mark.parametrize("name", ["cgi-binX.pl", "cgi-bin.pl", "cgi-binX/run.pl"])
def test_what_only_begins_like_cgi_bin_stays_in_the_web_root(site, name):
    """The scripts directory's neighbours are out of reach."""
    site.add_user("alice", "secret", 1)
    neighbour = site.root / name.replace("cgi-bin", "scripts", 1)
    neighbour.parent.mkdir(exist_ok=True)
    neighbour.write_text(DUMP)
    site.serve()
    assert site.raw(request_text(f"/{name}", basic("alice", "secret"))) == REPLY_404
    script(site, name, DUMP)
    assert dumped(site, f"/{name}", basic("alice", "secret"))[2] == f"{site.root}/wwwroot/{name}"


def test_the_script_is_named_in_the_log_at_level_3(site):
    script(site, "dump.pl", DUMP)
    site.configure(audit={"debuglevel": 3})
    site.serve()
    site.get("/dump.pl")
    lines = [line for line in site.err() if line.startswith("Script ")]
    assert len(lines) == 1
    assert re.fullmatch(rf"Script \[{site.root}/wwwroot/dump\.pl\] requested on session thread 0x[0-9A-F]+\.", lines[0])


def test_the_script_is_not_named_at_level_2(site):
    script(site, "dump.pl", DUMP)
    site.configure(audit={"debuglevel": 2})
    site.serve()
    site.get("/dump.pl")
    assert not any("Script" in line for line in site.err())


# ------------------------------------------------------------------------------------------------ the script's input


def test_the_query_reaches_the_input_as_it_was_sent(site):
    script(site, "echo.pl", ECHO)
    site.serve()
    assert site.get("/echo.pl?a=%41+b&c=%00%zz?d").body == b"18|a=%41+b&c=%00%zz?d"
    assert site.get("/echo.pl?").body == b"0|"
    assert site.get("/echo.pl").body == b"0|"


BODIES = [b"x=1&y", b"a\0b", b"\0", bytes(range(256)) * 8, b"EXIT", os.urandom(70_000), os.urandom(1 << 20)]


@pytest.mark.parametrize("body", BODIES, ids=lambda body: f"{len(body)}-bytes")
def test_a_posted_body_reaches_the_input_whole(site, body):
    """The announced length is exactly the number of the bytes, NULs included."""
    script(site, "echo.pl", ECHO)
    site.serve()
    assert post(site, "/echo.pl", body).body == b"%d|" % len(body) + body


def test_the_largest_body_reaches_the_input_and_a_larger_one_is_refused(site):
    script(site, "echo.pl", "import hashlib\noutput(hashlib.sha256(body()).hexdigest())\n")
    site.serve()
    body = os.urandom(2_064_384)
    assert post(site, "/echo.pl", body).body.decode() == hashlib.sha256(body).hexdigest()
    assert post(site, "/echo.pl", body + b"x").status == 413


def test_a_query_counts_before_a_body(site):
    script(site, "echo.pl", ECHO)
    site.serve()
    assert post(site, "/echo.pl?z=2", b"x=1").body == b"3|z=2"


def test_sixteen_bodies_with_nul_bytes_hold_no_slot(site):
    script(site, "echo.pl", ECHO)
    site.serve()
    body = b"\0" * 100
    Background(lambda _: [post(site, "/echo.pl", body) for _ in range(3)], 16).join()
    assert post(site, "/echo.pl", body).body == b"100|" + body


# ----------------------------------------------------------------------------------------------------------- the page


def test_the_page_comes_with_the_headers_of_a_page_that_nobody_keeps(site):
    script(site, "page.pl", "output('<html>page</html>')\n")
    script(site, "empty.pl", "")
    script(site, "big.pl", "output(b'0123456789abcdef' * 200_000)\n")
    script(site, "exit.pl", "output('before')\nsay_exit()\noutput(' and after')\n")
    site.serve()
    check_page(site.raw(request_text("/page.pl")), b"<html>page</html>")
    check_page(site.raw(request_text("/page.pl", "If-Modified-Since: Fri, 01 Jan 2038 00:00:00 GMT")),
               b"<html>page</html>")
    check_page(site.raw(request_text("/empty.pl")), b"")
    check_page(site.raw(request_text("/big.pl")), b"0123456789abcdef" * 200_000)
    check_page(site.raw(request_text("/exit.pl")), b"before and after")
    assert [int(line.rpartition(" ")[2]) for line in site.access()] == [17, 17, 0, 3_200_000, 16]


def test_a_page_may_declare_its_own_type(site):
    page = b'<html><head><meta http-equiv="Content-Type" content="text/html; charset=utf-8"></head></html>'
    script(site, "page.pl", f"output({page!r})\n")
    site.serve()
    check_page(site.raw(request_text("/page.pl")), page, content_type=b"text/html; charset=utf-8")


def test_a_page_that_was_put_in_the_place_of_the_output_file_is_not_seen(site):
    """The server reads the file that it opened itself."""
    script(site, "page.pl", "open('beside', 'w').write('page')\nos.rename('beside', args[4])\n")
    site.serve()
    check_page(site.raw(request_text("/page.pl")), b"")
    wait_until(lambda: output_files(site) == [], "the file is removed")


def test_scripts_are_numbered_in_hexadecimal_and_their_files_are_gone_afterwards(site):
    script(site, "name.pl", "output(args[4])\n")
    server = site.serve()
    names = [site.get("/name.pl").body.decode() for _ in range(17)]
    assert names == [f"./.oxscript:{number:x}" for number in range(1, 18)]
    server.wait_idle()
    assert output_files(site) == []


def test_the_output_file_while_the_script_runs(site):
    script(site, "wait.pl", "open('runs', 'w').close()\nwhile os.path.exists('runs'): time.sleep(0.005)\n")
    site.serve()
    with Client(site.port) as client:
        client.send(request_text("/wait.pl"))
        wait_until(lambda: (site.root / "runs").exists(), "the script runs")
        assert output_files(site) == [".oxscript:1"]
        assert mode_of(site.root / ".oxscript:1") == 0o664
        assert (site.root / ".oxscript:1").stat().st_size == 0
        (site.root / "runs").unlink()
        check_page(client.read_all(), b"")
    wait_until(lambda: output_files(site) == [], "the file is removed")


def test_a_client_that_goes_away_leaves_no_output_file(site):
    script(site, "big.pl", "output(b'x' * 5_000_000)\n")
    server = site.serve()
    for _ in range(5):
        client = Client(site.port, receive_buffer=4096)
        client.send(request_text("/big.pl"))
        client.receive(100)
        client.reset()
    server.wait_idle()
    assert output_files(site) == []
    site.allow("err", r"Reply error writing to socket - socket error = \d+")


def test_two_requests_for_one_script_write_to_different_files(site):
    script(site, "name.pl", "open(args[4] + '.runs', 'w').close()\n"
           "while not os.path.exists('go'): time.sleep(0.005)\noutput(args[4])\n")
    site.serve()
    pages = []
    load = Background(lambda _: pages.append(site.get("/name.pl").body), 2)
    wait_until(lambda: len(list(site.root.glob(".oxscript:*.runs"))) == 2, "both run")
    (site.root / "go").touch()
    load.join()
    assert sorted(pages) == [b"./.oxscript:1", b"./.oxscript:2"]


def test_a_link_in_the_place_of_the_output_file_is_not_followed(site):
    victim = site.scratch / "victim"
    victim.write_text("untouched")
    (site.root / ".oxscript:1").symlink_to(victim)
    (site.root / ".oxscript:2").write_text("of an earlier server")
    script(site, "page.pl", "output('page')\n")
    site.serve()
    check_page(site.raw(request_text("/page.pl")), b"page")
    check_page(site.raw(request_text("/page.pl")), b"page")
    assert victim.read_text() == "untouched" and not victim.is_symlink()
    wait_until(lambda: output_files(site) == [], "the files are removed")


def test_an_output_file_that_cannot_be_made_is_a_server_error(site):
    (site.root / ".oxscript:1").mkdir()
    script(site, "page.pl", "output('page')\n")
    site.serve()
    assert site.raw(request_text("/page.pl")) == REPLY_500
    check_page(site.raw(request_text("/page.pl")), b"page")


# ------------------------------------------------------------------------------------------- scripts that are not run


def test_a_script_that_is_not_there_is_not_found(site):
    site.serve()
    assert site.raw(request_text("/none.pl")) == REPLY_404
    assert site.raw(request_text("/none.pl", method="POST")) == REPLY_404


@pytest.mark.parametrize(
    "name,url",
    [
        ("a b.pl", "/a%20b.pl"),
        ("a\tb.pl", "/a%09b.pl"),
        ("a\nb.pl", "/a%0Ab.pl"),
        ("a\x01b.pl", "/a%01b.pl"),
        ("a\x7fb.pl", "/a%7Fb.pl"),
        (" .pl", "/%20.pl"),
    ],
)
def test_a_blank_or_control_character_in_the_path_of_a_script_is_not_found(site, name, url):
    script(site, name, "output('page')\n")
    site.serve()
    assert site.raw(request_text(url)) == REPLY_404


@pytest.mark.parametrize(
    "url", ["/page.pl%00.gif", "/page.pl%00", "/page.pl%00.htm", "/page.pl%00/x.gif", "/page%2Epl%00x.txt"]
)
def test_a_nul_in_the_path_never_shows_the_text_of_a_script(site, url):
    """The path ends at the NUL: the script is run."""
    script(site, "page.pl", "output('the page')  # the text\n")
    site.serve()
    check_page(site.raw(request_text(url)), b"the page")


@pytest.mark.parametrize("debuglevel", [1, 3])
def test_a_very_long_script_path_is_not_found(site, debuglevel):
    site.configure(audit={"debuglevel": debuglevel})
    site.serve()
    for length in (300, 4100, 8000):
        assert site.raw(request_text("/" + "x" * length + ".pl")) == REPLY_404
    assert all(len(line) < 4200 for line in site.err())
    site.allow("err", r"Script \[\S{3900,}")


def test_a_directory_with_the_name_of_a_script_is_the_engine_s_affair(site):
    (site.web / "dir.pl").mkdir()
    site.serve()
    assert site.raw(request_text("/dir.pl")) == REPLY_500_SCRIPT
    site.expect("status", "Traceback .*", times=1)
    site.expect("status", "  .*")
    site.expect("status", "IsADirectoryError: .*", times=1)
