"""Scratch installations of the server, raw HTTP clients, and the check of all logs that every test ends with.

Only the standard library is used. Nothing here waits for a fixed time where it can wait for a condition, and every
wait has a deadline that grows with the kind of build under test (a sanitizer makes the server several times slower).
"""

import base64
import calendar
import contextlib
import os
import random
import re
import resource
import select
import shutil
import signal
import socket
import stat
import subprocess
import tempfile
import threading
import time
from pathlib import Path

BANNER = "\nOrvex Reporting UI\n"
INVALID = "\nError: Invalid argument\n"
USAGE = (
    "\nUsage:\n\n"
    "\tox_remote [-option]\n\n"
    "Where [-option] is one of:\n\n"
    "\t-start\t\tStarts the remote interface server.\n"
    "\t-stop\t\tStops the remote interface server.\n"
    "\t-status\t\tReports the current server status.\n\n"
)
STATUS_NOTICE = (
    "Status request sent to the server.\n"
    "Refer to ./oxm_oxx/datfiles/statuslogs/oxinterface.audit for results.\n\n"
)
ALREADY_RUNNING = "The server is already running!\n\n"
DEBUG_NOTICE = "\n[Debug]\n\n"

B400 = (
    b"<html><HEAD><TITLE>400 Bad Request</TITLE></HEAD><BODY><H1>400 Bad Request</H1>\r\n"
    b"The request could not be processed.<P></body></html>"
)
B404 = (
    b"<html><HEAD><TITLE>404 Not Found</TITLE></HEAD>\r\n<BODY><H1>404 Not Found</H1>\r\n"
    b"The requested URL was not found on this server.</body></html>"
)
B413 = (
    b"<html><HEAD><TITLE>413 Server Error</TITLE></HEAD>\r\n<BODY><H2>413 Request Entity Too Large</H2>"
    b"The server was unable to process your request.<P></body></html>"
)
B401 = (
    b"<html><HEAD><TITLE>401 Unauthorized</TITLE></HEAD><BODY><H1>401 Unauthorized</H1>\r\n"
    b"Authentication required.<P></body></html>"
)
B403 = (
    b"<html><HEAD><TITLE>403 Forbidden</TITLE></HEAD>\r\n<BODY><H1>403 Forbidden</H1>\r\n"
    b"Access to the requested URL is restricted.<P></body></html>"
)
LOCKOUT_PAGE = (
    b'<html><head><meta HTTP-EQUIV="Expires" content="0"><meta HTTP-EQUIV="Pragma"  content="no-cache">'
    b'<LINK REL=STYLESHEET HREF="/orvx.css" TYPE="text/css"><title>Access Denied: Orvex Reporting Server</title></head>'
    b"<body class=standard><br><h1>Orvex Reporting Server &#153;</h1><table border=0><tr><td><font size=-1>"
    b"This account has been locked for one minute because multiple failed attempts to login were attempted! "
    b"</font></td></tr><tr><td><font size=-1>After a one minute time out, this account will be unlocked and you will be "
    b"able to access it again.</font></td></tr></table></body></html>"
)
REPLY_400 = b"HTTP/1.0 400 Bad Request\r\nContent-Length: 133\r\n\r\n" + B400
REPLY_401 = (
    b"HTTP/1.0 401 Unauthorized\r\n"
    b'WWW-Authenticate: Basic realm="Orvex Reporting Server\r\n'  # no quote behind the realm
    b"Content-Length: 124\r\n\r\n" + B401
)
REPLY_403 = b"HTTP/1.0 403 Forbidden\r\nContent-Length: 138\r\n\r\n" + B403
REPLY_LOCKED_OUT = b"HTTP/1.0 403 Forbidden\r\nContent-Length: 590\r\n\r\n" + LOCKOUT_PAGE
REPLY_404 = b"HTTP/1.0 404 Not Found\r\nContent-Length: 140\r\n\r\n" + B404
REPLY_413 = b"HTTP/1.0 413 Request Entity Too Large\r\nContent-Length: 158\r\n\r\n" + B413

DEAD_PID = 99999999  # above every pid_max, and longer than every real pid
NOBODY = 65534


def shown_host_name(name=None):
    """The machine's name as the server's start line shows it: one of 64 characters or more does not fit."""
    name = socket.gethostname() if name is None else name
    return name if len(os.fsencode(name)) < 64 else "local"


def not_running(errno):
    return f"Error: The server is not running ({errno}).\n\n"


# ---------------------------------------------------------------------------------------------- the build under test


