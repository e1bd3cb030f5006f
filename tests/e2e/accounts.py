"""Accounts of the operating system for the tests. They stand in files of the test, which cover those of the machine in
a mount namespace that only the server under test sees."""

import os
import re
import shlex
import subprocess

import pytest

from harness import IS_ROOT, REPLY_401, REPLY_LOCKED_OUT, basic, request_text

# "in passwd" and so on, enciphered with few rounds so that the checks take no time.
HASHES = {
    "in passwd": "$6$rounds=1000$saltsalt$"
    "SeNk9n.vN3tgOYPGkRI.cMWta7J8zqiQEhXI4AVZIh8eL3XZu9o6iQhRFb65RZ7g/VELDgKbVps5wHePHiS4Z0",
    "in shadow": "$6$rounds=1000$saltsalt$"
    "dih8mYDTqYe8XJJbgOyC0V/MMVeSGMxkD1FiOOD./laXUcJ.QAK2b77KXe/GGeWQgDrVCeQ6bobs7iZg26zP91",
    "yes": "$y$j75$saltsalt$VOEZpMAm7epRPvWtVjIZTO.l4uc9DVj.pPqYrOK3TD1",
}
# The account's field in the passwd file and in the shadow file.
ACCOUNTS = {
    "shadowed": ("x", HASHES["in shadow"]),
    "both": (HASHES["in passwd"], HASHES["in shadow"]),
    "passwdonly": (HASHES["in passwd"], None),
    "open": ("", None),
    "emptyshadow": ("x", ""),
    "locked": ("x", "!" + HASHES["in shadow"]),
    "starred": ("*", "*"),
    "yescrypt": ("x", HASHES["yes"]),
    "anonymous": ("x", HASHES["in shadow"]),
    "nouser": ("x", HASHES["in shadow"]),
    "expired": ("x", HASHES["in shadow"]),
}
PAM_LOGIN = "auth required pam_unix.so nodelay\naccount required pam_unix.so\n"


def may_unshare():
    command = ["/usr/bin/unshare", "--mount", "--propagation", "private", "/bin/true"]
    return IS_ROOT and subprocess.run(command, capture_output=True, check=False).returncode == 0


def has_pam_unix():
    return any(
        os.path.exists(os.path.join(directory, "pam_unix.so"))
        for directory, _, _ in os.walk("/usr/lib")
        if directory.endswith("/security")
    )


needs_namespace = pytest.mark.skipif(not may_unshare(), reason="needs root and private mount namespaces")
needs_pam = pytest.mark.skipif(not has_pam_unix(), reason="needs the modules of PAM")


class Machine:
    """The account files of one server, and the server with them."""

    def __init__(self, site):
        self.site = site
        self.etc = site.scratch / "etc"
        self.etc.mkdir()
        (self.etc / "pam.d").mkdir()
        passwd = [f"{name}:{field}:2000:2000::/:/bin/sh" for name, (field, _) in ACCOUNTS.items()]
        shadow = [
            f"{name}:{field}:19000:0:99999:7::{19001 if name == 'expired' else ''}:"
            for name, (_, field) in ACCOUNTS.items()
            if field is not None
        ]
        self.write("passwd", "\n".join(["root:x:0:0::/root:/bin/sh", *passwd, ""]))
        self.write("shadow", "\n".join(["root:*:19000:0:99999:7:::", *shadow, ""]), 0o600)
        self.write("group", "root:x:0:\nusers:x:2000:\n")
        self.write("nsswitch.conf", "passwd: files\nshadow: files\ngroup: files\n")
        self.write("pam.d/login", PAM_LOGIN)
        self.write("pam.d/other", "auth required pam_deny.so\naccount required pam_deny.so\n")
        site.configure(web={"OSAuthentication": 1}, audit={"debuglevel": 3})
        site.page("deep/page.htm", b"a deep page\n")
        site.allow("err", r"Authentication failed: user .*\.|User .* authentication failed\.")

    def write(self, name, text, mode=0o644):
        path = self.etc / name
        path.write_text(text)
        path.chmod(mode)
        return path

    def methods(self, text):
        self.site.settings["authentication"] = {"methods": text}
        self.site.configure()

    def arguments(self, *command):
        covers = "".join(
            f"mount --bind {shlex.quote(str(self.etc / name))} /etc/{name} && "
            for name in ("passwd", "shadow", "group", "nsswitch.conf", "pam.d")
        )
        script = covers + 'exec "$0" "$@"'
        return ["--mount", "--propagation", "private", "/bin/sh", "-c", script, str(self.site.exe), *command]

    def serve(self):
        return self.site.serve(*self.arguments("-debug"), program="/usr/bin/unshare", argv0="unshare")

    def login(self, name, password):
        raw = self.site.raw(request_text("/deep/page.htm", basic(name, password)))
        if raw == REPLY_LOCKED_OUT:
            return "locked out"
        assert raw.endswith(b"a deep page\n") or raw == REPLY_401, raw
        return raw != REPLY_401


def login_lines(site):
    return [line for line in site.err() if "uthenticat" in line]


def failure_lines(site):
    return [line for line in site.status() if "uthentication failed" in line]


def expect_failures(site, *names):
    """The failed accounts, which must stand in the status log in this order and with nothing else."""
    lines = [f"User Authentication failed: {name}" for name in names]
    assert failure_lines(site) == lines
    for line in set(lines):
        site.expect("status", re.escape(line), times=lines.count(line))
