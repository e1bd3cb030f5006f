"""Logins with the accounts of the operating system: the methods, and what is said."""

import os
import re

import pytest

from accounts import HASHES, expect_failures, failure_lines, login_lines, needs_namespace, needs_pam
from harness import BANNER, DEBUG_NOTICE, basic, is_listening, process_status, wait_until

RESET = 16
ROOT_NEEDED = "O/S authentication requires starting the program with root access."


# --------------------------------------------------------------------------------------------- the right to do it


@pytest.mark.parametrize("error_log", ["ox_remote.err", "other.err"])
@pytest.mark.parametrize("command", ["-debug", pytest.param("-start", marks=pytest.mark.daemon)])
def test_an_ordinary_user_cannot_start_it(site, command, error_log):
    """The reason is in the log that the fixed text points to, whatever the settings call theirs."""
    site.use_ordinary_user()
    site.configure(web={"OSAuthentication": 1, "WebErrorLog": error_log}, audit={"debuglevel": 3})
    site.add_user("alice")
    code, out = site.run(command)
    lines = [
        "Error: The remote interface server failed to initialize.",
        'Refer to "ox_remote.err" for more information.',
    ]
    if command == "-debug":
        assert code == 1
        assert out == BANNER + DEBUG_NOTICE + f"Changing dir to {site.root};\n" * ("Changing" in out) + "".join(
            f"{line}\n" for line in lines
        )
    wait_until(lambda: lines[-1] in site.status(), "the lines of the failed start")
    wait_until(lambda: not site.leftover_processes(), "the end of the server")
    fixed = site.root / "ox_remote.err"
    assert site.err(fixed)[-1] == ROOT_NEEDED
    assert fixed.read_text().endswith(": " + ROOT_NEEDED + "\n")
    assert {path.name for path in site.root.glob("*.err")} == {"ox_remote.err", error_log}
    assert (ROOT_NEEDED in site.err()) == (site.error_log == fixed)
    assert not any(line.startswith("Starting server") for line in site.err())
    assert not site.pid_file.exists()
    site.expect("err", re.escape(ROOT_NEEDED), times=1)
    for line in lines:
        site.expect("status", re.escape(line), times=1)


@pytest.mark.parametrize("error_log", ["ox_remote.err", "other.err"])
def test_a_reset_of_an_ordinary_user_to_it_leaves_the_server_stopped_and_waiting(site, error_log):
    site.use_ordinary_user()
    site.configure(web={"WebErrorLog": error_log})
    site.add_user("alice")
    site.page("deep/page.htm", b"a deep page\n")
    server = site.serve()
    assert site.get("/deep/page.htm", basic("alice", "secret")).status == 200
    site.configure(web={"OSAuthentication": 1})
    server.signal(RESET)
    fixed = site.root / "ox_remote.err"
    wait_until(lambda: ROOT_NEEDED in site.err(fixed), "the line of the failed reset")
    assert (ROOT_NEEDED in site.err()) == (site.error_log == fixed)
    site.run("-status")
    stopped = "Remote interface server is stopped."
    wait_until(lambda: stopped in site.status(), "the answer of the stopped server")
    assert server.alive() and not is_listening(site.port)
    site.configure(web={"OSAuthentication": 0})
    server.reset()
    assert site.get("/deep/page.htm", basic("alice", "secret")).status == 200
    site.expect("err", re.escape(ROOT_NEEDED), times=1)
    site.expect("status", re.escape(stopped), times=1)


def test_without_error_logging_the_refusal_leaves_no_file(site):
    site.use_ordinary_user()
    site.configure(web={"OSAuthentication": 1, "WebLogErrors": 0})
    code, _ = site.run("-debug")
    assert code == 1
    assert not site.error_log.exists()
    site.allow("status", r"Error: The remote interface server failed to initialize\.|Refer to .*")


@pytest.mark.parametrize("value", ["0", "no", "", "off", "x"])
def test_where_it_is_not_asked_for_an_ordinary_user_starts(site, value):
    site.use_ordinary_user()
    site.configure(web={"OSAuthentication": value})
    site.add_user("alice")
    site.page("deep/page.htm", b"a deep page\n")
    site.serve()
    assert site.get("/deep/page.htm", basic("alice", "secret")).status == 200


# ------------------------------------------------------------------------------------------------------ the methods