def executable():
    value = os.environ.get("OX_REMOTE", "")
    if not value:
        raise RuntimeError("OX_REMOTE is not set: it must name the ox_remote executable to test")
    path = Path(value).resolve()
    if not (path.is_file() and os.access(path, os.X_OK)):
        raise RuntimeError(f"OX_REMOTE names no executable file: {path}")
    return path


def _sanitizer():
    try:
        data = executable().read_bytes()
    except RuntimeError:
        return ""
    for name, mark in (("thread", b"__tsan_init"), ("address", b"__asan_init")):
        if mark in data:
            return name
    return ""


def has_symbol(name):
    return name.encode() in executable().read_bytes()


SANITIZER = _sanitizer()
SLOWDOWN = {"": 1, "address": 3, "thread": 6}[SANITIZER]
DEADLINE = 20 * SLOWDOWN
IS_ROOT = os.geteuid() == 0


def wait_until(condition, what, timeout=None):
    """Repeats `condition` until it gives something true, which is returned."""
    deadline = time.monotonic() + (DEADLINE if timeout is None else timeout)
    pause = 0.002
    while True:
        value = condition()
        if value:
            return value
        if time.monotonic() > deadline:
            raise AssertionError(f"waited in vain: {what}")
        time.sleep(pause)
        pause = min(pause * 1.5, 0.05)


def stays_true(condition, seconds, what):
    """Fails as soon as `condition` gives something false within the given time."""
    deadline = time.monotonic() + seconds
    while time.monotonic() < deadline:
        assert condition(), what
        time.sleep(0.02)


def raise_descriptor_limit():
    hard = resource.getrlimit(resource.RLIMIT_NOFILE)[1]
    resource.setrlimit(resource.RLIMIT_NOFILE, (hard, hard))
    return hard


# ---------------------------------------------------------------------------------------------------------- ports

_port_claims = []


def free_port(low=10000, high=32000):
    """A port below the range that the kernel gives to clients. It is claimed for the life of this process by an
    abstract Unix socket, so that test processes that run side by side never choose the same one."""
    for _ in range(2000):
        port = random.randrange(low, high)
        claim = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        try:
            claim.bind(f"\0ox-remote-e2e-port-{port}")
            with socket.socket() as probe:
                probe.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
                with contextlib.suppress(PermissionError):  # a privileged port, looked for by an ordinary user
                    probe.bind(("", port))
        except OSError:
            claim.close()
            continue
        _port_claims.append(claim)
        return port
    raise AssertionError(f"no free port between {low} and {high}")


def unprivileged_port_start():
    return int(Path("/proc/sys/net/ipv4/ip_unprivileged_port_start").read_text())


def is_listening(port):
    wanted = f":{port:04X}"
    with open("/proc/net/tcp") as table:
        return any(f[1].endswith(wanted) and f[3] == "0A" for f in (line.split() for line in table))


# ------------------------------------------------------------------------------------------------------ processes


def process_status(pid):
    """The fields of /proc/PID/status, or None when there is no such process."""
    try:
        text = Path(f"/proc/{pid}/status").read_text()
    except OSError:
        return None
    return {k: v.strip() for k, _, v in (line.partition(":") for line in text.splitlines())}


def is_alive(pid):
    fields = process_status(pid)
    return fields is not None and not fields["State"].startswith("Z")


def cpu_seconds(pid):
    fields = Path(f"/proc/{pid}/stat").read_text().rpartition(")")[2].split()
    return (int(fields[11]) + int(fields[12])) / os.sysconf("SC_CLK_TCK")


def descriptors(pid):
    found = {}
    for name in os.listdir(f"/proc/{pid}/fd"):
        with contextlib.suppress(OSError):
            found[int(name)] = os.readlink(f"/proc/{pid}/fd/{name}")
    return found


def thread_count(pid):
    return len(os.listdir(f"/proc/{pid}/task"))


def resident_kib(pid):
    return int(process_status(pid)["VmRSS"].split()[0])


def signals_in_mask(hex_mask):
    mask = int(hex_mask, 16)
    return {number for number in range(1, 65) if mask >> (number - 1) & 1}


# ------------------------------------------------------------------------------------------------------ log lines

