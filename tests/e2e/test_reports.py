"""Who may see which report."""

import re

import pytest

from engines import use_python
from harness import basic
from places import ALICE, BOB, CHIEF, PLACES, fetch, furnish


@pytest.fixture
def site(site):
    return furnish(site)


def forbidden_lines(site):
    return [line for line in site.err() if "forbidden" in line]


# ------------------------------------------------------------------------------------------------ reports and users


@pytest.mark.parametrize(
    "path,alice,bob,admin,chief",
    [
        ("/reports/sales/x.htm", b"the report\n", 403, b"the report\n", b"the report\n"),
        ("/reports/sales.wlp/x.htm", b"by file\n", 403, b"by file\n", b"by file\n"),
        ("/reports/empty/x.htm", 403, 403, b"the report of nobody\n", b"the report of nobody\n"),
        ("/reports/Sales/x.htm", 403, 403, 403, 404),
        ("/reports/sales.WLP/x.htm", 403, 403, 403, 404),
        ("/reports/sales.wlp.wlp/x.htm", 403, 403, 403, 404),
        ("/reports/sale/x.htm", 403, 403, 403, 404),
        ("/reports/salesx/x.htm", 403, 403, 403, 404),
        ("/reports/%20sales/x.htm", 403, 403, 403, 404),
        ("/reports//sales/x.htm", 403, 403, 403, b"the report\n"),
        ("/reports//", 403, 403, 403, 404),
        ("/reports/", 403, 403, 403, 404),
        ("/reports/x.htm", 403, 403, 403, b"between the profiles\n"),
        ("/reports/.wlp/x.htm", 403, 403, 403, 404),
        ("/reports", 403, 403, 403, 403),
    ],
)
def test_who_may_see_which_report(site, path, alice, bob, admin, chief):
    site.serve()
    users = (ALICE, BOB, basic("admin", "secret"), CHIEF)
    assert [fetch(site, path, user) for user in users] == [alice, bob, admin, chief]


def test_a_refused_report_has_its_line_at_level_2(site):
    site.configure(audit={"debuglevel": 2})
    site.serve()
    assert fetch(site, "/reports/sales/x.htm", BOB) == 403
    assert fetch(site, "/reports/a%0Ab/x.htm", BOB) == 403
    assert fetch(site, "/reports//sales/x.htm", BOB) == 403
    assert fetch(site, "/reports") == 403
    lines = [
        "User bob requested a forbidden profile: sales",
        r"User bob requested a forbidden profile: a\x0ab",
        "User bob requested a forbidden profile: ",
        "User  requested a forbidden profile: ",
    ]
    assert forbidden_lines(site) == lines
    for line in [*lines, "Authentication failed: user anonymous."]:
        site.expect("err", re.escape(line), times=1)


def test_a_refused_report_has_no_line_at_level_1(site):
    site.serve()
    assert fetch(site, "/reports/sales/x.htm", BOB) == 403
    assert forbidden_lines(site) == []


def test_an_identifier_that_a_profile_has_exactly_comes_first(site):
    """The profile "a.wlp.wlp" is also reached as "a.wlp", unless there is a profile of that name."""
    site.add_profile("a.wlp.wlp", "alice")
    for name in ("a", "a.wlp", "a.wlp.wlp"):
        site.add_report(f"{name}/x.htm", name.encode())
    server = site.serve()
    assert [fetch(site, f"/reports/{name}/x.htm", ALICE) for name in ("a", "a.wlp", "a.wlp.wlp")] == [
        403, b"a.wlp", b"a.wlp.wlp",
    ]
    site.add_profile("a.wlp", "bob")
    server.reset()
    assert [fetch(site, f"/reports/{name}/x.htm", ALICE) for name in ("a", "a.wlp", "a.wlp.wlp")] == [
        403, 403, b"a.wlp.wlp",
    ]
    assert [fetch(site, f"/reports/{name}/x.htm", BOB) for name in ("a", "a.wlp")] == [b"a", b"a.wlp"]


@pytest.mark.parametrize(
    "users,permitted",
    [
        ("", []),
        ("alice", ["alice"]),
        ("Alice", []),
        (", alice,,bob", ["alice", "bob"]),
        ("alice , bob", ["bob"]),
        ("bob,alice", ["alice", "bob"]),
        ("al ice", []),
        ("alice;bob", []),
        ("x," * 3000 + "alice", ["alice"]),
    ],
    ids=range(9),
)
def test_the_list_of_users_in_a_profile_file(site, users, permitted):
    site.add_profile("sales.wlp", users)
    site.serve()
    seen = [name for name in ("alice", "bob") if fetch(site, "/reports/sales/x.htm", basic(name, "secret")) != 403]
    assert seen == permitted
    assert fetch(site, "/reports/sales/x.htm", basic("admin", "secret")) == b"the report\n"


