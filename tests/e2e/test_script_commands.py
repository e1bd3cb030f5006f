"""The commands of scripts, through the real pipes: users, profiles, encryption, and what others have to carry out."""

import contextlib
import re
import socket
import subprocess
import threading

import pytest

from conftest import needs_root
from engines import call, no_remote_service, remote_request, script, take_steps, use_steps
from harness import REPLY_401, basic, mode_of, request_text

ADD, DELETE, LIST, CHANGE, GET = 20, 21, 22, 23, 24
LIST_PROFILES, TEST_PROFILE = 30, 31
ENCRYPT, DECRYPT = 70, 71
DONE, FAILED, NOT_HANDLED, UNREACHABLE = 0, -1, -2, -9


@pytest.fixture
def site(site):
    use_steps(site)
    script(site, "in/args.pl", "output(args[8])\n")
    return site


def user_texts(site):
    return {path.name: path.read_text() for path in site.users.iterdir()}


def values(text):
    pairs = (line.partition("=") for line in text.splitlines() if "=" in line)
    return {key.strip(): value.strip() for key, _, value in pairs}


def logged_in(site, name, password):
    """What a script learns about the user, or None when the login is refused."""
    raw = site.raw(request_text("/in/args.pl", basic(name, password)))
    if raw == REPLY_401:
        return None
    assert raw.startswith(b"HTTP/1.0 200 OK\r\n"), raw
    return raw.rpartition(b"\r\n\r\n")[2].decode()


# --------------------------------------------------------------------------------------------------------------- users


def test_the_life_of_a_user(site):
    site.serve()
    assert call(site, LIST) == (DONE, "")
    text = "username=dora&password=the+pass%77ord&permissions=3&maxprofiles=7&logfileurl=http%3A%2F%2Fx%2Fa%3Fb%3Dc"
    assert call(site, ADD, "", text) == (DONE, "")
    path = site.users / "dora.usr"
    assert mode_of(path) == 0o600
    stored = values(path.read_text())
    assert stored["username"] == "dora" and stored["permissions"] == "3"
    assert (stored["maxprofiles"], stored["logfileurl"]) == ("7", "http://x/a?b=c")
    assert "the password" not in path.read_text() and "PlaintextPassword" not in stored

    assert logged_in(site, "dora", "the password") == "username=dora&permissions=3"
    assert logged_in(site, "dora", "the passWord") is None
    assert call(site, GET, "", "username=dora") == (DONE, "permissions=3")
    assert call(site, LIST) == (DONE, "u1=dora&p1=3")
    assert call(site, ADD, "", "username=dora&password=x&permissions=1") == (FAILED, "")

    assert logged_in(site, "dora", "the password") == "username=dora&permissions=3"
    assert call(site, CHANGE, "", "username=dora&password=new") == (DONE, "")
    assert logged_in(site, "dora", "the password") is None, "the old password is good no longer"
    assert logged_in(site, "dora", "new") == "username=dora&permissions=3"
    assert call(site, CHANGE, "", "username=dora&permissions=8&maxprofiles=9") == (DONE, "")
    assert logged_in(site, "dora", "new") == "username=dora&permissions=8"
    assert values(path.read_text())["maxprofiles"] == "9"
    assert values(path.read_text())["logfileurl"] == "http://x/a?b=c"

    assert call(site, DELETE, "", "username=dora") == (DONE, "")
    assert not path.exists()
    assert logged_in(site, "dora", "new") is None, "a deleted user is out at once"
    assert call(site, DELETE, "", "username=dora") == (FAILED, "")
    assert call(site, GET, "", "username=dora") == (FAILED, "")
    assert call(site, LIST) == (DONE, "")


