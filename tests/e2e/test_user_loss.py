"""The user files: damage, lost keys and unreadable files, other directories and identities."""

import re

import pytest

from harness import IS_ROOT, mode_of, wait_until
from userfiles import TOO_LONG, cipher_text, key_file, opens, serve

UNDECIPHERABLE = "Password for user {0} cannot be deciphered. User {0} will not be used."


def expect_undecipherable(site, name, times=1):
    line = UNDECIPHERABLE.format(name)
    assert site.status().count(line) == times
    site.expect("status", re.escape(line), times=times)


# ------------------------------------------------------------------------------------------------- damage and loss


def enciphered(site, *names):
    """Users whose files hold enciphered passwords, and a server that has stopped again."""
    paths = [site.add_user(name, f"secret of {name}") for name in names]
    serve(site).stop()
    return paths


def test_a_damaged_password_is_good_for_nobody(site):
    path, _ = enciphered(site, "alice", "bob")
    text, sealed = path.read_text(), cipher_text(path)
    other = "B" if sealed[20] == "A" else "A"
    damaged = text.replace(sealed, sealed[:20] + other + sealed[21:])
    path.write_text(damaged)
    server = site.serve()
    expect_undecipherable(site, "alice")
    for password in ("secret of alice", "", sealed):
        assert not opens(site, "alice", password)
    assert opens(site, "bob", "secret of bob")
    assert path.read_text() == damaged, "the damaged file is left alone"
    path.write_text(text)
    server.reset()
    assert opens(site, "alice", "secret of alice")


@pytest.mark.parametrize("sealed", ["x", "secret of alice", "A" * 80, "a" * 80, "=" * 60, "a" + "_" * 2000])
def test_a_text_that_was_never_enciphered_is_good_for_nobody(site, sealed):
    path, _ = enciphered(site, "alice", "bob")
    path.write_text(f"[UserInfo]\nusername=alice\npassword={sealed}\nPlaintextPassword=second\n")
    before = path.read_bytes()
    site.serve()
    expect_undecipherable(site, "alice")
    for password in ("secret of alice", "", "second"):
        assert not opens(site, "alice", password)
    assert path.read_bytes() == before
    assert opens(site, "bob", "secret of bob")


@pytest.mark.parametrize("kind", ["lost", "foreign", "short", "empty", "directory", "unreadable"])
def test_without_its_key_no_enciphered_password_is_good(site, kind):
    if kind == "unreadable":
        site.use_ordinary_user()
    paths = enciphered(site, "alice", "bob")
    texts = [path.read_text() for path in paths]
    site.add_user("open", None)
    key = key_file(site)
    kept = key.rename(site.root / "kept.key")
    if kind == "directory":
        key.mkdir()
    elif kind == "unreadable":
        key.write_bytes(kept.read_bytes())
        key.chmod(0)
    elif kind != "lost":
        key.write_bytes({"foreign": b"k" * 32, "short": b"k" * 31, "empty": b""}[kind])
    site.serve().stop()
    server = site.serve()
    for name in ("alice", "bob"):
        expect_undecipherable(site, name, times=2)
        for password in (f"secret of {name}", "", "x"):
            assert not opens(site, name, password)
    assert opens(site, "open", "any"), "a user without a password needs no key"
    assert [path.read_text() for path in paths] == texts, "no file is rewritten"
    assert key.exists() == (kind != "lost"), "a key is made only for something to encipher"
    if kind == "directory":
        key.rmdir()
    kept.rename(key)
    server.reset()
    server.stop()
    site.serve()
    assert opens(site, "alice", "secret of alice") and opens(site, "bob", "secret of bob")


@pytest.mark.parametrize("kind", ["short", "directory"])
def test_a_damaged_key_is_never_replaced(site, kind):
    """Then a password by hand stays as it was written."""
    key = key_file(site)
    key.mkdir() if kind == "directory" else key.write_bytes(b"k" * 31)
    path = site.add_user("alice")
    before = path.read_bytes()
    server = serve(site)
    assert opens(site, "alice", "secret") and not opens(site, "alice", "x")
    assert path.read_bytes() == before
    assert key.is_dir() if kind == "directory" else key.read_bytes() == b"k" * 31
    key.rmdir() if kind == "directory" else key.unlink()
    server.reset()
    assert cipher_text(path)
    assert opens(site, "alice", "secret")


def test_a_file_that_cannot_be_read_concerns_its_user_only(site):
    site.use_ordinary_user()
    path = site.add_user("alice")
    site.add_user("bob")
    path.chmod(0)
    server = serve(site)
    assert not opens(site, "alice", "secret") and not opens(site, "alice", "")
    assert opens(site, "bob", "secret")
    server.reset()  # told once
    site.expect("status", re.escape(f"User file {path} cannot be read: Permission denied"), times=1)
    path.chmod(0o600)
    server.reset()
    assert opens(site, "alice", "secret")


def test_a_user_whose_file_became_unreadable_is_kept_as_it_was(site):
    site.use_ordinary_user()
    path = site.add_user("alice")
    server = serve(site)
    path.chmod(0)
    server.reset()
    assert opens(site, "alice", "secret") and not opens(site, "alice", "")
    site.expect("status", re.escape(f"User file {path} cannot be read: Permission denied"), times=1)


def not_found_line(site):
    return f"User database directory not found: {site.users}"