# ---------------------------------------------------------------------------------------------- the anonymous user

ANONYMOUS_SEES = b"the report\n"


@pytest.fixture
def public(site):
    """The profile "sales" is open to the anonymous user, who has all permissions."""
    site.configure(audit={"debuglevel": 3})
    site.add_profile("sales.wlp", "alice,anonymous")
    site.add_user("anonymous", None, 1)
    site.allow("err", r"Authentication failed: user .*\.")
    return site


@pytest.mark.parametrize("headers", [[], [basic("nobody", "x")], [basic("alice", "wrong")], [basic("", "x")]])
def test_an_anonymous_visitor_sees_what_is_open_to_all(public, headers):
    public.serve()
    assert fetch(public, "/reports/sales/x.htm", *headers) == ANONYMOUS_SEES
    assert fetch(public, "/reports/sales/", *headers) == b"the default report\n"
    lines = [line for line in public.err() if "anonymous" in line]
    assert lines == ["Authenticating user anonymous...", "User anonymous Authenticated"] * 2


def test_an_anonymous_visitor_sees_nothing_else(public):
    """The permissions of the anonymous user count only for those who log in under that name."""
    public.serve()
    for path in ("/reports/empty/x.htm", "/reports/", "/reports//sales/x.htm", "/images/x.gif", "/deep/page.htm"):
        assert fetch(public, path) == 401
    assert fetch(public, "/reports/empty/x.htm", basic("anonymous", "")) == b"the report of nobody\n"
    assert fetch(public, "/deep/page.htm", basic("anonymous", "any")) == b"deep\n"


def test_who_is_logged_in_is_not_anonymous(public):
    public.serve()
    public.expect("err", "User bob requested a forbidden profile: sales", times=1)
    assert fetch(public, "/reports/sales/x.htm", BOB) == 403
    assert not any("anonymous" in line for line in public.err())


def test_a_locked_out_user_still_sees_what_is_open_to_all(public):
    public.serve()
    wrong = basic("alice", "wrong")
    assert [fetch(public, "/deep/page.htm", wrong) for _ in range(4)] == [401, 401, 401, "locked out"]
    public.expect("err", r"User alice locked out for 1 minutes\. Too many failed logins\.", times=1)
    before = public.err().count("Authenticating user alice...")
    assert fetch(public, "/reports/sales/x.htm", ALICE) == ANONYMOUS_SEES
    assert fetch(public, "/reports/empty/x.htm", ALICE) == "locked out"
    assert public.err().count("Authenticating user alice...") == before


def test_visits_without_a_login_lock_nobody_out(public):
    public.serve()
    for _ in range(6):
        assert fetch(public, "/reports/empty/x.htm") == 401
    assert fetch(public, "/reports/sales/x.htm") == ANONYMOUS_SEES
    assert fetch(public, "/deep/page.htm", basic("anonymous", "")) == b"deep\n"


def test_a_script_in_an_open_report_is_shown_as_a_file(public):
    """Every file of a report that is open to all is static."""
    use_python(public)
    public.serve()
    assert fetch(public, "/reports/sales/x.pl") == PLACES["oxm_oxx/datfiles/reports/sales/x.pl"]


@pytest.mark.parametrize("password", ["secret", "x"])
def test_an_anonymous_user_with_a_password_opens_nothing(public, password):
    public.add_user("anonymous", password, 1)
    public.serve()
    assert fetch(public, "/reports/sales/x.htm") == 401
    for name in ("nobody", ""):
        assert fetch(public, "/reports/sales/x.htm", basic(name, password)) == 401, "the password is not the visitor's"
    assert fetch(public, "/reports/sales/x.htm", basic("anonymous", password)) == ANONYMOUS_SEES


def test_without_an_anonymous_user_nothing_is_open(public):
    (public.users / "anonymous.usr").unlink()
    public.serve()
    assert fetch(public, "/reports/sales/x.htm") == 401
    assert fetch(public, "/reports/sales/x.htm", basic("anonymous", "")) == 401
