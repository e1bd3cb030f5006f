"""An installation with something in every place that a URL may lead to."""

from harness import REPLY_401, REPLY_403, REPLY_404, REPLY_LOCKED_OUT, basic, request_text

ALICE = basic("alice", "secret")  # of the profile "sales"
BOB = basic("bob", "secret")  # of no profile
CHIEF = basic("chief", "secret")  # with all profiles
PLACES = {
    "wwwroot/top.htm": b"top\n",
    "wwwroot/deep/page.htm": b"deep\n",
    "wwwroot/images/x.gif": b"image\n",
    "wwwroot/reports.htm": b"top reports\n",
    "wwwroot/reportsX/x.htm": b"like reports\n",
    "wwwroot/reports/sales/x.htm": b"not the report\n",
    "oxm_oxx/datfiles/reports/sales/x.htm": b"the report\n",
    "oxm_oxx/datfiles/reports/sales/deep/x.gif": b"a deep report\n",
    "oxm_oxx/datfiles/reports/sales/default.htm": b"the default report\n",
    "oxm_oxx/datfiles/reports/sales/x.pl": b"output('text of a script')\n",
    "oxm_oxx/datfiles/reports/sales.wlp/x.htm": b"by file\n",
    "oxm_oxx/datfiles/reports/empty/x.htm": b"the report of nobody\n",
    "oxm_oxx/datfiles/reports/x.htm": b"between the profiles\n",
    "oxm_oxx/datfiles/images/x.gif": b"not the image\n",
    "scripts/page.htm": b"a file among the scripts\n",
}


def furnish(site):
    """Files in all places, the four users, and two profiles."""
    for name, content in PLACES.items():
        path = site.root / name
        path.parent.mkdir(parents=True, exist_ok=True)
        path.write_bytes(content)
    for name, permissions in (("alice", 2), ("bob", 0), ("chief", 1), ("admin", 0)):
        site.add_user(name, permissions=permissions)
    site.add_profile("sales.wlp", "alice, carol")
    site.add_profile("empty.wlp", "")
    return site


def fetch(site, path, *headers):
    """The body of a page, or the kind of a refusal, which must be that refusal byte for byte."""
    raw = site.raw(request_text(path, *headers))
    refusals = {REPLY_401: 401, REPLY_403: 403, REPLY_404: 404, REPLY_LOCKED_OUT: "locked out"}
    if raw in refusals:
        return refusals[raw]
    head, _, body = raw.partition(b"\r\n\r\n")
    assert head.startswith(b"HTTP/1.0 200 OK\r\n"), raw
    return body