def test_users_outlive_the_server(site):
    server = site.serve()
    call(site, ADD, "", "username=bob&password=pw&permissions=1")
    call(site, ADD, "", "username=al&password=&permissions=-2")
    call(site, CHANGE, "", "username=bob&logfileurl=%2Fx&maxprofiles=7")
    call(site, CHANGE, "", "username=al&permissions=4")
    server.stop()
    site.serve()
    assert logged_in(site, "bob", "pw") == "username=bob&permissions=1"
    assert logged_in(site, "al", "any") == "username=al&permissions=4"
    stored = values((site.users / "bob.usr").read_text())
    assert (stored["logfileurl"], stored["maxprofiles"]) == ("/x", "7")
    assert call(site, LIST) == (DONE, "u1=al&p1=4&u2=bob&p2=1")


@pytest.mark.parametrize(
    "first,second",
    [("", "username=alice"), ("any context", "username=alice"), ("username=alice", ""), ("x", "%75sername=al%69ce"),
     ("", "username=alice&more=x&flag"), ("", "username%3Dalice")],
)
def test_the_arguments_are_the_second_text_or_else_the_first(site, first, second):
    site.add_user("alice", "pw", 5)
    site.serve()
    assert call(site, GET, first, second) == (DONE, "permissions=5")


def test_a_value_cannot_bring_in_a_key(site):
    site.add_user("bob", "pw", 0)
    site.serve()
    assert call(site, CHANGE, "", "username=bob&password=x%26permissions%3D1") == (DONE, "")
    assert call(site, GET, "", "username=bob") == (DONE, "permissions=0")
    assert logged_in(site, "bob", "x&permissions=1") == "username=bob&permissions=0"


# Each text is refused by both commands where it is for both, and leaves the files as they were.
@pytest.mark.parametrize(
    "command,text",
    [
        (ADD, ""),
        (ADD, "password=x&permissions=1"),
        (ADD, "username=&password=x"),
        (ADD, "username=bob&password=x"),
        (ADD, "username=eve&permissions=0&permissions=1"),
        (ADD, "username=eve&username=eve2"),
        (ADD, "username=eve&password=a&password=b"),
        (ADD, "username=eve&logfileurl=x%0Apermissions%3D1"),
        (ADD, "username=eve&logfileurl=x%0D"),
        (ADD, "username=eve%0Apermissions%3D1"),
        (ADD, "username=eve%09"),
        (ADD, "username=e%3Ave"),
        (ADD, "username=e%26ve"),
        (ADD, "username=e%3Dve"),
        (ADD, "username=+eve"),
        (ADD, "username=eve+"),
        (ADD, "username=" + "e" * 256),
        (ADD, "username=eve&permissions=1x"),
        (ADD, "username=eve&permissions=x"),
        (ADD, "username=eve&maxprofiles=1.5"),
        (ADD, "username=eve&password=" + "p" * 352),
        (DELETE, ""),
        (DELETE, "username=eve"),
        (DELETE, "username=BOB"),
        (DELETE, "username=bob&username=bob"),
        (CHANGE, ""),
        (CHANGE, "password=x&permissions=1"),
        (CHANGE, "username=bob&permissions=1&permissions=1"),
        (CHANGE, "username=bob&logfileurl=x%0Apermissions%3D1"),
        (CHANGE, "username=bob&logfileurl=x%01"),
        (CHANGE, "username=bob&permissions=one"),
        (GET, ""),
        (GET, "username=eve"),
        (GET, "user=bob"),
        (GET, "username"),
    ],
    ids=lambda value: str(value)[:40],
)
def test_bad_arguments_are_refused_and_change_nothing(site, command, text):
    site.add_user("bob", "pw", 0)
    site.serve()
    before = user_texts(site)
    assert call(site, command, "", text) == (FAILED, "")
    assert user_texts(site) == before
    assert logged_in(site, "bob", "pw") == "username=bob&permissions=0"


NOBODYS_FILES = {
    "damaged.usr": b"no settings\n",
    "nameless.usr": b"[UserInfo]\npermissions=1\nPlaintextPassword=x\n",
    "empty.usr": b"[UserInfo]\nusername=\n",
    "nul.usr": b"[UserInfo]\nusername=a\0b\n",
    "nothing.usr": b"",
}


