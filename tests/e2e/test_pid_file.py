"""The pid file: its text, its lock, and what odd contents do."""

import errno
import fcntl
import os
import re
import signal
import struct
import subprocess

import pytest

from conftest import needs_root
from harness import (
    ALREADY_RUNNING,
    BANNER,
    DEAD_PID,
    DEBUG_NOTICE,
    is_alive,
    mode_of,
    not_running,
    wait_until,
)


def lock_owner(path):
    """The process that holds a write lock on the whole file, 0 when none does."""
    with open(path, "r+b") as file:
        question = struct.pack("hhqqi", fcntl.F_WRLCK, os.SEEK_SET, 0, 0, 0)
        kind, _, start, length, pid = struct.unpack("hhqqi", fcntl.fcntl(file, fcntl.F_GETLK, question))
    if kind == fcntl.F_UNLCK:
        return 0
    assert (kind, start, length) == (fcntl.F_WRLCK, 0, 0)
    return pid


def run_in_a_group(site, option):
    """Runs a command from a shell that leads a process group with one more member: (the shell's own exit status,
    the command's exit status and output, whether the other member lives on)."""
    script = 'sleep 600 & echo $!; "$0" ' + option + '; echo "status $?"; wait'
    shell = subprocess.Popen(
        ["/bin/sh", "-c", script, str(site.exe)],
        cwd=site.root, env=site.environment(), stdout=subprocess.PIPE, stderr=subprocess.STDOUT,
        stdin=subprocess.DEVNULL, start_new_session=True, text=True,
    )
    sibling = int(shell.stdout.readline())
    text = ""
    try:
        for line in shell.stdout:
            if match := re.match(r"status (\d+)\n", line):
                return int(match[1]), text, is_alive(sibling) and shell.poll() is None
            text += line
        return None, text, False
    finally:
        for pid in (sibling, shell.pid):
            try:
                os.kill(pid, signal.SIGKILL)
            except ProcessLookupError:
                pass
        shell.wait()
        shell.stdout.close()


SIGNAL_FAILED = {
    "-stop": "Error: Failed to signal the server (3).\n\n",
    "-status": "Error: Failed to get the server status (3).\n\n",
}


@pytest.mark.parametrize("option", ["-stop", "-status"])
@pytest.mark.parametrize("text", ["abc", "", "0", "0\n", "\n", "x1"], ids=repr)
def test_a_pid_that_reads_as_0_is_never_signalled(site, text, option):
    site.pid_file.write_text(text)
    status, out, group_lives = run_in_a_group(site, option)
    assert group_lives, "the command signalled its own process group"
    assert (status, out) == (1, BANNER + SIGNAL_FAILED[option])


@pytest.fixture
def group(site):
    """A process group of the user that runs the commands."""
    site.use_ordinary_user()
    user = {"user": site.user, "group": site.user, "extra_groups": []} if site.user is not None else {}
    with subprocess.Popen(["/bin/sleep", "600"], start_new_session=True, **user) as leader:
        yield leader
        leader.kill()


@pytest.mark.parametrize("option", ["-stop", "-status"])
@pytest.mark.parametrize("text", ["-{}", "-{}\n", "-1", "-1\n"], ids=repr)
def test_a_number_that_names_a_group_of_processes_is_asked_about_but_never_signalled(site, group, text, option):
    """-1 names all processes."""
    text = text.format(group.pid)
    site.pid_file.write_text(text)
    assert site.run(option) == (1, BANNER + SIGNAL_FAILED[option])
    assert group.poll() is None and is_alive(group.pid)
    assert site.run("-debug") == (1, BANNER + DEBUG_NOTICE + ALREADY_RUNNING)
    assert site.pid_file.read_text() == text


@pytest.mark.parametrize("text", [f"-{DEAD_PID}", f"-{DEAD_PID}\n"], ids=repr)
def test_a_number_that_names_no_group_is_no_server(site, text):
    site.pid_file.write_text(text)
    for option in ("-stop", "-status"):
        assert site.run(option) == (1, BANNER + not_running(3))
    server = site.serve()
    assert site.get("/hello.htm").status == 200
    own = f"{server.pid}\n"
    assert site.pid_file.read_text() == own + text[len(own) :]


@pytest.mark.parametrize("text", ["abc", "", "0"], ids=repr)
def test_a_pid_that_reads_as_0_refuses_the_start(site, text):
    site.pid_file.write_text(text)
    status, out, group_lives = run_in_a_group(site, "-start")
    assert group_lives
    assert (status, out) == (1, BANNER + ALREADY_RUNNING)
    assert site.run("-debug") == (1, BANNER + DEBUG_NOTICE + ALREADY_RUNNING)
    assert site.pid_file.read_text() == text