STAMP = re.compile(r"(Jan|Feb|Mar|Apr|May|Jun|Jul|Aug|Sep|Oct|Nov|Dec)-\d\d-\d{4} \d\d:\d\d:\d\d: ")
ACCESS_LINE = re.compile(
    r"(?P<peer>\d+\.\d+\.\d+\.\d+) - (?P<user>.+?) "
    r"\[(?P<time>\d+/[A-Z][a-z]{2}/\d{4}:\d+:\d\d:\d\d) (?P<zone>[+-]\d+)\] "
    r'"(?P<request>[^"]*)" (?P<status>\d{3}) (?P<bytes>\d+)'
)

# What a healthy server writes, with the level each line needs. Lines without a level need 1: level 0 silences all.
ORDINARY_LINES = {
    "err": [
        (1, r"Starting server: connecting to \S.* on port \d+\."),
        (3, r"Logging server activity to \S+\."),
        (3, r"Server log closed\."),
        (3, r"User database directory: \S+\."),
        (3, r"Log analysis configuration file: \S+\."),
        (3, r"Profile configuration file: \S*\."),
        (3, r"Script \[\S+\] requested on session thread 0x[0-9A-F]+\."),
        (3, r"Authenticating user .+\.\.\."),
        (2, r"User .+ [Aa]uthenticated\.?"),
        (3, r"Server stopping\.\.\."),
        (5, r"Daemon thread started\. Thread id = 0x[0-9A-F]+"),
        (5, r"Adding user session 0x[0-9A-F]+\."),
        (5, r"Removing user session 0x[0-9A-F]+\."),
        (5, r"Daemon thread exiting normally\."),
        (5, r"session thread 0x[0-9A-F]+ exiting\."),
        (7, r"HttpDaemon thread: waiting on 128 connections\."),
        (7, r"HttpDaemon thread: accepting connection:"),
        (7, r"HttpDaemon thread: connected to \d+\.\d+\.\d+\.\d+\."),
        (9, r"Debug level is now \d+\."),
    ],
    "status": [
        (1, r"Remote interface server available on http://\S+:\d+\."),
        (1, r"The remote configuration server has been started \(\d+\)\."),
        (1, r"Process \d+ termination requested\. Cleaning up\.\.\."),
        (1, r"Process \d+ cancelled - cleaning up\.\.\."),
        (1, r"Process \d+: oxSIGRESET received - resetting the server:"),
        (1, r"Process \d+: oxSIGSTATUS received - current server status:"),
        (1, r"Remote interface server is active on port \d+\."),
        (3, r"Changing dir to \S.*;"),
        (7, r"gid=\d+ egid=\d+"),
        (7, r"uid=\d+ euid=\d+"),
        (9, r"Debug level is now \d+\."),
        (10, r"Signal received: \d+ - \S.*"),
    ],
    "startup": [
        (5, r"RLIMIT_NOFILE set to \d+\."),
        (5, r"RLIMIT_NOFILE set to unlimited\."),
        (9, r"Debug level is now \d+\."),
    ],
}


def port_in_use_line(port):
    return f"Server unable to start - the specified address or port ({port}) is already in use."


def http_time(epoch):
    return time.strftime("%a, %d %b %Y %H:%M:%S GMT", time.gmtime(epoch))


def parse_http_time(text):
    value = calendar.timegm(time.strptime(text, "%a, %d %b %Y %H:%M:%S GMT"))
    assert http_time(value) == text, f"not in the form of an HTTP date: {text!r}"
    return value


# ------------------------------------------------------------------------------------------------- an installation