# Account, password, and whether PAM, the passwd file and the shadow file let it in.
CHECKS = [
    ("shadowed", "in shadow", "pam shadow"),
    ("shadowed", "in passwd", ""),
    ("shadowed", "", ""),
    ("both", "in passwd", "pam passwd"),
    ("both", "in shadow", "shadow"),
    ("both", "In shadow", ""),
    ("passwdonly", "in passwd", "pam passwd"),
    ("passwdonly", "x", ""),
    ("open", "any", "passwd"),
    ("open", "", "passwd"),
    ("emptyshadow", "any", ""),
    ("emptyshadow", "", ""),
    ("locked", "in shadow", ""),
    ("starred", "*", ""),
    ("starred", "", ""),
    ("yescrypt", "yes", "pam shadow"),
    ("yescrypt", "in shadow", ""),
    ("expired", "in shadow", "shadow"),
    ("absent", "", ""),
    ("absent", "in shadow", ""),
]


@needs_namespace
@needs_pam
@pytest.mark.parametrize("identity", ["root", "lowered"])
@pytest.mark.parametrize("method", ["pam", "passwd", "shadow"])
def test_each_method_by_itself(machine, method, identity):
    site = machine.site
    if identity == "lowered":
        site.configure(unix={"uid": 1, "gid": 1})
        site.give_to(1)
    for name in {name for name, _, _ in CHECKS}:
        site.add_user(name, "unused")
    machine.methods(method)
    server = machine.serve()
    results = [(name, password, machine.login(name, password)) for name, password, _ in CHECKS]
    assert results == [(name, password, method in methods.split()) for name, password, methods in CHECKS]
    expect_failures(site, *[name for name, _, good in results if not good])
    server.wait_idle()
    for task in os.listdir(f"/proc/{server.pid}/task"):
        with open(f"/proc/{server.pid}/task/{task}/status") as status:
            assert re.search(r"^Uid:\t0\t%d\t" % (identity == "lowered"), status.read(), re.M)
    assert process_status(server.pid)["Groups"].split() == process_status(server.pid)["Gid"].split()[:1]


@needs_namespace
@needs_pam
@pytest.mark.parametrize(
    "methods,tried",
    [
        ("none", ""),
        ("", ""),
        ("nopam", "pam"),
        ("shadow pam", "pam shadow"),
        ("PAM,Passwd", "pam passwd"),
        ("spamshadowpasswd", "pam shadow passwd"),
        ("xpasswdx", "passwd"),
        (None, "pam shadow passwd"),
    ],
)
def test_the_methods_of_the_settings(machine, methods, tried):
    site = machine.site
    for name in ("shadowed", "both", "open", "expired"):
        site.add_user(name, "unused")
    if methods is not None:
        machine.methods(methods)
    machine.serve()
    tried = set(tried.split())
    assert machine.login("both", "in passwd") == bool(tried & {"pam", "passwd"})
    assert machine.login("shadowed", "in shadow") == bool(tried & {"pam", "shadow"})
    assert machine.login("expired", "in shadow") == ("shadow" in tried)
    assert machine.login("open", "any") == ("passwd" in tried)
    assert not machine.login("shadowed", "wrong")
    site.allow("status", r"User Authentication failed: (both|shadowed|expired|open)")


@needs_namespace
@needs_pam
def test_the_methods_are_read_at_each_check(machine):
    site = machine.site
    for name in ("shadowed", "both"):
        site.add_user(name, "unused")
    machine.methods("none")
    machine.serve()
    assert not machine.login("shadowed", "in shadow")
    machine.methods("shadow")
    assert machine.login("shadowed", "in shadow")
    machine.methods("none")
    assert machine.login("shadowed", "in shadow"), "a remembered login is not asked about again"
    assert not machine.login("both", "in shadow")
    expect_failures(site, "shadowed", "both")


# -------------------------------------------------------------------------------------------- users and their lines


