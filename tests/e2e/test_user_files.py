"""The user files: what is taken from them and what is written back."""

import os
import re

import pytest

from harness import basic, mode_of, wait_until
from userfiles import TOO_LONG, cipher_text, key_file, opens, serve


# ---------------------------------------------------------------------------------------------- passwords by hand


def test_a_password_written_by_hand_is_enciphered_by_the_start(any_site):
    site = any_site
    path = site.add_user("alice", "a plain secret", 3)
    server = serve(site)
    text = path.read_text()
    assert "plaintext" not in text.lower() and "plain secret" not in text
    assert re.fullmatch(r"[A-Za-z0-9_-]{40,}", cipher_text(path))
    assert [line.split("=")[0].strip() for line in text.splitlines() if "=" in line].count("password") == 1
    assert re.search(r"^username *= *alice$", text, re.M) and re.search(r"^permissions *= *3$", text, re.M)
    assert mode_of(path) == 0o600
    assert sorted(entry.name for entry in site.users.iterdir()) == ["alice.usr"]
    assert (mode_of(key_file(site)), key_file(site).stat().st_size) == (0o600, 32)
    assert opens(site, "alice", "a plain secret")
    assert not opens(site, "alice", "")

    key = key_file(site).read_bytes()
    server.reset()
    assert opens(site, "alice", "a plain secret")
    server.stop()
    site.serve()
    assert opens(site, "alice", "a plain secret")
    assert path.read_text() == text and key_file(site).read_bytes() == key


def test_one_password_of_two_users_is_enciphered_to_two_texts(site):
    paths = [site.add_user("alice"), site.add_user("bob")]
    serve(site)
    assert cipher_text(paths[0]) != cipher_text(paths[1])
    assert opens(site, "alice", "secret") and opens(site, "bob", "secret")


@pytest.mark.parametrize("password", ["p" * 40, "ü" * 20], ids=["characters", "bytes"])
def test_a_password_of_40_bytes_is_taken(site, password):
    path = site.add_user("alice", password)
    serve(site)
    assert opens(site, "alice", password)
    assert not opens(site, "alice", password[:-1])
    assert cipher_text(path)


@pytest.mark.parametrize("password", ["p" * 41, "ü" * 20 + "x", "p" * 400], ids=["characters", "bytes", "many"])
def test_a_password_of_41_bytes_makes_the_user_unusable(site, password):
    path = site.add_user("alice", password)
    site.add_user("bob")
    before = path.read_bytes()
    server = serve(site)
    assert [line for line in site.status() if "alice" in line] == [line.format("alice") for line in TOO_LONG]
    assert path.read_bytes() == before
    assert not any(opens(site, "alice", tried) for tried in (password[:40], password[:200], ""))
    assert opens(site, "bob", "secret")
    server.reset()
    wait_until(lambda: sum("alice" in line for line in site.status()) == 2 * len(TOO_LONG), "the lines of the reset")
    for line in TOO_LONG:
        site.expect("status", re.escape(line.format("alice")), times=2)


@pytest.mark.parametrize(
    "password", ["a:b:c", ":", "übergröße", "two words", "a=b;c#d&e%41+", '"quoted"', "[UserInfo]"]
)
def test_odd_passwords(site, password):
    site.add_user("alice", password)
    server = serve(site)
    for _ in range(2):
        assert opens(site, "alice", password)
        assert not opens(site, "alice", password + "x") and not opens(site, "alice", password[:-1])
        server.stop()
        server = site.serve()


@pytest.mark.parametrize("text", ["", "PlaintextPassword=\n", "password=\n"])
def test_a_user_without_a_password_is_open_to_any(site, text):
    path = site.user_file("alice.usr", f"[UserInfo]\nusername=alice\n{text}".encode())
    before = path.read_bytes()
    server = serve(site)
    assert "plaintext" not in path.read_text().lower()
    if not text.lower().startswith("plaintext"):
        assert path.read_bytes() == before, "a file without a password by hand is left as it is"
    for _ in range(2):
        for password in ("", "any", "p" * 200):
            assert opens(site, "alice", password)
        server.reset()


# ------------------------------------------------------------------------------------------------- names and files


@pytest.mark.parametrize(
    "name", ["two words", "domain\\user", "müller", "a&b=c%41+d", "%s", "..", "a/b", "-", "x" * 200]
)
def test_odd_names_in_files_by_hand(site, name):
    site.add_user(name, file="somebody.usr")
    serve(site)
    assert opens(site, name, "secret")
    assert not opens(site, name, "Secret")
    assert sorted(entry.name for entry in site.users.iterdir()) == ["somebody.usr"]


def test_names_are_told_apart_by_case(site):
    site.add_user("alice", "one", file="1.usr")
    site.add_user("Alice", "two", file="2.usr")
    serve(site)
    assert opens(site, "alice", "one") and opens(site, "Alice", "two")
    assert not opens(site, "alice", "two") and not opens(site, "ALICE", "one")


def test_of_two_files_with_one_name_one_counts_and_always_the_same(site):
    site.add_user("alice", "one", file="b.usr")
    site.add_user("alice", "two", file="a.usr")
    server = serve(site)
    good = [opens(site, "alice", password) for password in ("one", "two")]
    assert sorted(good) == [False, True]
    server.stop()
    site.serve()
    assert [opens(site, "alice", password) for password in ("one", "two")] == good