class Installation:
    """A directory that holds a copy of the executable, its settings and a web root, with the processes run from it."""

    def __init__(self):
        self.scratch = Path(tempfile.mkdtemp(prefix="ox-e2e-")).resolve()
        self.scratch.chmod(0o755)
        self.sanitizer_dir = self.scratch / "sanitizer"
        self.sanitizer_dir.mkdir()
        self.sanitizer_dir.chmod(0o1777)
        self.root = self.scratch / "site"
        self.root.mkdir()
        self.root.chmod(0o755)
        self.exe = self.root / "ox_remote"
        shutil.copy(executable(), self.exe)
        self.exe.chmod(0o755)
        self.web = self.root / "wwwroot"
        self.web.mkdir()
        self.web.chmod(0o755)
        self.port = free_port()
        self.user = None
        self.owner = None
        self.servers = []
        self._output = 0
        self._expected = {"err": [], "status": [], "startup": []}
        self._highest_level = 0
        self.settings = {
            "unix": {"uid": "0", "gid": "0"} if IS_ROOT else {},
            "Audit": {},
            "RemoteConfiguration": {"WebAddress": "127.0.0.1", "WebPort": str(self.port)},
        }
        self.data = self.root / "oxm_oxx" / "datfiles"
        self.data.mkdir(parents=True)
        self.users = self.data / "users"
        self.users.mkdir(mode=0o700)
        (self.root / "oxm_oxx").chmod(0o755)
        self.main_ini = self.root / "oxm_oxx" / "oxm_oxx.ini"
        self.main_ini.write_text("[interface]\nersaddress=127.0.0.1:1\n")
        self.ini = self.root / "ox_remote.ini"
        self.configure()
        self.page("default.htm", b"<html><body>the default page</body></html>\n")
        self.page("hello.htm", b"<html><body>hello</body></html>\n")

    # --- files

    def configure(self, *, web=None, audit=None, unix=None):
        """Merges values into the settings and writes the file; None takes a key out."""
        for section, values in (("RemoteConfiguration", web), ("Audit", audit), ("unix", unix)):
            for key, value in (values or {}).items():
                if value is None:
                    self.settings[section].pop(key, None)
                else:
                    self.settings[section][key] = str(value)
        self._highest_level = max(self._highest_level, self.level)
        text = ""
        for section, values in self.settings.items():
            text += f"[{section}]\n" + "".join(f"{k}={v}\n" for k, v in values.items()) + "\n"
        beside = self.root / "ox_remote.ini.new"
        beside.write_text(text)
        beside.chmod(0o644)
        if self.user is not None:
            os.chown(beside, self.user, self.user)
        beside.replace(self.ini)

    @property
    def level(self):
        with contextlib.suppress(ValueError):
            return int(self.settings["Audit"].get("debuglevel", "1"))
        return 1

    def page(self, name, content, mtime=None):
        path = self.web / name
        path.parent.mkdir(parents=True, exist_ok=True)
        path.write_bytes(content)
        path.chmod(0o644)
        if mtime is not None:
            os.utime(path, (mtime, mtime))
        return path

    def user_file(self, name, content):
        path = self.users / name
        path.write_bytes(content)
        path.chmod(0o600)
        self._own(path)
        return path

    def add_user(self, name, password="secret", permissions=0, *, file=None, more=""):
        """Writes a user file as people do. Without a password (None) any password is good."""
        lines = [f"username={name}", f"permissions={permissions}"]
        if password is not None:
            lines.insert(1, f"PlaintextPassword={password}")
        text = "[UserInfo]\n" + "".join(f"{line}\n" for line in lines) + more
        return self.user_file(file or f"{name}.usr", text.encode())

    def add_profile(self, name, users, directory="profiles"):
        """Writes a profile file; the main settings file names its directory from then on."""
        path = self.root / directory / name
        path.parent.mkdir(exist_ok=True)
        path.write_text(f"[Profile]\nUsers={users}\n")
        self.main_ini.write_text(f"[interface]\nersaddress=127.0.0.1:1\n[defaults]\nprofilesdir=./{directory}\n")
        self._own(path.parent, path)
        return path

    def add_report(self, name, content=b"<html>a report</html>\n"):
        path = self.data / "reports" / name
        path.parent.mkdir(parents=True, exist_ok=True)
        path.write_bytes(content)
        return path

    def _own(self, *paths):
        if self.owner is not None:
            for path in paths:
                os.chown(path, self.owner, self.owner)

    def give_to(self, uid):
        """Makes `uid` the owner of the tree (root only), also of the user and profile files that are still to come."""
        self.owner = uid
        for directory, folders, files in os.walk(self.root):
            for name in [directory] + [os.path.join(directory, n) for n in folders + files]:
                os.lchown(name, uid, uid)

    def use_ordinary_user(self):
        """From now on the programs run as an ordinary user that owns the tree."""
        if IS_ROOT:
            self.user = NOBODY
            self.give_to(NOBODY)

    @property
    def pid_file(self):
        return self.root / "ox_remote.pid"

    @property
    def startup_log(self):
        return self.root / "ox_remote.startup"

    @property
    def status_log(self):
        audit = {k.lower(): v for k, v in self.settings["Audit"].items()}
        directory = self.root / audit.get("logdir", "oxm_oxx/datfiles/statuslogs")
        return directory / audit.get("logfile", "oxinterface.audit")

    @property
    def error_log(self):
        return self.root / self.settings["RemoteConfiguration"].get("WebErrorLog", "ox_remote.err")

    @property
    def access_log(self):
        return self.root / self.settings["RemoteConfiguration"].get("WebLogFileName", "ox_remote.log")

    def rename(self, name):
        """Gives the directory of the installation another name, before anything runs in it."""
        self.root = self.root.rename(self.scratch / name)
        self.exe, self.web, self.ini = self.root / "ox_remote", self.root / "wwwroot", self.root / "ox_remote.ini"
        self.main_ini = self.root / "oxm_oxx" / "oxm_oxx.ini"
        self.data = self.root / "oxm_oxx" / "datfiles"
        self.users = self.data / "users"

    def _log_files(self, which):
        if which == "startup":
            return sorted(self.root.glob("*.startup"))
        if which == "status":
            return sorted(set(self.root.rglob("*.audit")) | ({self.status_log} & set(self.root.rglob("*"))))
        return sorted(set(self.root.glob("*.err")) | ({self.error_log} & set(self.root.iterdir())))

    @staticmethod
    def _lines(path):
        try:
            data = path.read_bytes()
        except FileNotFoundError:
            return []
        return data.decode("latin-1").split("\n")[:-1]

    def err(self, path=None):
        """The texts of the message log, without their stamps."""
        return [STAMP.sub("", line, count=1) for line in self._lines(path or self.error_log)]

    def status(self):
        return [STAMP.sub("", line, count=1) for line in self._lines(self.status_log)]

    def setup_lines(self):
        """What a start says at level 3 before it opens its access log, where no profiles are set up."""
        return [
            f"User database directory: {self.users}.",
            f"Log analysis configuration file: {self.main_ini}.",
            "Profile configuration file: .",
        ]

    def startup(self):
        return [STAMP.sub("", line, count=1) for line in self._lines(self.startup_log)]

    def access(self, path=None):
        return self._lines(path or self.access_log)

    # --- what the logs may hold

    def expect(self, log, pattern, times=None):
        """Declares that the log holds lines of this form: exactly `times`, or at least one."""
        self._expected[log].append([re.compile(pattern), times, 0])

    def allow(self, log, pattern):
        """Declares lines that may or may not occur."""
        self._expected[log].append([re.compile(pattern), "any", 0])

    def log_faults(self):
        faults = []
        for log, ordinary in ORDINARY_LINES.items():
            expected = self._expected[log]
            for path in self._log_files(log):
                if not path.is_file():
                    continue
                data = path.read_bytes()
                if data and not data.endswith(b"\n"):
                    faults.append(f"{path.name}: the last line is not ended")
                for line in data.decode("latin-1").split("\n")[:-1]:
                    text = STAMP.sub("", line, count=1)
                    for entry in expected:
                        if entry[0].fullmatch(text):
                            entry[2] += 1
                            break
                    else:
                        if not STAMP.match(line):
                            faults.append(f"{path.name}: raw output: {line}")
                        elif not any(
                            level <= self._highest_level and re.fullmatch(pattern, text)
                            for level, pattern in ordinary
                        ):
                            faults.append(f"{path.name}: unexpected line: {line}")
            for pattern, times, seen in expected:
                if times is None and seen == 0:
                    faults.append(f"{log} log: no line matches {pattern.pattern!r}")
                elif isinstance(times, int) and seen != times:
                    faults.append(f"{log} log: {seen} lines instead of {times} match {pattern.pattern!r}")
        for line in self.access():
            if not ACCESS_LINE.fullmatch(line):
                faults.append(f"access log: malformed line: {line}")
        return faults

    # --- running programs

    def environment(self, **extra):
        env = dict(os.environ, TZ="UTC")
        for name in ("ASAN_OPTIONS", "TSAN_OPTIONS", "UBSAN_OPTIONS", "LSAN_OPTIONS"):
            options = [env[name]] if env.get(name) else []
            options.append(f"log_path={self.sanitizer_dir}/report")
            if IS_ROOT and self.user is None and self.settings["unix"].get("uid") != "0":
                options.append("detect_leaks=0")  # the leak check cannot look into a process that changed its user
            env[name] = ":".join(options)
        env.update(extra)
        return env

    def spawn(self, *args, argv0=None, program=None, cwd=None, env=None, shell=None, redirect="", **popen):
        """Starts the program in a session of its own. `shell` is a prologue run by /bin/sh in the same process,
        `redirect` are shell redirections of the program itself."""
        program = str(program or self.exe)
        argv = [argv0 if argv0 is not None else program, *args]
        if shell is not None or redirect:
            argv = ["/bin/sh", "-c", f'{shell or ":"}; exec "$0" "$@" {redirect}', *argv]
            program = "/bin/sh"
        if self.user is not None:
            popen.setdefault("user", self.user)
            popen.setdefault("group", self.user)
            popen.setdefault("extra_groups", [])
        popen.setdefault("umask", 0o022)
        popen.setdefault("stdin", subprocess.DEVNULL)
        return subprocess.Popen(
            argv,
            executable=program,
            cwd=cwd or self.root,
            env=self.environment(**(env or {})),
            start_new_session=True,
            **popen,
        )

    def run(self, *args, stderr="", timeout=None, **how):
        """Runs a command to its end: (exit status, standard output). Standard error must be exactly `stderr`."""
        process = self.spawn(*args, stdout=subprocess.PIPE, stderr=subprocess.PIPE, **how)
        try:
            out, err = process.communicate(timeout=timeout or 40 + DEADLINE)
        except subprocess.TimeoutExpired:
            process.kill()
            out, err = process.communicate()
            raise AssertionError(f"{args} did not end; so far it wrote {out!r} and {err!r}") from None
        if stderr is not None:
            assert err.decode("latin-1") == stderr, f"standard error of {args}"
        return process.returncode, out.decode("latin-1")

    def serve(self, *args, ready=True, **how):
        """Starts the server in the foreground mode and waits until it serves."""
        server = Server(self, args or ("-debug",), how)
        self.servers.append(server)
        if ready:
            server.wait_ready()
        return server

    def start_daemon(self, *args, **how):
        """Runs -start: (exit status, standard output, the daemon)."""
        code, out = self.run(*(args or ("-start",)), **how)
        pid = wait_until(self.read_pid, "a pid in the pid file")
        daemon = Daemon(self, pid)
        self.servers.append(daemon)
        line = f"The remote configuration server has been started ({pid})."
        wait_until(lambda: line in self.status(), "the start line")
        return code, out, daemon

    def read_pid(self):
        try:
            return int(self.pid_file.read_text().split("\n")[0])
        except (OSError, ValueError):
            return 0

    # --- requests

    def get(self, path, *headers, **how):
        return get(self.port, path, *headers, **how)

    def raw(self, data, **how):
        return exchange(self.port, data, **how)

    # --- the end

    def leftover_processes(self):
        left = []
        for name in os.listdir("/proc"):
            if name.isdigit():
                with contextlib.suppress(OSError):  # script engines run from elsewhere, but in the directory
                    places = [os.readlink(f"/proc/{name}/{link}") for link in ("exe", "cwd")]
                    if any(place.startswith(str(self.scratch)) for place in places) and is_alive(int(name)):
                        left.append(int(name))
        return left

    def close(self):
        """Stops what runs and returns everything that is wrong."""
        faults = []
        for server in self.servers:
            faults += server.end()
        try:
            wait_until(lambda: not self.leftover_processes(), "no process left", timeout=10 * SLOWDOWN)
        except AssertionError:
            for pid in self.leftover_processes():
                faults.append(f"process {pid} was left behind")
                with contextlib.suppress(OSError):
                    os.kill(pid, signal.SIGKILL)
        for report in sorted(self.sanitizer_dir.iterdir()):
            faults.append(f"sanitizer report:\n{report.read_text(errors='replace')[:6000]}")
        faults += self.log_faults()
        return faults

    def describe(self):
        text = ""
        for path in sorted(self.root.rglob("*")):
            if path.suffix in (".err", ".log", ".audit", ".startup", ".ini", ".pid") and path.is_file():
                text += f"--- {path.relative_to(self.root)}\n{path.read_bytes()[-4000:].decode('latin-1')}\n"
        return text

    def remove(self):
        if not os.environ.get("OX_KEEP"):
            shutil.rmtree(self.scratch, ignore_errors=True)


