"""What the tests of user files have in common."""

import re

from harness import basic

# The lines about a password by hand that is longer than it may be.
TOO_LONG = [
    "Plaintext password for user {} exceeds max allowable length. (40)",
    "User {} will not be used.",
]


def opens(site, name, password):
    """Whether the login is good."""
    status = site.get("/deep/page.htm", basic(name, password)).status
    assert status in (200, 401)
    return status == 200


def serve(site):
    site.page("deep/page.htm", b"a deep page\n")
    return site.serve()


def key_file(site):
    return site.data / "ox_remote.key"


def cipher_text(path):
    return re.search(r"^password *= *(\S+)", path.read_text(), re.M)[1]
