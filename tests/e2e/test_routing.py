"""Where each URL leads, and the settings that the places come from."""

import os
import re

import pytest

from engines import script, use_python
from harness import REPLY_404, basic, request_text
from places import ALICE, BOB, CHIEF, PLACES, fetch, furnish


@pytest.fixture
def site(site):
    return furnish(site)


# ------------------------------------------------------------------------------------------------- where URLs lead


@pytest.mark.parametrize(
    "path,file",
    [
        ("/top.htm", "wwwroot/top.htm"),
        ("/deep/page.htm", "wwwroot/deep/page.htm"),
        ("/deep%2Fpage.htm", "wwwroot/deep/page.htm"),
        ("//deep//page.htm", "wwwroot/deep/page.htm"),
        ("/images/x.gif", "wwwroot/images/x.gif"),
        ("/reports.htm", "wwwroot/reports.htm"),
        ("/reportsX/x.htm", "wwwroot/reportsX/x.htm"),
        ("/reports/sales/x.htm", "oxm_oxx/datfiles/reports/sales/x.htm"),
        ("/reports/sales/x.htm?a=/../b", "oxm_oxx/datfiles/reports/sales/x.htm"),
        ("/reports%2Fsales%2fx.htm", "oxm_oxx/datfiles/reports/sales/x.htm"),
        ("/r%65ports/s%61les/x.htm", "oxm_oxx/datfiles/reports/sales/x.htm"),
        ("/reports/sales/deep/x.gif", "oxm_oxx/datfiles/reports/sales/deep/x.gif"),
        ("/reports/sales/", "oxm_oxx/datfiles/reports/sales/default.htm"),
        ("/reports/sales.wlp/x.htm", "oxm_oxx/datfiles/reports/sales.wlp/x.htm"),
        ("//reports/sales/x.htm", "wwwroot/reports/sales/x.htm"),
        ("/Reports/sales/x.htm", None),
        ("/cgi-bin/page.htm", None),
        ("/scripts/page.htm", None),
        ("/oxm_oxx/oxm_oxx.ini", None),
        ("/users/alice.usr", None),
        ("/deep/absent.htm", None),
        ("/reports/sales/absent.htm", None),
    ],
)
def test_the_places(site, path, file):
    site.serve()
    content = 404 if file is None else PLACES[file]
    assert fetch(site, path, ALICE) == content
    is_top = path.split("?")[0].replace("%2F", "/").count("/") == 1
    assert fetch(site, path) == (content if is_top else 401)


@pytest.mark.parametrize(
    "path",
    [
        "/../top.htm",
        "/deep/../top.htm",
        "/a/../b.pl",
        "/reports/sales/../x.pl",
        "/deep/../../ox_remote.ini",
        "/a../b",
        "/a%2e%2e%2Fb",
        "/..%2f",
        "/reports/sales/../../users/alice.usr",
        "/reports/../x.htm",
        "/public.pl/../x",
        "/cgi-bin/../../ox_remote.ini",
        "/deep/..//x",
    ],
)
def test_what_climbs_is_not_found_before_anybody_is_asked(site, path):
    site.configure(audit={"debuglevel": 3})
    site.serve()
    for headers in ([], [CHIEF], [basic("nobody", "x")], [basic("anonymous", "")]):
        assert site.raw(request_text(path, *headers)) == REPLY_404
    assert not any("uthenticat" in line for line in site.err())


@pytest.mark.parametrize(
    "path,content",
    [
        ("/top.htm%00.gif", b"top\n"),
        ("/top.htm%00/../../x", b"top\n"),
        ("/top.htm%00/deep/page.htm", b"top\n"),
        ("/reports/sales/x.htm%00/../../../users/alice.usr", b"the report\n"),
        ("/reports/sales/%00x.htm", b"the default report\n"),
        ("/deep/page%00.htm", 404),
    ],
)
def test_a_nul_ends_the_path(site, path, content):
    site.serve()
    assert fetch(site, path, ALICE) == content
    assert fetch(site, "/reports/empty/x.htm%00/../sales/", ALICE) == 403


def test_the_type_of_a_path_with_a_nul_is_that_of_the_file(site):
    site.serve()
    assert site.get("/top.htm%00.gif").header("Content-Type") == "text/html"
    assert "Expires" not in site.get("/top.htm%00.gif").names()


# ------------------------------------------------------------------------------------------- the two login scripts


