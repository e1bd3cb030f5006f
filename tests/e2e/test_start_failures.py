"""Starts that cannot succeed: each gives its lines in order and exit status 1, and leaves nothing behind."""

import os
import re
import socket

import pytest

from conftest import needs_root
from harness import (
    BANNER,
    DEBUG_NOTICE,
    IS_ROOT,
    SLOWDOWN,
    free_port,
    mode_of,
    port_in_use_line,
    process_status,
    unprivileged_port_start,
    wait_until,
)

FAILED = [
    "Error: The remote interface server failed to initialize.",
    'Refer to "ox_remote.err" for more information.',
]


def check_failed_start(site, messages):
    """Runs the server, which must give up with these lines in its message log."""
    code, out = site.run("-debug")
    assert code == 1
    assert out == BANNER + DEBUG_NOTICE + "".join(f"{line}\n" for line in FAILED)
    assert site.status() == FAILED
    assert site.err() == messages
    assert not site.pid_file.exists()
    for line in FAILED:
        site.expect("status", re.escape(line), times=1)
    for line in messages:
        site.allow("err", re.escape(line))


@pytest.fixture
def occupied():
    with socket.socket() as holder:
        holder.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
        port = free_port()
        holder.bind(("127.0.0.1", port))
        holder.listen()
        yield port


def in_use_lines(port):
    return [
        f"Starting server: connecting to 127.0.0.1 on port {port}.",
        "Socket bind failed: Address already in use (98)",
        port_in_use_line(port),
    ]


@pytest.mark.parametrize("logging", [0, 1])
def test_a_port_in_use(site, occupied, logging):
    site.configure(web={"WebPort": occupied, "WebLogging": logging})
    check_failed_start(site, in_use_lines(occupied))


@pytest.mark.parametrize("logging", [0, 1])
def test_a_port_in_use_at_level_9(site, occupied, logging):
    site.configure(web={"WebPort": occupied, "WebLogging": logging}, audit={"debuglevel": 9})
    code, _ = site.run("-debug")
    assert code == 1
    lines = in_use_lines(occupied)
    opened = [f"Logging server activity to {site.root}/ox_remote.log."] if logging else []
    closed = ["Server log closed."] if logging else []
    assert site.err() == ["Debug level is now 9.", *site.setup_lines(), *opened, *lines[:2], *closed, lines[2]]
    assert [line for line in site.status() if line in FAILED] == FAILED
    for line in lines:
        site.allow("err", re.escape(line))
    for line in FAILED:
        site.allow("status", re.escape(line))


def test_two_installations_on_one_port(make_site):
    first, second = make_site(), make_site()
    first.serve()
    second.configure(web={"WebPort": first.port})
    check_failed_start(second, in_use_lines(first.port))
    assert first.get("/hello.htm").status == 200


def test_the_pointer_to_the_message_log_is_a_fixed_text(site, occupied):
    site.configure(web={"WebPort": occupied, "WebErrorLog": "other.err"})
    check_failed_start(site, in_use_lines(occupied))
    assert not (site.root / "ox_remote.err").exists()


def test_port_0_is_no_port(site):
    site.configure(web={"WebPort": 0})
    check_failed_start(site, ["Server unable to start - an address or port was not specified."])


@pytest.mark.parametrize("address", ["192.0.2.1", "203.0.113.77"])
def test_an_address_of_another_machine(site, address):
    site.configure(web={"WebAddress": address})
    check_failed_start(
        site,
        [
            f"Starting server: connecting to {address} on port {site.port}.",
            "Socket bind failed: Cannot assign requested address (99)",
            "Server unable to start. (error=99)",
        ],
    )


def test_an_address_that_cannot_be_resolved(site):
    """The server must not report a success while nobody can reach it."""
    site.configure(web={"WebAddress": "no-such-host.invalid"})
    site.allow("err", r"Socket bind failed: .+")
    site.allow("err", r"Server unable to start.+")
    site.allow("err", r".*no-such-host\.invalid.*")
    for line in FAILED:
        site.expect("status", re.escape(line), times=1)
    code, out = site.run("-debug", timeout=30 * SLOWDOWN)
    assert code == 1
    assert out == BANNER + DEBUG_NOTICE + "".join(f"{line}\n" for line in FAILED)
    assert site.err()[0] == f"Starting server: connecting to no-such-host.invalid on port {site.port}."
    assert len(site.err()) > 1


def test_a_privileged_port_without_the_right(site):
    start = unprivileged_port_start()
    if start < 10:
        pytest.skip("this system has no privileged ports")
    port = free_port(2, start)
    site.configure(web={"WebPort": port})
    site.use_ordinary_user()
    check_failed_start(
        site,
        [
            f"Starting server: connecting to 127.0.0.1 on port {port}.",
            "Socket bind failed: Permission denied (13)",
            "Server unable to start. (error=13)",
        ],
    )


def test_no_address_means_every_local_address(site):
    site.configure(web={"WebAddress": None})
    site.serve()
    assert site.err() == [f"Starting server: connecting to local host on port {site.port}."]
    assert site.get("/hello.htm").status == 200
    with socket.socket() as client:
        client.settimeout(20)
        client.connect(("127.9.9.9", site.port))
        client.sendall(b"GET /hello.htm HTTP/1.0\r\n\r\n")
        assert client.recv(15) == b"HTTP/1.0 200 OK"


def test_a_host_name_as_address(site):
    site.configure(web={"WebAddress": "localhost"})
    site.serve()
    assert site.err() == [f"Starting server: connecting to localhost on port {site.port}."]
    assert site.get("/hello.htm").status == 200