@needs_namespace
@needs_pam
def test_the_lines_of_each_outcome(machine):
    """An account needs a user file too: that gives the permissions, and its own password counts for nothing."""
    site = machine.site
    for name, permissions in (("shadowed", 0), ("both", 1)):
        site.add_user(name, "unused", permissions)
    site.add_report("sales/page.htm")
    machine.serve()
    assert machine.login("shadowed", "in shadow")
    assert not machine.login("shadowed", "unused")
    assert not machine.login("nouser", "in shadow")
    assert not machine.login("noaccount", "x")
    assert machine.login("shadowed", "in shadow")
    assert login_lines(site) == [
        "Authenticating user shadowed...",
        "User shadowed authenticated.",
        "Authenticating user shadowed...",
        "User shadowed authentication failed.",
        "Authenticating user nouser...",
        "Authentication failed: user nouser.",
        "Authenticating user noaccount...",
        "Authentication failed: user noaccount.",
    ]
    expect_failures(site, "shadowed")
    site.expect("err", "User shadowed requested a forbidden profile: sales", times=1)
    assert site.get("/reports/sales/page.htm", basic("shadowed", "in shadow")).status == 403
    assert site.get("/reports/sales/page.htm", basic("both", "in passwd")).status == 200


@needs_namespace
@needs_pam
@pytest.mark.parametrize("level,wanted", [(1, ()), (2, ("User", "Authentication")), (3, None)])
def test_the_levels_of_the_lines(machine, level, wanted):
    """The results from level 2 on, the beginnings from 3."""
    site = machine.site
    site.add_user("shadowed", "unused")
    site.configure(audit={"debuglevel": level})
    machine.serve()
    assert machine.login("shadowed", "in shadow")
    assert not machine.login("shadowed", "unused")
    assert not machine.login("nouser", "in shadow")
    lines = [
        "Authenticating user shadowed...",
        "User shadowed authenticated.",
        "Authenticating user shadowed...",
        "User shadowed authentication failed.",
        "Authenticating user nouser...",
        "Authentication failed: user nouser.",
    ]
    assert login_lines(site) == [line for line in lines if wanted is None or line.startswith(wanted)]
    expect_failures(site, "shadowed")


@needs_namespace
@needs_pam
def test_a_user_without_an_account_is_refused_by_the_system(machine):
    site = machine.site
    site.add_user("noaccount", None)
    machine.serve()
    for password in ("", "x"):
        assert not machine.login("noaccount", password)
    assert login_lines(site)[-1] == "User noaccount authentication failed."
    expect_failures(site, "noaccount", "noaccount")


@needs_namespace
@needs_pam
@pytest.mark.parametrize("password", ["", "in shadow", "any"])
def test_the_anonymous_user_needs_a_file_and_no_password(machine, password):
    site = machine.site
    site.add_user("anonymous", "unused")
    site.add_report("sales/page.htm")
    site.add_profile("sales.wlp", "anonymous")
    server = machine.serve()
    assert machine.login("anonymous", password)
    assert site.get("/reports/sales/page.htm").status == 200
    assert failure_lines(site) == []
    assert login_lines(site) == ["Authenticating user anonymous..."] * 2, "no success that was checked"
    (site.users / "anonymous.usr").unlink()
    server.reset()
    assert not machine.login("anonymous", password)
    assert site.get("/reports/sales/page.htm").status == 401
    assert login_lines(site)[-1] == "Authentication failed: user anonymous."
    assert failure_lines(site) == []


@needs_namespace
@needs_pam
@pytest.mark.parametrize(
    "name,account",
    [
        ("OFFICE\\shadowed", "shadowed"),
        ("OFFICE/shadowed", "shadowed"),
        ("/shadowed", "shadowed"),
        ("a\\b\\shadowed", "b\\shadowed"),
        ("a/b\\shadowed", "b\\shadowed"),
        ("d" * 180 + "\\shadowed", "shadowed"),
        ("shadowed\\", ""),
    ],
)
def test_a_domain_in_front_of_the_account_decides_nothing(machine, name, account):
    site = machine.site
    site.add_user(name, "unused", file="1.usr")
    site.add_user("shadowed", "unused")
    machine.serve()
    assert machine.login(name, "in shadow") == (account == "shadowed")
    assert not machine.login(name, "wrong")
    site.allow("status", re.escape(f"User Authentication failed: {account}"))
    assert set(failure_lines(site)) == {f"User Authentication failed: {account}"}


@needs_namespace
@needs_pam
def test_a_domain_in_the_settings_is_put_in_front(machine):
    """So the account is that behind it, also where the user's name holds another domain."""
    site = machine.site
    site.configure(web={"NTAuthenticationDomain": "OFFICE"})
    site.add_user("shadowed", "unused")
    site.add_user("HOME\\both", "unused", file="1.usr")
    machine.serve()
    assert machine.login("shadowed", "in shadow")
    assert not machine.login("shadowed", "wrong")
    assert not machine.login("HOME\\both", "in shadow")
    assert not machine.login("OFFICE/shadowed", "in shadow"), "there is no user of that name"
    expect_failures(site, "shadowed", "HOME\\both")


