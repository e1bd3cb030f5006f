"""Long runs of scripts. Like the other long load runs they run only when OX_SOAK=1; their figures are printed.

10,000 scripts under load leave no zombie, descriptor, thread or output file; sixteen scripts with thousands of
call-backs each never see another one's answer; and a server that is killed in the middle of a thousand user changes
leaves every user file whole.
"""

import os
import random
import signal
import time

import pytest

from engines import REPLY_500_SCRIPT, check_page, children, engines, output_files, post, script, use_player
from harness import (
    SANITIZER,
    SLOWDOWN,
    Background,
    Client,
    basic,
    descriptors,
    request_text,
    resident_kib,
    thread_count,
    wait_until,
)

pytestmark = pytest.mark.soak

RUNS = 10_000
CLIENTS = 20


@pytest.fixture
def site(site):
    use_player(site)
    script(site, "page.pl", "send 60 1\nexpect 0 TOKEN RETREIVED SUCCESSFULLY\nwrite-output page\nexitmsg\n")
    return site


def settle(site, server):
    server.wait_idle()
    site.get("/hello.htm")
    server.wait_idle()


def test_10000_scripts_under_load(site):
    script(site, "echo.pl", "read length\nwrite-body\n")
    script(site, "fails.pl", "write-output half a page\nexit 3\n")
    script(site, "dies.pl", "send 61 2\nanswer\nkill 9\n")
    script(site, "deserts.pl", "write-output page\nfork-sleep 0.2\nexit 0\n")
    server = site.serve()
    body = os.urandom(100_000)
    done = []

    def load(number):
        for turn in range(number, count, CLIENTS):
            kind = turn % 10
            if kind < 5:
                check_page(site.raw(request_text("/page.pl")), b"page")
            elif kind < 7:
                assert post(site, "/echo.pl", body).body == body
            elif kind == 9 and turn % 100 == 9:
                assert site.get("/deserts.pl").body.startswith(b"pagechild ")
            else:
                assert site.raw(request_text("/dies.pl" if kind == 8 else "/fails.pl")) == REPLY_500_SCRIPT
            done.append(turn)

    count = 500
    Background(load, CLIENTS).join(timeout=300 * SLOWDOWN)
    settle(site, server)
    files, memory, done[:] = len(descriptors(server.pid)), resident_kib(server.pid), []
    count, began = RUNS, time.monotonic()
    Background(load, CLIENTS).join(timeout=1200 * SLOWDOWN)
    elapsed = time.monotonic() - began
    settle(site, server)
    wait_until(lambda: engines(site) == [], "the children of the engines have ended")
    print(
        f"\n{RUNS} scripts at {CLIENTS} clients in {elapsed:.1f} s, {RUNS / elapsed:.0f}/s, RSS {memory} -> "
        f"{resident_kib(server.pid)} KiB, descriptors {files} -> {len(descriptors(server.pid))}, threads "
        f"{server.threads} -> {thread_count(server.pid)}"
    )
    assert sorted(done) == list(range(RUNS))
    assert children(server.pid) == {} and output_files(site) == []
    assert len(descriptors(server.pid)) == files
    assert thread_count(server.pid) == server.threads
    if not SANITIZER:
        assert resident_kib(server.pid) - memory < 2048


def test_sixteen_scripts_with_thousands_of_call_backs_get_their_own_answers(site):
    rounds = 4000 // SLOWDOWN
    for number in range(16):
        mark = f"script-{number}-" + chr(ord("a") + number) * (50 * number)
        script(site, f"s{number}.pl", f"repeat {rounds}\nsend 70 - x={mark}-%n\nanswer\nsend 71 - decode=%a\n"
               f"expect 0 {mark}-%n\nsend 24 - username=u{number}\nexpect 0 permissions={number}\n"
               f"send 24 - username=nobody{number}\nexpect -1\nend\nwrite-output done {number}\n")
        site.add_user(f"u{number}", "pw", number)
    site.serve()
    began = time.monotonic()

    def load(number):
        check_page(site.raw(request_text(f"/s{number}.pl"), timeout=900), b"done %d" % number)

    Background(load, 16).join(timeout=900)
    elapsed = time.monotonic() - began
    print(f"\n{16 * 4 * rounds} call-backs in {elapsed:.1f} s, {16 * 4 * rounds / elapsed:.0f}/s")


def changes(site):
    """How many changes the scripts of a killed server have got an answer to: each leaves a dot in the output file."""
    return sum((site.root / name).read_bytes().count(b".") for name in output_files(site))


def check_user_files(site, users):
    """Each file has all its lines, and its longest one from one end to the other."""
    for path in site.users.glob("*.usr"):
        lines = path.read_text().splitlines()
        values = dict(line.partition("=")[::2] for line in lines if "=" in line)
        values = {key.strip(): value.strip() for key, value in values.items()}
        assert values["username"] == path.stem and "[UserInfo]" in lines, path.read_text()
        assert values["password"] and int(values["permissions"]) >= 0
        url = values.get("logfileurl", "")
        if url:
            begin, middle, end = url.split("/")
            assert begin == end and middle == "x" * 3000, url
    assert {path.stem for path in site.users.glob("*.usr")} == set(users)


def test_a_killed_server_leaves_every_user_file_whole(site):
    users = [f"user{number}" for number in range(5)]
    for name in users:
        site.add_user(name, "pw-" + name, 0)
        script(site, f"{name}.pl", f"repeat 100000\nsend 23 - username={name}&permissions=%n&logfileurl=%n/"
               + "x" * 3000 + "/%n\nexpect 0\nwrite-output .\nend\n")
    script(site, "in/page.pl", "write-output page\n")
    done = rounds = 0
    while done < 1000 or rounds < 20:
        server = site.serve()
        for name in users:
            check_page(site.raw(request_text("/in/page.pl", basic(name, "pw-" + name))), b"page")
        clients = [Client(site.port) for _ in users]
        for name, client in zip(users, clients):
            client.send(request_text(f"/{name}.pl"))
        wait_until(lambda: changes(site) > 0, "the first change")
        time.sleep(random.uniform(0, 0.3))  # the moment of the end is any
        server.signal(signal.SIGKILL)
        assert server.wait_exit() == -signal.SIGKILL
        wait_until(lambda: engines(site) == [], "the engines are gone")
        for client in clients:
            client.close()
        check_user_files(site, users)
        done, rounds = done + changes(site), rounds + 1
        for name in output_files(site):
            (site.root / name).unlink()
    server = site.serve()
    for name in users:
        check_page(site.raw(request_text("/in/page.pl", basic(name, "pw-" + name))), b"page")
    server.stop()
    site.allow("status", r"ox_test_engine: the input ended after 0 of 8 bytes")  # of engines that outlive it a moment
    print(f"\n{rounds} servers killed during {done} changes")