def test_nobodys_files_survive_what_is_done_to_nobody(site):
    """What has no usable name is nobody's: a command without a name reaches none of them."""
    site.add_user("bob", "pw", 0)
    for name, content in NOBODYS_FILES.items():
        site.user_file(name, content)
    site.serve()
    assert call(site, LIST) == (DONE, "u1=bob&p1=0")
    before = {path.name: path.read_bytes() for path in site.users.iterdir()}
    assert before.keys() == NOBODYS_FILES.keys() | {"bob.usr"}
    for text in ("", "username=", "username", "x=y", "username%3D", "username=%00"):
        assert call(site, DELETE, "", text) == (FAILED, ""), text
    assert call(site, ADD, "", "username=&password=x") == (FAILED, "")
    assert call(site, CHANGE, "", "username=&password=x&permissions=1&logfileurl=x&maxprofiles=1") == (DONE, "")
    assert {path.name: path.read_bytes() for path in site.users.iterdir()} == before
    assert before.items() >= NOBODYS_FILES.items()
    assert logged_in(site, "bob", "pw") == "username=bob&permissions=0"


def test_a_change_of_nobody_is_no_failure_and_makes_nothing(site):
    site.serve()
    before = user_texts(site)
    assert call(site, CHANGE, "", "username=nobody&permissions=1&password=x") == (DONE, "")
    assert user_texts(site) == before
    assert logged_in(site, "nobody", "x") is None


@pytest.mark.parametrize("name", ["..%2F..%2Fevil", "%2Ftmp%2Fevil", ".evil", "a%2Fb", "..", "evil.usr%2F..", "%2E%2E"])
def test_a_name_like_a_path_makes_no_file_outside(site, name):
    site.serve()
    call(site, LIST)

    def everything():
        return {p for p in site.scratch.rglob("*") if p.parent != site.users and "oxscript" not in p.name}

    before = everything() | {site.data / "ox_remote.key"}
    status, text = call(site, ADD, "", f"username={name}&password=x")
    assert status in (DONE, FAILED) and text == ""
    assert everything() <= before
    names = [path.name for path in site.users.iterdir()]
    assert len(names) == (status == DONE)
    assert all(re.fullmatch(r"[A-Za-z0-9_@%-][A-Za-z0-9_@.%-]*\.usr", name) for name in names), names


def test_a_changed_file_keeps_what_others_wrote_into_it(site):
    site.add_user("bob", "pw", 0, more="colour=green\n; a remark\n[Other]\nusername=not bob\n")
    site.serve()
    assert call(site, CHANGE, "", "username=bob&permissions=2") == (DONE, "")
    text = (site.users / "bob.usr").read_text()
    assert "colour=green\n" in text.replace(" ", "") and "; a remark\n" in text and "[Other]\n" in text
    assert "PlaintextPassword" not in text and mode_of(site.users / "bob.usr") == 0o600
    assert logged_in(site, "bob", "pw") == "username=bob&permissions=2"