@needs_namespace
@needs_pam
def test_a_reset_takes_a_changed_domain(machine):
    site = machine.site
    site.add_user("HOME\\both", "unused", file="1.usr")
    server = machine.serve()
    for turn, (domain, account) in enumerate([(None, "both"), ("OFFICE", "HOME\\both"), ("", "both")]):
        if turn > 0:
            site.configure(web={"NTAuthenticationDomain": domain})
            server.reset()
        assert machine.login("HOME\\both", "in shadow") == (account == "both")
    expect_failures(site, "HOME\\both")


@needs_namespace
@needs_pam
def test_a_reset_takes_who_proves_the_password(machine):
    """The accounts or the user files; what was remembered by the other rule counts no more."""
    site = machine.site
    site.add_user("shadowed", "in the file")
    site.configure(web={"OSAuthentication": 0})
    server = machine.serve()
    for turn, value in enumerate((0, 1, 0)):
        if turn > 0:
            site.configure(web={"OSAuthentication": value})
            server.reset()
        assert machine.login("shadowed", "in shadow") == (value == 1)
        assert machine.login("shadowed", "in the file") == (value == 0)
    expect_failures(site, "shadowed")


@needs_namespace
@needs_pam
@pytest.mark.parametrize("length,good", [(63, True), (64, False)])
def test_names_and_passwords_of_64_bytes_are_refused_and_not_cut(machine, length, good):
    """A name that was cut could be another account."""
    site = machine.site
    name = "n" * 63
    machine.write("passwd", f"root:x:0:0::/root:/bin/sh\n{name}:{HASHES['in passwd']}:2000:2000::/:/bin/sh\n")
    site.add_user("n" * length, "unused", file="1.usr")
    machine.serve()
    assert machine.login("n" * length, "in passwd") == good
    assert not machine.login("n" * length, "in passwd".ljust(64, "x"))
    site.allow("status", "User Authentication failed: n+")


@needs_namespace
@needs_pam
def test_an_entry_of_the_passwd_file_that_is_too_long_has_its_line(machine):
    site = machine.site
    site.add_user("long", "unused")
    machine.write("passwd", f"root:x:0:0::/root:/bin/sh\nlong:{HASHES['in passwd']}:2000:2000:{'g' * 600}:/:/bin/sh\n")
    machine.methods("passwd")
    machine.serve()
    assert not machine.login("long", "in passwd")
    lines = [
        "UNIX passwd authentication failed: Numerical result out of range (rc=34)",
        "User Authentication failed: long",
    ]
    assert failure_lines(site) == lines
    for line in lines:
        site.expect("status", re.escape(line), times=1)


@needs_namespace
@needs_pam
def test_an_entry_of_the_shadow_file_that_is_too_long_has_its_line(machine):
    site = machine.site
    site.add_user("shadowed", "unused")
    machine.write("shadow", f"shadowed:{HASHES['in shadow']}:19000:0:99999:7::{'9' * 9000}:\n", 0o600)
    machine.methods("shadow")
    machine.serve()
    assert not machine.login("shadowed", "in shadow")
    lines = [
        "Shadow password authentication failed: Numerical result out of range (rc=34)",
        "User Authentication failed: shadowed",
    ]
    assert failure_lines(site) == lines
    for line in lines:
        site.expect("status", re.escape(line), times=1)


@needs_namespace
@needs_pam
def test_control_bytes_in_a_name_stay_within_the_line(machine):
    site = machine.site
    site.add_user("a\x1b[2Jb", "unused", file="1.usr")
    machine.serve()
    assert not machine.login("a\x1b[2Jb", "x")
    expect_failures(site, r"a\x1b[2Jb")


@needs_namespace
@needs_pam
def test_a_deleted_user_file_ends_the_login_although_the_account_lives(machine):
    site = machine.site
    path = site.add_user("shadowed", "unused")
    server = machine.serve()
    assert machine.login("shadowed", "in shadow")
    path.unlink()
    server.reset()
    assert not machine.login("shadowed", "in shadow")
    assert failure_lines(site) == []