class Server:
    """A server in the foreground mode, a child of the test."""

    def __init__(self, site, args, how):
        self.site = site
        site._output += 1
        self.out_file = site.scratch / f"stdout.{site._output}"
        self.err_file = site.scratch / f"stderr.{site._output}"
        with open(self.out_file, "wb") as out, open(self.err_file, "wb") as err:
            self.process = site.spawn(*args, stdout=out, stderr=err, **how)
        self.pid = self.process.pid
        self.expected_stderr = ""
        self.threads = None
        self.over = False

    def wait_ready(self):
        line = f"The remote configuration server has been started ({self.pid})."

        def ready():
            assert self.alive(), f"the server ended: {self.process.returncode}\n{self.stdout()}\n{self.stderr()}"
            if self.site.level > 0:
                return line in self.site.status()
            return is_listening(self.site.port)

        wait_until(ready, "the server is started")
        self.threads = thread_count(self.pid)

    def alive(self):
        return self.process.poll() is None

    def reset(self):
        """Makes the server stop and start, with its settings and users read again."""

        def starts():
            return sum(line.startswith("Starting server: ") for line in self.site.err())

        before = starts()
        self.signal(16)
        wait_until(lambda: starts() == before + 1 and is_listening(self.site.port), "the next start")

    def stdout(self):
        return self.out_file.read_bytes().decode("latin-1")

    def stderr(self):
        return self.err_file.read_bytes().decode("latin-1")

    def signal(self, number):
        os.kill(self.pid, number)

    def wait_exit(self, timeout=None):
        """Waits for the end of the process and gives its exit status."""
        try:
            code = self.process.wait(timeout=timeout or 15 + DEADLINE)
        except subprocess.TimeoutExpired:
            raise AssertionError("the server did not end") from None
        self.over = True
        return code

    def stop(self):
        self.signal(signal.SIGTERM)
        code = self.wait_exit()
        assert code == 0, f"exit status {code}"

    def wait_idle(self, timeout=None):
        """Waits until all sessions have ended: no more threads than there were before the first one."""
        wait_until(lambda: thread_count(self.pid) <= self.threads, "the sessions' threads have ended", timeout)

    def end(self):
        faults = []
        if not self.over:
            if not self.alive():
                faults.append(f"the server ended by itself with {self.process.returncode}")
            else:
                self.signal(signal.SIGCONT)
                with contextlib.suppress(AssertionError, OSError):
                    if self.threads is not None:  # sessions that are just ending are not to be cut by the stop
                        self.wait_idle(timeout=5)
                self.signal(signal.SIGTERM)
                try:
                    code = self.wait_exit()
                    if code != 0:
                        faults.append(f"the server's exit status is {code}")
                except AssertionError:
                    faults.append("the server did not end on the termination signal")
                    self.process.kill()
                    self.process.wait()
        if self.expected_stderr is not None and self.stderr() != self.expected_stderr:
            faults.append(f"standard error of the server: {self.stderr()!r}")
        return faults


