"""Logins with the accounts of the operating system: many at once, slow ones, and who the server is meanwhile."""

import os
import re
import shlex

import pytest

from accounts import PAM_LOGIN, expect_failures, needs_namespace, needs_pam
from harness import REPLY_401, Background, basic, request_text, thread_count, wait_until


@needs_namespace
@needs_pam
@pytest.mark.parametrize("path", ["/deep/page.htm", "/reports/sales/page.htm"])
def test_guessing_asks_the_system_four_times(machine, path):
    site = machine.site
    site.add_user("shadowed", "unused")
    machine.serve()
    Background(lambda _: site.get(path, basic("shadowed", "wrong")), 12).join()
    expect_failures(site, *["shadowed"] * 4)
    assert machine.login("shadowed", "in shadow") == "locked out"
    site.expect("err", r"User shadowed locked out for 1 minutes\. Too many failed logins\.", times=1)


def task_uids(server):
    """The effective user ids of the server's threads."""
    found = []
    for task in os.listdir(f"/proc/{server.pid}/task"):
        try:
            with open(f"/proc/{server.pid}/task/{task}/status") as status:
                found.append(int(re.search(r"^Uid:\t\d+\t(\d+)", status.read(), re.M)[1]))
        except (FileNotFoundError, ProcessLookupError):
            continue
    return found


@needs_namespace
@needs_pam
def test_while_the_system_thinks_one_thread_is_root_and_others_are_served(machine):
    site = machine.site
    site.configure(unix={"uid": 1, "gid": 1})
    site.give_to(1)
    for name in ("shadowed", "both"):
        site.add_user(name, "unused")
    gate, asked = site.scratch / "gate", site.scratch / "asked"
    os.mkfifo(gate)
    script = site.scratch / "wait.sh"
    script.write_text(f"#!/bin/sh\n: >{asked}\nread line <{gate}\n")
    script.chmod(0o755)
    machine.write("pam.d/login", f"auth required pam_exec.so quiet {script}\n" + PAM_LOGIN)
    machine.methods("pam")
    server = machine.serve()
    idle = thread_count(server.pid)
    answers = []
    client = Background(lambda _: answers.append(machine.login("shadowed", "in shadow")), 1)
    wait_until(asked.exists, "the system is asked")
    for _ in range(20):
        assert site.get("/hello.htm").status == 200
        assert site.raw(request_text("/deep/page.htm")) == REPLY_401
        assert sorted(set(task_uids(server))) == [0, 1] and task_uids(server).count(0) == 1
    assert thread_count(server.pid) > idle
    assert answers == []
    gate.write_text("go on\n")
    client.join()
    assert answers == [True]
    server.wait_idle()
    assert set(task_uids(server)) == {1}


@needs_namespace
@needs_pam
@pytest.mark.parametrize("module", ["pam_deny.so", "pam_absent.so", "pam_permit.so"])
def test_what_other_modules_decide(machine, module):
    site = machine.site
    site.add_user("shadowed", "unused")
    machine.write("pam.d/login", f"auth required {module}\naccount required pam_permit.so\n")
    machine.methods("pam")
    machine.serve()
    assert machine.login("shadowed", "any") == (module == "pam_permit.so")
    if module != "pam_permit.so":
        expect_failures(site, "shadowed")


@needs_namespace
@needs_pam
def test_a_module_that_changes_the_groups_changes_nothing_in_the_server(machine):
    site = machine.site
    site.configure(unix={"uid": 1, "gid": 1})
    site.give_to(1)
    site.add_user("shadowed", "unused")
    (machine.etc / "security").mkdir()
    config = machine.write("security/group.conf", "login;*;*;Al0000-2400;users\n")
    machine.write("pam.d/login", PAM_LOGIN + "auth optional pam_group.so\n")
    machine.methods("pam")
    arguments = machine.arguments("-debug")
    index = arguments.index("-c") + 1
    arguments[index] = f"mount --bind {shlex.quote(str(config))} /etc/security/group.conf && " + arguments[index]
    if not os.path.exists("/etc/security/group.conf"):
        pytest.skip("needs pam_group and its settings file")
    server = site.serve(*arguments, program="/usr/bin/unshare", argv0="unshare")
    assert machine.login("shadowed", "in shadow")
    server.wait_idle()
    for task in os.listdir(f"/proc/{server.pid}/task"):
        with open(f"/proc/{server.pid}/task/{task}/status") as status:
            assert re.search(r"^Groups:\t1 *$", status.read(), re.M)


@needs_namespace
@needs_pam
def test_many_logins_at_once_with_all_methods(machine):
    site = machine.site
    site.configure(unix={"uid": 1, "gid": 1}, web={"WebMaxConnectionsPerAddress": 0})
    site.give_to(1)
    names = ["shadowed", "both", "passwdonly", "yescrypt"]
    passwords = {"shadowed": "in shadow", "both": "in shadow", "passwdonly": "in passwd", "yescrypt": "yes"}
    for name in names:
        site.add_user(name, "unused")
    server = machine.serve()

    def load(number):
        name = names[number % len(names)]
        for turn in range(5):
            assert machine.login(name, passwords[name]) is True
            if turn == 2 and number < len(names):
                assert machine.login(name, "wrong") is False
            assert site.get("/hello.htm").status == 200

    Background(load, 12).join()
    server.wait_idle()
    assert set(task_uids(server)) == {1}
    site.expect("status", "User Authentication failed: (shadowed|both|passwdonly|yescrypt)", times=4)


@needs_namespace
@needs_pam
@pytest.mark.daemon
def test_a_daemon_keeps_its_lowered_identity(machine):
    site = machine.site
    site.configure(unix={"uid": 1, "gid": 1})
    site.give_to(1)
    site.add_user("shadowed", "unused")
    site.run("-status")
    site.give_to(1)
    code, _, daemon = site.start_daemon(*machine.arguments("-start"), program="/usr/bin/unshare", argv0="unshare")
    assert code == 0
    assert not machine.login("shadowed", "wrong")
    assert machine.login("shadowed", "in shadow")
    expect_failures(site, "shadowed")
    wait_until(lambda: set(task_uids(daemon)) == {1}, "no thread is root")
    daemon.signal(16)
    wait_until(lambda: sum(line.startswith("Starting server") for line in site.err()) == 2, "the reset")
    wait_until(lambda: machine.login("shadowed", "in shadow"), "the login after the reset")
    assert set(task_uids(daemon)) == {1}
