"""One user from the first day to the last, as the administrator's scripts and the user's browser see it."""

from engines import call, no_remote_service, script, use_steps
from harness import basic
from places import fetch, furnish

ADD, DELETE, LIST, CHANGE, GET = 20, 21, 22, 23, 24
LIST_PROFILES, TEST_PROFILE, REFRESH_PROFILE = 30, 31, 32
DONE, FAILED = 0, -1

SALES, EMPTY, OWN_PAGE = "/reports/sales/x.htm", "/reports/empty/x.htm", "/own/page.pl"


def test_a_users_whole_life(site):
    furnish(site)
    use_steps(site)
    no_remote_service(site)
    script(site, "own/page.pl", "output(args[8])\n")
    server = site.serve()
    profile = site.root / "profiles" / "sales.wlp"
    first, second = basic("dora", "first word"), basic("dora", "second")

    def dora_sees(*paths):
        return [fetch(site, path, first) for path in paths]

    # Nobody knows the name; the script of an administrator adds it.
    assert dora_sees(SALES, OWN_PAGE) == [401, 401]
    assert call(site, GET, "", "username=dora") == (FAILED, "")
    assert call(site, ADD, "", "username=dora&password=first+word&permissions=4") == (DONE, "")
    assert (site.users / "dora.usr").exists()

    # Logged in, with pages of the web root and scripts that are told who asks, and without any report.
    assert dora_sees("/deep/page.htm", OWN_PAGE) == [b"deep\n", b"username=dora&permissions=4"]
    assert dora_sees(SALES, EMPTY) == [403, 403]
    assert call(site, LIST_PROFILES, "", "username=dora") == (DONE, "")

    # A profile lists the user and is read again; the others stay closed.
    profile.write_text("[Profile]\nUsers=alice,dora\n")
    assert dora_sees(SALES) == [403], "the file alone changes nothing"
    assert call(site, REFRESH_PROFILE, "", "profile_id=sales") == (DONE, "")
    assert dora_sees(SALES, EMPTY, "/reports/none/x.htm") == [b"the report\n", 403, 403]
    assert call(site, TEST_PROFILE, "", "username=dora&profile_id=sales") == (DONE, "")
    assert call(site, TEST_PROFILE, "", "username=dora&profile_id=empty") == (FAILED, "")
    assert call(site, LIST_PROFILES, "", "username=dora") == (DONE, "profile_id=sales.wlp")

    # Another password counts with the next request, and for a server that is started anew.
    assert call(site, CHANGE, "", "username=dora&password=second") == (DONE, "")
    assert [fetch(site, SALES, login) for login in (first, second)] == [401, b"the report\n"]
    server.stop()
    site.serve()
    assert [fetch(site, SALES, login) for login in (first, second)] == [401, b"the report\n"]

    # All profiles with bit 0, and none beyond the list without it.
    assert call(site, CHANGE, "", "username=dora&permissions=5") == (DONE, "")
    assert fetch(site, EMPTY, second) == b"the report of nobody\n"
    assert call(site, CHANGE, "", "username=dora&permissions=4") == (DONE, "")
    assert [fetch(site, path, second) for path in (EMPTY, SALES)] == [403, b"the report\n"]

    # The profile is taken away, then the user.
    profile.write_text("[Profile]\nUsers=alice\n")
    assert call(site, REFRESH_PROFILE, "", "profile_id=sales") == (DONE, "")
    assert fetch(site, SALES, second) == 403
    assert call(site, DELETE, "", "username=dora") == (DONE, "")
    assert not (site.users / "dora.usr").exists()
    assert [fetch(site, path, second) for path in (SALES, "/deep/page.htm")] == [401, 401]
    assert call(site, LIST) == (DONE, "u1=admin&p1=0&u2=alice&p2=2&u3=bob&p3=0&u4=chief&p4=1")