def test_twenty_rounds_of_start_and_stop(site):
    """A client that connects as soon as the start line is there is served, and no round leaves an error line."""
    site.configure(audit={"debuglevel": 5})
    for _ in range(20):
        server = site.serve()
        assert site.get("/hello.htm").status == 200
        assert site.run("-stop")[0] == 0
        assert server.wait_exit() == 0
        assert not site.pid_file.exists()
        ends = [line for line in site.err() if not line.startswith(("Removing", "Server log closed"))][-2:]
        assert ends[0] == "Daemon thread exiting normally."
        assert re.fullmatch(r"session thread 0x[0-9A-F]+ exiting\.", ends[1])
    site.allow("err", r"1 sessions not cleaned up on exit\.")


# ------------------------------------------------------------------------------------------------------- identities


@needs_root
def test_a_server_of_root_runs_under_the_configured_ids(site):
    start = unprivileged_port_start()
    site.port = free_port(2, start) if start >= 10 else site.port
    site.configure(unix={"uid": 1, "gid": 1}, audit={"debuglevel": 7}, web={"WebPort": site.port})
    site.give_to(1)
    server = site.serve()
    assert site.get("/hello.htm").status == 200
    fields = process_status(server.pid)
    assert fields["Uid"].split()[:2] == ["0", "1"]
    assert fields["Gid"].split() == ["1", "1", "1", "1"]
    assert fields["Groups"].split() == ["1"]
    assert "gid=1 egid=1" in site.status() and "uid=0 euid=1" in site.status()
    for path in (site.access_log, site.error_log, site.status_log, site.pid_file):
        assert (path.stat().st_uid, path.stat().st_gid) == (1, 1), path
    for task in os.listdir(f"/proc/{server.pid}/task"):
        text = open(f"/proc/{server.pid}/task/{task}/status").read()
        assert re.search(r"^Uid:\t0\t1\t", text, re.M)
    server.signal(16)
    wait_until(lambda: sum(line.startswith("Starting server") for line in site.err()) == 2, "the second start")
    wait_until(lambda: "Server stopping..." in site.err(), "the stop")
    assert wait_until(lambda: answered(site), "an answer on the privileged port")


def answered(site):
    try:
        return site.get("/hello.htm").status == 200
    except OSError:
        return False


@needs_root
def test_files_that_the_configured_user_may_not_read_are_not_found(site):
    site.configure(unix={"uid": 1, "gid": 1})
    site.page("secret.htm", b"secret").chmod(0o600)
    site.give_to(1)
    os.chown(site.web / "secret.htm", 0, 0)
    site.serve()
    assert site.get("/secret.htm").status == 404


@needs_root
def test_a_directory_that_the_configured_user_may_not_write_ends_the_start(site):
    site.run("-status")
    site.startup_log.unlink()
    site.configure(unix={"uid": 1, "gid": 1})
    os.chown(site.root / "oxm_oxx/datfiles/statuslogs", 1, 1)
    code, out = site.run("-debug", stderr="oxAuditFile error: Permission denied\n")
    lines = [
        f"Error: can't open pidfile {site.pid_file}: Permission denied",
        f"Error: Unable to create lock file, {site.pid_file}.",
    ]
    assert code == 1
    assert out == BANNER + DEBUG_NOTICE + "".join(f"{line}\n" for line in lines)
    for line in lines:
        site.expect("status", re.escape(line), times=1)


@needs_root
def test_user_id_65535_is_named_a_security_risk(site):
    site.configure(unix={"uid": 65535})
    site.give_to(65535)
    server = site.serve()
    assert process_status(server.pid)["Uid"].split()[1] == "65535"
    assert site.get("/hello.htm").status == 200
    line = "Warning: running as uid 65535 is a security risk."
    assert line in site.status()
    site.expect("status", re.escape(line), times=1)


@needs_root
@pytest.mark.parametrize("level", [1, 7])
def test_user_id_minus_1_is_refused_by_the_system_and_named_a_security_risk(site, level):
    site.configure(unix={"uid": -1}, audit={"debuglevel": level})
    server = site.serve()
    server.expected_stderr = "seteuid: Invalid argument"
    assert process_status(server.pid)["Uid"].split() == ["0"] * 4
    assert site.get("/hello.htm").status == 200
    warning = "Warning: running as uid -1 is a security risk."
    identity = [line for line in site.status() if "uid" in line or "gid" in line]
    if level == 7:
        assert identity == ["gid=0 egid=0", "seteuid: Invalid argument", "uid=0 euid=0", warning]
        site.expect("status", "seteuid: Invalid argument", times=1)
    else:
        assert identity == [warning]
    site.expect("status", re.escape(warning), times=1)


def test_an_ordinary_user_runs_the_server(site):
    site.configure(audit={"debuglevel": 9})
    site.use_ordinary_user()
    server = site.serve()
    assert site.get("/hello.htm").status == 200
    uid = str(site.user if IS_ROOT else os.getuid())
    assert process_status(server.pid)["Uid"].split() == [uid] * 4
    assert not any("uid=" in line or "gid=" in line for line in site.status())
    assert site.run("-status")[0] == 0
    assert site.run("-stop")[0] == 0
    assert server.wait_exit() == 0


@pytest.mark.parametrize("umask", [0, 0o022, 0o077])
def test_modes_of_the_files_that_the_server_makes(site, umask):
    server = site.serve(umask=umask)
    site.get("/hello.htm")
    assert mode_of(site.access_log) == 0o644
    assert mode_of(site.error_log) == 0o644
    assert mode_of(site.pid_file) == 0o664
    assert mode_of(site.status_log) == 0o644 & ~umask
    assert mode_of(site.status_log.parent) == 0o755 & ~umask
    assert process_status(server.pid)["Umask"] == "0000"