@pytest.mark.parametrize(
    "path,headers,answer",
    [
        ("/public.pl", [], 401),
        ("/public.pl", [ALICE], 401),
        ("/public.pl", [basic("", "x")], 401),
        ("/public.pl", [basic("Anonymous", "")], 401),
        ("/public.pl?a=b", [ALICE], 401),
        ("/public%2Epl", [ALICE], 401),
        ("/public.pl%00x", [ALICE], 401),
        ("/public.pl", [basic("anonymous", "")], b"public"),
        ("/public.pl", [basic("anonymous", "any")], b"public"),
        ("/private.pl", [], b"private"),
        ("/private.pl", [ALICE], b"private"),
        ("/private.pl", [basic("alice", "wrong")], b"private"),
        ("/private.pl", [basic("Anonymous", "")], b"private"),
        ("/private.pl", [basic("anonymous", "")], 401),
        ("/private.pl?a=b", [basic("anonymous", "x")], 401),
        ("/Public.pl", [ALICE], b"Public"),
        ("/tools/public.pl", [ALICE], b"tools/public"),
    ],
)
def test_the_scripts_that_make_a_browser_log_in_again(site, path, headers, answer):
    """The one drops a named login, the other an anonymous one; neither checks a password."""
    use_python(site)
    for name in ("public", "private", "Public", "tools/public"):
        script(site, f"{name}.pl", f"output({name!r})\n")
    site.configure(audit={"debuglevel": 3})
    site.serve()
    assert fetch(site, path, *headers) == answer
    if "tools" not in path:
        assert not any("uthenticat" in line for line in site.err())
    assert any("requested on session thread" in line for line in site.err()) == (answer != 401)


@pytest.mark.parametrize(
    "path,login", [("/public.pl", basic("anonymous", "")), ("/private.pl", ALICE)], ids=["public", "private"]
)
def test_the_scripts_that_were_let_through_get_no_parameters(site, path, login):
    use_python(site)
    script(site, path[1:], "output(args[8])\n")
    site.serve()
    assert fetch(site, path, login) == b"NULL"


# --------------------------------------------------------------------------------------------------- other scripts


@pytest.mark.parametrize("path", ["/reports/sales/y.pl", "/reports/y.pl", "/images/x.pl", "/deep/x.pl"])
def test_a_script_below_the_top_runs_for_whoever_is_logged_in(site, path):
    """Also one among the reports, which belongs to the web root and to no profile."""
    use_python(site)
    script(site, path[1:], "output(args[2] + ' ' + args[8])\n")
    site.add_report(path.removeprefix("/reports/"), b"not this one\n")
    site.configure(audit={"debuglevel": 2})
    site.serve()
    assert fetch(site, path) == 401
    for login, parameters in ((ALICE, "username=alice&permissions=2"), (BOB, "username=bob&permissions=0")):
        assert fetch(site, path, login).decode() == f"{site.root}/wwwroot{path} {parameters}"
    assert not any("forbidden" in line for line in site.err())
    site.allow("err", r"Authentication failed: user anonymous\.")


# -------------------------------------------------------------------------------------------------- the settings


def setup_lines(site):
    wanted = ("User database", "Log analysis", "Profile configuration", "Unable to open", "Starting server")
    return [line for line in site.err() if line.startswith(wanted)]


def test_the_lines_of_the_set_up_at_the_start_and_at_each_reset(any_site):
    site = any_site
    site.configure(audit={"debuglevel": 3})
    server = site.serve()
    start = f"Starting server: connecting to 127.0.0.1 on port {site.port}."
    lines = [
        f"User database directory: {site.users}.",
        f"Log analysis configuration file: {site.main_ini}.",
        f"Profile configuration file: {site.root}/./profiles.",
    ]
    assert setup_lines(site) == [*lines, start]
    others = site.root / "others"
    site.configure(web={"userspath": others})
    site.main_ini.write_text(f"[interface]\nersaddress=127.0.0.1:1\n[defaults]\nprofilesdir={others}\n")
    server.reset()
    lines += [
        start,
        f"User database directory not found: {others}",
        f"Log analysis configuration file: {site.main_ini}.",
        f"Profile configuration file: {others}.",
    ]
    assert setup_lines(site) == [*lines, start]
    site.expect("err", re.escape(f"User database directory not found: {others}"), times=1)
    site.configure(web={"userspath": None})
    site.main_ini.write_text("[interface]\nersaddress=127.0.0.1:1\n")
    server.reset()
    lines += [start, *lines[:2], "Profile configuration file: ."]
    assert setup_lines(site) == [*lines, start]


def test_the_set_up_says_nothing_at_level_2(site):
    site.configure(audit={"debuglevel": 2})
    site.serve()
    assert setup_lines(site) == [f"Starting server: connecting to 127.0.0.1 on port {site.port}."]


def test_an_absent_main_settings_file_is_named_and_refuses_the_reports(site):
    server = site.serve()
    assert fetch(site, "/reports/sales/x.htm", ALICE) == b"the report\n"
    text = site.main_ini.read_text()
    site.main_ini.unlink()
    server.reset()
    line = f"Unable to open the log analysis configuration file, {site.main_ini}."
    assert site.err().count(line) == 1
    site.expect("err", re.escape(line), times=1)
    assert [fetch(site, "/reports/sales/x.htm", user) for user in (ALICE, CHIEF)] == [403, b"the report\n"]
    assert fetch(site, "/top.htm") == b"top\n"
    site.main_ini.write_text(text)
    server.reset()
    assert fetch(site, "/reports/sales/x.htm", ALICE) == b"the report\n"