def test_a_directory_that_became_unreadable_keeps_its_users(site):
    site.use_ordinary_user()
    site.add_user("alice")
    server = serve(site)
    site.users.chmod(0)
    server.reset()
    assert site.err().count(not_found_line(site)) == 1
    site.expect("err", re.escape(not_found_line(site)), times=1)
    assert opens(site, "alice", "secret")
    site.users.chmod(0o700)
    server.reset()
    assert opens(site, "alice", "secret")


@pytest.mark.parametrize("kind", ["missing", "file", "unreadable"])
def test_a_server_without_its_users_directory_serves_what_needs_no_login(site, kind):
    if kind == "unreadable":
        site.use_ordinary_user()
        site.add_user("alice")
        site.users.chmod(0)
    else:
        site.users.rmdir()
        if kind == "file":
            site.users.write_bytes(b"")
    server = serve(site)
    assert site.err()[0] == not_found_line(site)
    site.expect("err", re.escape(not_found_line(site)), times=1)
    assert site.get("/hello.htm").status == 200
    assert not opens(site, "alice", "secret")
    if kind == "missing":
        assert not site.users.exists()
        site.users.mkdir(0o700)
    elif kind == "file":
        site.users.unlink()
        site.users.mkdir(0o700)
    else:
        site.users.chmod(0o700)
    site.add_user("alice")
    server.reset()
    assert opens(site, "alice", "secret")


def test_a_directory_that_cannot_be_written_keeps_the_passwords_by_hand(site):
    site.use_ordinary_user()
    path = site.add_user("alice")
    before = path.read_bytes()
    site.users.chmod(0o500)
    serve(site)
    assert opens(site, "alice", "secret") and not opens(site, "alice", "x")
    assert path.read_bytes() == before
    site.users.chmod(0o700)


def test_leftovers_of_an_interrupted_change_are_removed(site):
    leftover = site.user_file(".alice.usr.tmp-a1b2c3", b"[UserInfo]\nusername=alice\n")
    other = site.user_file(".alice.note", b"mine")
    site.add_user("alice")
    serve(site)
    assert not leftover.exists() and other.exists()


# -------------------------------------------------------------------------------------------- settings and identity


def test_userspath_names_another_directory_and_a_reset_takes_it(any_site):
    site = any_site
    site.configure(audit={"debuglevel": 3})
    site.add_user("alice")
    first, second = site.users, site.root / "people"
    second.mkdir(0o700)
    site._own(second)
    site.users = second
    site.add_user("bob")
    server = serve(site)
    assert opens(site, "alice", "secret") and not opens(site, "bob", "secret")
    site.configure(web={"userspath": second})
    server.reset()
    assert opens(site, "bob", "secret") and not opens(site, "alice", "secret")
    site.configure(web={"userspath": None})
    server.reset()
    assert opens(site, "alice", "secret") and not opens(site, "bob", "secret")
    lines = [line for line in site.err() if line.startswith("User database")]
    assert lines == [f"User database directory: {path}." for path in (first, second, first)]
    assert sorted(path.name for path in second.iterdir()) == ["bob.usr"]
    site.allow("err", r"Authentication failed: user (alice|bob)\.")


def test_an_empty_userspath_names_no_directory(site):
    """Not the usual one, and not the working directory."""
    path = site.add_user("alice")
    (site.root / "alice.usr").write_bytes(path.read_bytes())
    site.configure(web={"userspath": ""})
    server = serve(site)
    line = "User database directory not found: "
    assert site.err()[0] == line
    assert not opens(site, "alice", "secret")
    site.expect("err", line, times=1)
    site.configure(web={"userspath": None})
    server.reset()
    assert opens(site, "alice", "secret")


def test_userspath_may_be_relative_to_the_installation(site):
    site.configure(web={"userspath": "people"})
    site.users = site.root / "people"
    site.users.mkdir(0o700)
    path = site.add_user("alice")
    serve(site)
    assert opens(site, "alice", "secret")
    assert cipher_text(path)


@pytest.mark.skipif(not IS_ROOT, reason="needs root")
def test_a_server_of_root_writes_its_files_as_the_configured_user(site):
    site.configure(unix={"uid": 1, "gid": 1})
    site.give_to(1)
    path = site.add_user("alice")
    serve(site)
    for file in (path, key_file(site)):
        assert (file.stat().st_uid, file.stat().st_gid, mode_of(file)) == (1, 1, 0o600)


@pytest.mark.daemon
def test_the_daemons_empty_file_mask_opens_no_file_to_others(site):
    path = site.add_user("alice")
    site.add_user("bob", "p" * 41)
    site.page("deep/page.htm", b"a deep page\n")
    _, _, daemon = site.start_daemon(umask=0)
    assert opens(site, "alice", "secret") and not opens(site, "bob", "p" * 41)
    assert (mode_of(path), mode_of(key_file(site))) == (0o600, 0o600)
    for line in TOO_LONG:
        assert site.status().count(line.format("bob")) == 1
        site.expect("status", re.escape(line.format("bob")), times=1)
    assert daemon.alive()


def test_500_users(site):
    for number in range(500):
        site.add_user(f"user{number}", f"secret {number}", file=f"{number}.usr")
    server = serve(site)
    for number in (0, 123, 499):
        assert opens(site, f"user{number}", f"secret {number}")
        assert not opens(site, f"user{number}", f"secret {number + 1}")
    wait_until(lambda: all("Plaintext" not in path.read_text() for path in site.users.iterdir()), "all are enciphered")
    server.reset()
    assert opens(site, "user7", "secret 7")