def test_the_pid_file_holds_the_pid_and_its_lock_while_the_server_runs(site, server):
    assert site.pid_file.read_text() == f"{server.pid}\n"
    assert mode_of(site.pid_file) == 0o664
    assert lock_owner(site.pid_file) == server.pid
    site.run("-status")
    wait_until(lambda: any("is active on port" in line for line in site.status()), "the report")
    assert lock_owner(site.pid_file) == server.pid
    server.signal(16)
    wait_until(lambda: len([line for line in site.err() if line.startswith("Starting server")]) == 2, "the reset")
    site.run("-status")
    wait_until(lambda: site.get("/hello.htm").status == 200, "an answer")
    assert lock_owner(site.pid_file) == server.pid
    server.stop()
    assert not site.pid_file.exists()


def test_a_stale_pid_file_is_written_over_and_its_tail_stays(site):
    site.pid_file.write_text(f"{DEAD_PID}\n")
    server = site.serve()
    text = f"{server.pid}\n"
    assert site.pid_file.read_text() == text + f"{DEAD_PID}\n"[len(text) :]
    assert site.run("-status")[0] == 0
    assert site.run("-stop")[0] == 0
    assert server.wait_exit() == 0
    assert not site.pid_file.exists()


def test_only_the_first_19_bytes_are_read(site):
    site.pid_file.write_text(f"{DEAD_PID}".rjust(19) + "9" * 3000)
    assert site.run("-status") == (1, BANNER + not_running(3))


def test_a_lock_held_by_another_process_refuses_the_start_and_the_file_stays(site):
    path = str(site.pid_file)
    text = f"{DEAD_PID}\n"
    site.pid_file.write_text(text)
    if site.user is not None:
        os.chown(site.pid_file, site.user, site.user)
    with open(site.pid_file, "r+") as held:
        fcntl.lockf(held, fcntl.LOCK_EX)
        code, out = site.run("-debug")
        assert code == 1
        lines = [
            f"Error: Orvex Reporting UI is already running: {os.strerror(errno.EAGAIN)}",
            f"Error: Unable to create lock file, {path}.",
        ]
        assert out == BANNER + DEBUG_NOTICE + "".join(f"{line}\n" for line in lines)
        assert site.status() == lines
        assert site.pid_file.read_text() == text
    site.expect("status", r"Error: Orvex Reporting UI is already running: .+", times=1)
    site.expect("status", rf"Error: Unable to create lock file, {re.escape(path)}\.", times=1)


def test_the_running_server_refuses_a_second_one_by_its_lock_alone(site, server):
    """Somebody has written a dead process's number into the pid file; the lock still tells."""
    with open(site.pid_file, "r+") as file:
        file.write(f"{DEAD_PID}\n")
    code, out = site.run("-debug")
    assert code == 1
    assert "Error: Orvex Reporting UI is already running: " in out
    assert site.pid_file.exists()
    assert site.get("/hello.htm").status == 200
    site.expect("status", r"Error: Orvex Reporting UI is already running: .+", times=1)
    site.expect("status", r"Error: Unable to create lock file, .+\.", times=1)


def test_a_directory_in_place_of_the_pid_file_ends_the_start(site):
    site.pid_file.mkdir()
    path = str(site.pid_file)
    code, out = site.run("-debug")
    assert code == 1
    lines = [f"Error: can't open pidfile {path}: Is a directory", f"Error: Unable to create lock file, {path}."]
    assert out == BANNER + DEBUG_NOTICE + "".join(f"{line}\n" for line in lines)
    for line in lines:
        site.expect("status", re.escape(line), times=1)
    assert site.pid_file.is_dir()


def test_a_dead_server_that_nobody_has_reaped_does_not_refuse_the_next_start(site, server):
    server.signal(signal.SIGKILL)
    # Its last thread has ended, too: until then the process runs, whatever the state of its first one.
    assert os.waitid(os.P_PID, server.pid, os.WEXITED | os.WNOWAIT).si_pid == server.pid
    assert not is_alive(server.pid)
    assert site.read_pid() == server.pid
    second = site.serve()
    assert site.get("/hello.htm").status == 200
    assert site.read_pid() == second.pid
    assert server.wait_exit() == -signal.SIGKILL