NO_USERS = {
    "no-section.usr": b"username=alice\nPlaintextPassword=x\n",
    "other-section.usr": b"[User]\nusername=alice\nPlaintextPassword=x\n",
    "no-name.usr": b"[UserInfo]\nPlaintextPassword=x\n",
    "empty-name.usr": b"[UserInfo]\nusername=\nPlaintextPassword=x\n",
    "empty.usr": b"",
    "nul.usr": b"[UserInfo]\nusername=alice\n\0PlaintextPassword=x\n",
    ".hidden.usr": b"[UserInfo]\nusername=alice\nPlaintextPassword=x\n",
    "alice.usr~": b"[UserInfo]\nusername=alice\nPlaintextPassword=x\n",
    "alice.usr.bak": b"[UserInfo]\nusername=alice\nPlaintextPassword=x\n",
    "alice": b"[UserInfo]\nusername=alice\nPlaintextPassword=x\n",
    "garbage.usr": bytes(range(1, 256)) * 40,
    "large.usr": b"[UserInfo]\n" + b"; filling\n" * 200_000 + b"username=alice\nPlaintextPassword=x\n",
}


def test_what_is_no_user_file_is_left_alone(site):
    for name, content in NO_USERS.items():
        site.user_file(name, content)
    os.mkfifo(site.users / "fifo.usr", 0o600)
    (site.users / "directory.usr").mkdir()
    (site.users / "loop.usr").symlink_to("loop.usr")
    (site.users / "device.usr").symlink_to("/dev/zero")
    site.add_user("bob")
    serve(site)
    for name, reason in (("loop", "Too many levels of symbolic links"), ("large", "File too large")):
        site.expect("status", re.escape(f"User file {site.users}/{name}.usr cannot be read: {reason}"), times=1)
    assert opens(site, "bob", "secret")
    for password in ("x", ""):
        assert not opens(site, "alice", password)
        assert not opens(site, "", password)
    for name, content in NO_USERS.items():
        assert (site.users / name).read_bytes() == content, name
    assert not opens(site, "nobody", "")


KEPT = """\
; a comment at the top
[Other]
first = 1
second=two words

[UserInfo]
# a comment inside
username = alice
department = sales
PlaintextPassword = secret
permissions = 2
User1 = x
logfileurl = http://logs/alice
maxprofiles = 7
[Last]
key = value
"""


@pytest.mark.parametrize("end", ["\n", "\r\n"], ids=["lf", "crlf"])
@pytest.mark.parametrize("mark", ["", "\ufeff"], ids=["plain", "byte-order-mark"])
def test_what_else_a_file_holds_is_kept(site, end, mark):
    path = site.user_file("alice.usr", (mark + KEPT.replace("\n", end)).encode())
    serve(site)
    assert opens(site, "alice", "secret")
    assert not opens(site, "alice", "secret\r")

    def pairs(text):
        """The keys with their values and sections, and the comments."""
        found, section = set(), ""
        for line in text.lstrip("\ufeff").splitlines():
            if line.startswith("["):
                section = line
            elif line[:1] in (";", "#"):
                found.add(line)
            elif "=" in line:
                key, value = (part.strip() for part in line.split("=", 1))
                found.add((section, key, value))
        return found

    before = pairs(KEPT) - {("[UserInfo]", "PlaintextPassword", "secret")}
    after = pairs(path.read_bytes().decode())
    assert before <= after
    assert {entry[1] for entry in after - before} == {"password"}


@pytest.mark.parametrize(
    "text",
    [
        "[userinfo]\nUSERNAME=alice\nplaintextpassword=secret\n",
        "  [UserInfo]\n  username  =  alice  \n\tPlaintextPassword =\tsecret \n",
        "[UserInfo]\nusername=bob\nusername=alice\nPlaintextPassword=x\nPlaintextPassword=secret\n",
        "before=1\n[UserInfo]\n;username=bob\nusername=alice\nPlaintextPassword=secret\n",
    ],
)
def test_the_forms_of_a_file_by_hand(site, text):
    path = site.user_file("alice.usr", text.encode())
    server = serve(site)
    assert opens(site, "alice", "secret") and not opens(site, "alice", "x") and not opens(site, "bob", "secret")
    assert "secret" not in path.read_text()
    server.reset()
    assert opens(site, "alice", "secret") and not opens(site, "alice", "x")


@pytest.mark.parametrize(
    "value,all_profiles",
    [("0", 0), ("1", 1), ("2", 0), ("3", 1), ("-1", 1), ("0x11", 1), (" 1 ", 1), ("", 0), ("x", 0), ("-2", 0)],
)
def test_bit_0_of_the_permissions_opens_all_reports(site, value, all_profiles):
    site.add_user("alice", permissions=value)
    site.add_report("sales/page.htm")
    serve(site)
    assert site.get("/reports/sales/page.htm", basic("alice", "secret")).status == (200 if all_profiles else 403)


def test_a_file_without_permissions_gives_none(site):
    site.user_file("alice.usr", b"[UserInfo]\nusername=alice\nPlaintextPassword=secret\n")
    site.add_report("sales/page.htm")
    serve(site)
    assert site.get("/reports/sales/page.htm", basic("alice", "secret")).status == 403