class Daemon:
    """A server in the background."""

    def __init__(self, site, pid):
        self.site = site
        self.pid = pid
        self.pidfd = os.pidfd_open(pid)
        self.over = False

    def alive(self):
        return is_alive(self.pid)

    def signal(self, number):
        signal.pidfd_send_signal(self.pidfd, number)

    def wait_exit(self, timeout=None):
        ended, _, _ = select.select([self.pidfd], [], [], timeout or 15 + DEADLINE)
        assert ended, "the daemon did not end"
        self.over = True

    def end(self):
        faults = []
        if not self.over:
            if not self.alive():
                faults.append("the daemon ended by itself")
            else:
                self.signal(signal.SIGTERM)
                try:
                    self.wait_exit()
                except AssertionError:
                    faults.append("the daemon did not end on the termination signal")
                    self.signal(signal.SIGKILL)
        os.close(self.pidfd)
        return faults


# --------------------------------------------------------------------------------------------------------- clients


class Reply:
    """A parsed answer; `headers` keeps names and values in their order on the wire."""

    def __init__(self, raw):
        self.raw = raw
        head, separator, self.body = raw.partition(b"\r\n\r\n")
        assert separator, f"no end of the header block in {raw[:300]!r}"
        lines = head.decode("latin-1").split("\r\n")
        self.status_line = lines[0]
        match = re.fullmatch(r"HTTP/1\.0 (\d{3}) (.+)", lines[0])
        assert match, f"status line {lines[0]!r}"
        self.status = int(match[1])
        self.headers = []
        for line in lines[1:]:
            name, colon, value = line.partition(": ")
            assert colon, f"header line {line!r}"
            self.headers.append((name, value))

    def names(self):
        return [name for name, _ in self.headers]

    def header(self, name):
        values = [value for key, value in self.headers if key == name]
        assert len(values) == 1, f"{name}: {values}"
        return values[0]