def test_a_list_that_is_too_long_ends_with_a_whole_entry(site):
    for number in range(2500):
        site.user_file(f"u{number:04}.usr", b"[UserInfo]\nusername=user-%04d-abcdefghij\npermissions=1\n" % number)
    site.serve()
    status, text = call(site, LIST)
    assert status == DONE and 65000 < len(text) < 65536
    pairs = text.split("&")
    assert len(pairs) % 2 == 0
    for number in range(len(pairs) // 2):
        assert pairs[2 * number : 2 * number + 2] == [f"u{number + 1}=user-{number:04}-abcdefghij", f"p{number + 1}=1"]


@pytest.fixture
def small_disk(site):
    """A file system of 64 KiB in the place of the users directory."""
    command = ["mount", "-t", "tmpfs", "-o", "size=64k,mode=700", "none", site.users]
    mounted = subprocess.run(command, capture_output=True)
    if mounted.returncode != 0:
        pytest.skip(f"cannot mount: {mounted.stderr.decode().strip()}")
    yield site.users
    subprocess.run(["umount", "-l", site.users], check=True)


@needs_root
def test_a_full_disk_refuses_a_change_and_loses_nothing(site, small_disk):
    site.add_user("alice", "pw", 2)
    site.add_user("bob", "pw", 1, more="logfileurl=" + "x" * 3000 + "\n")
    server = site.serve()
    assert call(site, LIST) == (DONE, "u1=alice&p1=2&u2=bob&p2=1")
    with open(small_disk / "filler", "wb", buffering=0) as filler, contextlib.suppress(OSError):
        while True:
            filler.write(b"x" * 512)
    before = {name: text for name, text in user_texts(site).items() if name.endswith(".usr")}
    assert call(site, ADD, "", "username=eve&password=x") == (FAILED, "")
    for change in ("permissions=9", "password=new", "logfileurl=" + "y" * 3500, "maxprofiles=3"):
        call(site, CHANGE, "", "username=alice&" + change)
        call(site, CHANGE, "", "username=bob&" + change)
    assert {name: text for name, text in user_texts(site).items() if name != "filler"} == before
    assert call(site, LIST) == (DONE, "u1=alice&p1=2&u2=bob&p2=1")
    assert logged_in(site, "alice", "pw") == "username=alice&permissions=2"
    assert logged_in(site, "alice", "new") is None
    server.stop()
    server = site.serve()
    assert logged_in(site, "bob", "pw") == "username=bob&permissions=1"
    (small_disk / "filler").unlink()
    assert call(site, CHANGE, "", "username=alice&permissions=9&password=new") == (DONE, "")
    assert logged_in(site, "alice", "new") == "username=alice&permissions=9"
    server.stop()
    site.allow("status", ".*No space left on device.*")


# ------------------------------------------------------------------------------------------------------------ profiles


def test_profiles_of_a_user(site):
    site.add_profile("sales.wlp", "alice, bob")
    site.add_profile("web.wlp", "alice")
    no_remote_service(site)
    site.serve()
    ask = "username={}&profile_id={}".format
    assert call(site, LIST_PROFILES, "", "username=alice") == (DONE, "profile_id=sales.wlp&profile_id=web.wlp")
    assert call(site, LIST_PROFILES, "", "username=bob") == (DONE, "profile_id=sales.wlp")
    assert call(site, LIST_PROFILES, "", "username=Bob") == (DONE, "")
    assert call(site, LIST_PROFILES, "", "username=admin") == (DONE, "profile_id=sales.wlp&profile_id=web.wlp")
    assert call(site, LIST_PROFILES, "", "") == (FAILED, "")
    assert call(site, TEST_PROFILE, "", ask("bob", "sales.wlp")) == (DONE, "")
    assert call(site, TEST_PROFILE, "", ask("bob", "sales")) == (DONE, "")
    assert call(site, TEST_PROFILE, "", ask("bob", "web.wlp")) == (FAILED, "")
    assert call(site, TEST_PROFILE, "", ask("bob", "Sales.wlp")) == (FAILED, "")
    assert call(site, TEST_PROFILE, "", "username=bob") == (FAILED, "")


@pytest.mark.parametrize("command", [32, 33, 34, 35])
@pytest.mark.parametrize("remote", [False, True], ids=["no remote service", "unreachable"])
def test_a_profile_is_read_again(site, command, remote):
    site.add_profile("sales.wlp", "alice")
    site.add_profile("web.wlp", "alice")
    if not remote:
        no_remote_service(site)
    site.serve()
    away = (UNREACHABLE, "statusdesc=Server is unavailable at 127.0.0.1:1.") if remote else (DONE, "")
    (site.root / "profiles/sales.wlp").write_text("[Profile]\nUsers=bob\n")
    (site.root / "profiles/web.wlp").write_text("[Profile]\nUsers=bob\n")
    assert call(site, LIST_PROFILES, "", "username=bob") == (DONE, "")
    assert call(site, command, "", "profile_id=sales.wlp") == away
    assert call(site, LIST_PROFILES, "", "username=bob") == (DONE, "profile_id=sales.wlp")
    assert call(site, LIST_PROFILES, "", "username=alice") == (DONE, "profile_id=web.wlp")
    (site.root / "profiles/sales.wlp").unlink()
    assert call(site, command, "", "profile_id=sales.wlp") == away
    assert call(site, LIST_PROFILES, "", "username=bob") == (DONE, "")
    for bad in ("", "username=bob", "profile_id=a&profile_id=b"):
        assert call(site, command, "", bad) == (FAILED, "")
    for foreign in ("..%2Fprofiles%2Fweb.wlp", "%2Fdev%2Fzero", ".web.wlp", ""):
        assert call(site, command, "", f"profile_id={foreign}") == away
    assert call(site, LIST_PROFILES, "", "username=admin") == (DONE, "profile_id=web.wlp")
    if remote:
        site.expect("err", r"oxxHttpServer::SendERSRequest : connect failed - socket error = 111 Connection refused")


# ---------------------------------------------------------------------------------------------------------- encryption


@pytest.mark.parametrize(
    "sent,clear",
    [
        ("secret=abc", "abc"),
        ("abc", "abc"),
        ("x=a=b", "a=b"),
        ("a=b", "b"),
        ("x=", ""),
        ("x=a%26b%3Dc%25d%2Be+f", "a&b=c%d+e f"),
        ("x=a%4zb%", "a%4zb%"),
        ("x=\xc3\xa4 \xff", "\xc3\xa4 \xff"),
        ("x=ab%00cd", "ab"),
        ("x=" + "p" * 351, "p" * 351),
    ],
    ids=lambda text: repr(text[:20]),
)
def test_what_is_encrypted_is_decrypted_again(site, sent, clear):
    site.serve()
    status, sealed = call(site, ENCRYPT, "", sent)
    assert status == DONE and re.fullmatch(r"[A-Za-z0-9_.-]+", sealed)
    assert len(clear) < 10 or clear not in sealed
    assert call(site, ENCRYPT, "", sent)[1] != sealed, "a new seal each time"
    assert call(site, DECRYPT, "", f"decode={sealed}") == (DONE, clear)
    for broken in (sealed[:-1], sealed[:5] + ("A" if sealed[5] != "A" else "B") + sealed[6:], sealed + "A", "x", ""):
        assert call(site, DECRYPT, "", f"decode={broken}") == (FAILED, "")
    assert call(site, DECRYPT, "", sealed) == (FAILED, "")
    assert mode_of(site.data / "ox_remote.key") == 0o600


# --------------------------------------------------------------------------------------------- what others carry out


@pytest.mark.parametrize("command", [99, 0, -1, 19, 25, 29, 36, 62, 69, 72, 2147483647, -2147483648])
def test_an_unknown_command_is_for_the_remote_service(site, command):
    server = site.serve()
    answer = (UNREACHABLE, "statusdesc=Server is unavailable at 127.0.0.1:1.")
    assert call(site, command, "ctx", "a=b") == answer
    site.expect(
        "err", r"oxxHttpServer::SendERSRequest : connect failed - socket error = 111 Connection refused", times=1
    )
    server.stop()
    no_remote_service(site)
    site.serve()
    assert call(site, command, "ctx", "a=b") == (NOT_HANDLED, "")


def test_the_remote_service_gets_the_context_and_answers(site):
    listener = socket.create_server(("127.0.0.1", 0))
    site.main_ini.write_text(f"[interface]\nersaddress=127.0.0.1:{listener.getsockname()[1]}\n")
    requests = []

    def serve():
        for answer in (b"0|done|EOT", b"42||EOT", b"-7|x|EOT"):
            connection, _ = listener.accept()
            with connection:
                requests.append(remote_request(connection))
                connection.sendall(answer)

    thread = threading.Thread(target=serve, daemon=True)
    thread.start()
    site.serve()
    answers = take_steps(
        site, ("call", 99, "ctx", "a=b+c%3Dd"), ("call", 100, "", ""), ("call", 99, "ctx", "x|y"),
        ("call", 99, "c|x", "a=b")
    )
    thread.join(timeout=10)
    assert answers == [(0, "done"), (42, ""), (-7, "x"), (FAILED, "")]
    assert requests == [b"ctx|99|a=b c=d|EOT", b"|100|x|EOT", b"ctx|99|x|y|EOT"]
    listener.close()