@pytest.mark.parametrize(
    "value,line",
    [("profiles", "profiles"), (".hid", "{}/.hid"), ("../p", "{}/../p"), (".", "{}/."), ("./profiles", "{}/./profiles")],
)
def test_a_directory_of_profiles_that_begins_with_a_dot_lies_below_the_installation(site, value, line):
    """Another one is taken as it is: where it is relative, it belongs to the working directory."""
    site.configure(audit={"debuglevel": 3})
    (site.root / "profiles/sales.wlp").unlink()
    site.add_profile("sales.wlp", "bob", directory=value)
    site.main_ini.write_text(f"[interface]\nersaddress=127.0.0.1:1\n[defaults]\nprofilesdir={value}\n")
    site.serve()
    assert setup_lines(site)[2] == f"Profile configuration file: {line.format(site.root)}."
    assert [fetch(site, "/reports/sales/x.htm", user) for user in (ALICE, BOB)] == [403, b"the report\n"]
    site.expect("err", "User alice requested a forbidden profile: sales", times=1)


def test_a_reset_takes_another_directory_of_profiles(site):
    server = site.serve()
    assert [fetch(site, "/reports/sales/x.htm", user) for user in (ALICE, BOB)] == [b"the report\n", 403]
    site.add_profile("sales.wlp", "bob", directory="others")
    server.reset()
    assert [fetch(site, "/reports/sales/x.htm", user) for user in (ALICE, BOB)] == [403, b"the report\n"]


@pytest.mark.parametrize("value", [None, "", "./absent", "./ox_remote.ini"], ids=["unset", "empty", "missing", "file"])
def test_a_reset_that_finds_no_profiles_takes_the_reports_away(site, value):
    """From users without bit 0; their logins stay good."""
    server = site.serve()
    assert [fetch(site, "/reports/sales/x.htm", user) for user in (ALICE, CHIEF)] == [b"the report\n"] * 2
    text = site.main_ini.read_text()
    setting = "" if value is None else f"profilesdir={value}\n"
    site.main_ini.write_text(f"[interface]\nersaddress=127.0.0.1:1\n[defaults]\n{setting}")
    server.reset()
    assert [fetch(site, "/reports/sales/x.htm", user) for user in (ALICE, CHIEF)] == [403, b"the report\n"]
    assert fetch(site, "/deep/page.htm", ALICE) == PLACES["wwwroot/deep/page.htm"]
    site.main_ini.write_text(text)
    server.reset()
    assert [fetch(site, "/reports/sales/x.htm", user) for user in (ALICE, CHIEF)] == [b"the report\n"] * 2


def test_a_reset_with_an_unreadable_main_settings_file_takes_the_reports_away(site):
    site.use_ordinary_user()
    server = site.serve()
    assert [fetch(site, "/reports/sales/x.htm", user) for user in (ALICE, CHIEF)] == [b"the report\n"] * 2
    site.main_ini.chmod(0)
    server.reset()
    assert [fetch(site, "/reports/sales/x.htm", user) for user in (ALICE, CHIEF)] == [403, b"the report\n"]
    site.expect("err", re.escape(f"Unable to open the log analysis configuration file, {site.main_ini}."), times=1)
    site.main_ini.chmod(0o644)
    server.reset()
    assert fetch(site, "/reports/sales/x.htm", ALICE) == b"the report\n"


@pytest.mark.parametrize("kind", ["unset", "empty", "missing", "file", "no-profiles"])
def test_without_profiles_only_bit_0_opens_reports(site, kind):
    value = {"empty": "profilesdir=", "missing": "profilesdir=./absent", "file": "profilesdir=./ox_remote.ini",
             "no-profiles": "profilesdir=./scripts"}.get(kind, "")
    site.main_ini.write_text(f"[interface]\nersaddress=127.0.0.1:1\n[defaults]\n{value}\n")
    site.serve()
    assert [fetch(site, "/reports/sales/x.htm", user) for user in (ALICE, BOB, CHIEF)] == [403, 403, b"the report\n"]
    assert fetch(site, "/reports/sales/x.htm", basic("admin", "secret")) == 403


def test_what_is_no_profile_file_holds_nobody_up(site):
    profiles = site.root / "profiles"
    os.mkfifo(profiles / "fifo.wlp")
    (profiles / "directory.wlp").mkdir()
    (profiles / "loop.wlp").symlink_to("loop.wlp")
    (profiles / ".hidden.wlp").write_text("[Profile]\nUsers=alice\n")
    (profiles / "sales.wlp.bak").write_text("[Profile]\nUsers=bob\n")
    (profiles / "other.wlp").write_text("[Else]\nUsers=alice\n")
    site.serve()
    assert fetch(site, "/reports/sales/x.htm", ALICE) == b"the report\n"
    assert fetch(site, "/reports/sales/x.htm", BOB) == 403
    for name in ("fifo", "directory", "loop", ".hidden", "other", "sales.wlp.bak"):
        assert fetch(site, f"/reports/{name}/x.htm", ALICE) == 403