class Client:
    """One connection, in raw bytes."""

    def __init__(self, port, source=None, receive_buffer=None, timeout=None):
        self.socket = socket.socket()
        try:
            self.socket.settimeout(timeout or DEADLINE)
            if receive_buffer:
                self.socket.setsockopt(socket.SOL_SOCKET, socket.SO_RCVBUF, receive_buffer)
            if source:
                self.socket.bind((source, 0))
            self.socket.connect(("127.0.0.1", port))
            self.socket.setsockopt(socket.IPPROTO_TCP, socket.TCP_NODELAY, 1)
        except OSError:
            self.socket.close()
            raise

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.close()

    def send(self, *pieces):
        for piece in pieces:
            self.socket.sendall(piece)

    def end_of_request(self):
        self.socket.shutdown(socket.SHUT_WR)

    def receive(self, size=65536):
        return self.socket.recv(size)

    def receive_exactly(self, size):
        data = bytearray()
        while len(data) < size:
            block = self.socket.recv(min(65536, size - len(data)))
            assert block, f"the server closed after {len(data)} bytes"
            data += block
        return bytes(data)

    def read_all(self):
        data = bytearray()
        while block := self.socket.recv(65536):
            data += block
        return bytes(data)

    def at_end(self):
        """True when the server has closed the connection and nothing is left to read."""
        self.socket.setblocking(False)
        try:
            return self.socket.recv(1) == b""
        except BlockingIOError:
            return False
        except ConnectionResetError:
            return True
        finally:
            self.socket.settimeout(DEADLINE)

    def reset(self):
        """Closes with a reset instead of an end."""
        self.socket.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, b"\x01\0\0\0\0\0\0\0")
        self.socket.close()

    def close(self):
        self.socket.close()