@pytest.mark.parametrize("form", ["./ox_remote", "ox_remote", "absolute", "../site/ox_remote"])
def test_every_way_to_name_the_program_finds_the_same_directory(site, form):
    argv0 = str(site.exe) if form == "absolute" else form
    server = site.serve(argv0=argv0)
    assert site.pid_file.read_text() == f"{server.pid}\n"
    assert os.readlink(f"/proc/{server.pid}/cwd") == str(site.root)
    assert site.run("-status", argv0=argv0)[0] == 0
    code, out = site.run("-stop", argv0=argv0)
    assert code == 0 and out.endswith("The server has been stopped.\n")
    assert server.wait_exit() == 0
    assert site.startup_log.exists() and not site.pid_file.exists()


def test_the_program_found_through_the_path_works_in_the_current_directory(site):
    env = {"PATH": f"{site.root}:/usr/bin:/bin"}
    code, out = site.run("-status", argv0="ox_remote", env=env)
    assert (code, out) == (1, BANNER + not_running(2))
    assert site.startup_log.exists()


def test_a_relative_program_directory_is_entered_and_its_files_lie_there(make_site):
    """The settings are read where the command was given; the server then lives in the program's directory."""
    site = make_site()
    above = site.scratch
    (above / "oxm_oxx").mkdir()
    (above / "oxm_oxx" / "oxm_oxx.ini").write_bytes(site.main_ini.read_bytes())
    (above / "ox_remote.ini").write_bytes(site.ini.read_bytes())
    log = above / "oxm_oxx" / "datfiles" / "statuslogs" / "oxinterface.audit"
    server = site.serve(argv0="site/ox_remote", cwd=above, ready=False)
    line = f"The remote configuration server has been started ({server.pid})."
    wait_until(lambda: log.exists() and line in log.read_text(), "the start line")
    assert site.pid_file.read_text() == f"{server.pid}\n"
    assert os.readlink(f"/proc/{server.pid}/cwd") == str(site.root)
    assert site.get("/hello.htm").status == 200
    assert len(site.access()) == 1
    assert site.run("-stop", argv0="site/ox_remote", cwd=above)[0] == 0
    assert server.wait_exit() == 0
    assert not site.pid_file.exists()


@pytest.mark.parametrize("name,stem", [("srv.bin", "srv"), ("server", "server")])
def test_pid_file_and_start_up_log_are_named_after_the_program(site, name, stem):
    program = site.exe.rename(site.root / name)
    folder = site.root.rename(site.scratch / "v1.2")
    site.root, site.exe, site.web, site.ini = folder, folder / name, folder / "wwwroot", folder / "ox_remote.ini"
    server = site.serve(program=program.parent.with_name("v1.2") / name)
    assert (folder / f"{stem}.pid").read_text() == f"{server.pid}\n"
    assert site.run("-stop")[0] == 0
    assert server.wait_exit() == 0
    assert (folder / f"{stem}.startup").exists()
    assert not (folder / f"{stem}.pid").exists()


@pytest.mark.parametrize("form", ["./ox_remote", "ox_remote", "absolute"])
@pytest.mark.parametrize("name", ["back\\slash", "\\", "two  blanks ", " dir.with\\all . "], ids=repr)
def test_any_name_of_the_installation_directory_will_do(site, name, form):
    site.rename(name)
    if " " in name:
        line = r'Scripts cannot run: the directory name ".*" has a blank or control character in it\.'
        site.expect("err", line, times=1)
    argv0 = str(site.exe) if form == "absolute" else form
    assert site.run("-status", argv0=argv0) == (1, BANNER + not_running(2))
    server = site.serve(argv0=argv0)
    assert site.get("/hello.htm").status == 200
    assert site.pid_file.read_text() == f"{server.pid}\n"
    assert os.readlink(f"/proc/{server.pid}/cwd") == str(site.root)
    assert site.run("-status", argv0=argv0)[0] == 0
    code, out = site.run("-stop", argv0=argv0)
    assert code == 0 and out.endswith("The server has been stopped.\n")
    assert server.wait_exit() == 0
    assert not site.pid_file.exists()
    assert sorted(path.name for path in site.scratch.iterdir() if path.is_dir()) == sorted([name, "sanitizer"])


@needs_root
def test_the_pid_file_of_a_server_under_another_user_belongs_to_that_user(site):
    site.configure(unix={"uid": 1, "gid": 1})
    site.give_to(1)
    server = site.serve()
    assert (site.pid_file.stat().st_uid, site.pid_file.stat().st_gid) == (1, 1)
    server.stop()
    assert not site.pid_file.exists()
