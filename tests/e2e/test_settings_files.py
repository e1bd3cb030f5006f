"""The two settings files: missing, unreadable, odd and changed."""

import os

import pytest

from harness import (
    BANNER,
    DEAD_PID,
    IS_ROOT,
    NOBODY,
    SLOWDOWN,
    free_port,
    is_listening,
    not_running,
    spoil_settings,
    wait_until,
)

UNREADABLE = "Error: unable to read configuration files."
OPTIONS = ["-start", "-stop", "-status", "-debug", "-bogus"]


def exception_line(path):
    return f"Exception caught in ./ox_remote_exe/src/unix/xmain at ln. 607: {path}\n"


@pytest.mark.parametrize("missing", ["ox_remote.ini", "oxm_oxx/oxm_oxx.ini"])
def test_a_missing_settings_file_refuses_every_option(site, missing):
    (site.root / missing).unlink()
    for arguments in [[option] for option in OPTIONS] + [[]]:
        assert site.run(*arguments) == (1, UNREADABLE)


@pytest.mark.parametrize("broken", ["ox_remote.ini", "oxm_oxx/oxm_oxx.ini"])
@pytest.mark.parametrize("kind", ["directory", "nul", "pipe", "device"])
def test_a_settings_file_that_does_not_load_is_named(site, broken, kind):
    """At once: no command waits for somebody who writes to a pipe, or for the end of a device."""
    spoil_settings(site.root / broken, kind)
    for arguments in [[option] for option in OPTIONS] + [[]]:
        out = site.run(*arguments, stderr=exception_line(f"./{broken}"), timeout=3 * SLOWDOWN)
        assert out == (1, UNREADABLE)
    assert not site.pid_file.exists()


@pytest.mark.parametrize("broken", ["ox_remote.ini", "oxm_oxx/oxm_oxx.ini"])
def test_a_settings_file_without_read_permission_is_named(site, broken):
    site.use_ordinary_user()
    (site.root / broken).chmod(0)
    for option in ("-status", "-debug"):
        assert site.run(option, stderr=exception_line(f"./{broken}")) == (1, UNREADABLE)


def test_sections_and_keys_in_any_case_comments_byte_order_mark_and_crlf(site):
    port = free_port()
    ids = "[UNIX]\r\nUID = 0\r\nGID = 0\r\n" if IS_ROOT else ""
    site.ini.write_bytes(
        b"\xef\xbb\xbf"
        + (
            "text before the first section = ignored\r\n"
            "; WebPort=1\r\n# WebPort=2\r\n" + ids + "[remoteconfiguration]\r\n"
            "webaddress = 127.0.0.1 \r\n"
            "WEBPORT = 3\r\n"
            ";webport = 4\r\n"
            f"  webPort  =  {port}  \r\n"
            "WebLogFileName =  odd name.log \r\n"
            "[AUDIT]\r\nDebugLevel = 1\r\n"
        ).encode()
    )
    site.port = port
    site.settings["RemoteConfiguration"]["WebLogFileName"] = "odd name.log"
    site.serve()
    assert site.get("/hello.htm").status == 200
    assert len(site.access()) == 1


@pytest.mark.parametrize("text", ["abc", "", "-"])
def test_a_text_that_is_no_number_reads_as_the_default(site, text):
    site.configure(web={"WebUserTimeout": text, "WebMaxConnectionsPerAddress": text}, audit={"debuglevel": text})
    server = site.serve()
    assert site.get("/hello.htm").status == 200
    server.stop()
    assert f"Starting server: connecting to 127.0.0.1 on port {site.port}." in site.err()
    assert "Server stopping..." not in site.err()


def test_a_settings_file_may_be_empty(site):
    """All defaults hold: port 80 may or may not be free here, so only a command is tried."""
    site.settings = {"unix": {}, "Audit": {}, "RemoteConfiguration": {}}
    site.ini.write_text("")
    site.main_ini.write_text("")
    if IS_ROOT:
        site.give_to(1)
    site.pid_file.write_text(f"{DEAD_PID}\n")
    assert site.run("-status") == (1, BANNER + not_running(3))


def test_an_unwritable_program_directory_is_reported_and_commands_still_answer(site):
    site.run("-status")  # makes the status directory
    site.startup_log.unlink()
    if IS_ROOT:
        os.chown(site.root / "oxm_oxx/datfiles/statuslogs", NOBODY, NOBODY)
        site.user = NOBODY
        unlock = lambda: None
    else:
        site.root.chmod(0o555)
        unlock = lambda: site.root.chmod(0o755)
    try:
        denied = "oxAuditFile error: Permission denied\n"
        assert site.run("-status", stderr=denied) == (1, BANNER + not_running(2))
        assert site.run("-bogus", stderr=denied)[0] == 1
        code, out = site.run("-debug", stderr=denied)
        pid_file = str(site.pid_file)
        lines = [
            f"Error: can't open pidfile {pid_file}: Permission denied",
            f"Error: Unable to create lock file, {pid_file}.",
        ]
        assert code == 1
        assert out == BANNER + "\n[Debug]\n\n" + "".join(f"{line}\n" for line in lines)
        assert site.status() == lines
        for line in lines:
            site.expect("status", line.replace("(", r"\(").replace(")", r"\)"), times=1)
    finally:
        unlock()


def test_a_status_log_that_cannot_be_opened_is_reported_and_the_server_runs(site):
    """Its lines are lost, also on the screen; the server serves."""
    site.run("-status")
    site.status_log.mkdir()
    server = site.serve(ready=False)
    wait_until(lambda: is_listening(site.port), "the server listens")
    assert site.get("/hello.htm").status == 200
    server.expected_stderr = None
    server.stop()


def test_a_web_root_that_does_not_exist_gives_404(site):
    for path in site.web.iterdir():
        path.unlink()
    site.web.rmdir()
    site.serve()
    assert site.get("/").status == 404