def exchange(port, data, *, end=False, **how):
    """Sends the bytes on a new connection and reads to the end of the answer."""
    with Client(port, **how) as client:
        client.send(data)
        if end:
            client.end_of_request()
        return client.read_all()


def request_text(path, *headers, method="GET", version="HTTP/1.0"):
    return "".join(f"{line}\r\n" for line in (f"{method} {path} {version}", *headers, "")).encode("latin-1")


def basic(user, password):
    """The header of a login; the parts are text or bytes."""
    parts = [part.encode() if isinstance(part, str) else part for part in (user, password)]
    return "Authorization: Basic " + base64.b64encode(b":".join(parts)).decode()


def get(port, path, *headers, method="GET", **how):
    return Reply(exchange(port, request_text(path, *headers, method=method), **how))


class Background:
    """Runs a function in threads and hands on the first exception."""

    def __init__(self, function, count):
        self.errors = []
        self.threads = [threading.Thread(target=self._run, args=(function, n), daemon=True) for n in range(count)]
        for thread in self.threads:
            thread.start()

    def _run(self, function, number):
        try:
            function(number)
        except BaseException as error:  # noqa: BLE001 - it is raised again by join
            self.errors.append(error)

    def join(self, timeout=None):
        deadline = time.monotonic() + (timeout or 3 * DEADLINE)
        for thread in self.threads:
            thread.join(max(0.0, deadline - time.monotonic()))
            assert not thread.is_alive(), "a client thread did not end"
        if self.errors:
            raise self.errors[0]


class ResetLoad(Background):
    """Clients that fetch one file again and again from a server that is reset meanwhile. A connection may be refused, or
    reset without a byte while it waits in the queue of the listening socket; an answer that has begun is always whole."""

    def __init__(self, port, url, content, count):
        self.port, self.url, self.content = port, url, content
        self.outcomes = {"whole": 0, "refused": 0, "dropped": 0}
        self.ending = False
        super().__init__(self._load, count)

    def _load(self, _):
        while not self.ending:
            data = b""
            try:
                with Client(self.port) as client:
                    client.send(request_text(self.url))
                    while block := client.receive():
                        data += block
            except ConnectionRefusedError:
                self.outcomes["refused"] += 1
                time.sleep(0.001)
                continue
            except (ConnectionResetError, BrokenPipeError):
                assert data == b"", f"cut after {len(data)} bytes"
                self.outcomes["dropped"] += 1
                continue
            assert data.endswith(b"\r\n\r\n" + self.content), f"{len(data)} bytes"
            self.outcomes["whole"] += 1

    def stop(self):
        self.ending = True
        self.join()


def spoil_settings(path, kind):
    """Replaces a settings file by something that does not load; what the system says to it is returned."""
    text = path.read_bytes()
    path.unlink()
    if kind == "directory":
        path.mkdir()
        return "Is a directory"
    if kind == "nul":
        path.write_bytes(text + b"[x]\ny=\0z\n")
        return "The file holds a NUL byte"
    if kind == "pipe":
        os.mkfifo(path, 0o644)
    elif kind == "device":
        path.symlink_to("/dev/zero")
    else:
        assert kind == "missing"
        return "No such file or directory"
    return "Invalid argument"


def mode_of(path):
    return stat.S_IMODE(os.stat(path).st_mode)
