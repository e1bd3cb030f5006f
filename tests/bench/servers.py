"""The servers: a minimal configuration of each, the same in what matters, and their life.

The same for all: one web root, plain HTTP on loopback, access log on, no connection is kept (the clients speak
HTTP/1.0), room for more open connections than any cell asks for. Everything else (workers, sendfile, timeouts) is what
the server or Debian's package of it brings.
"""

import os
import shutil
import signal
import socket
import subprocess
import time
from pathlib import Path

START_SECONDS = 15
STOP_SECONDS = 20
OPEN_FILES = 16384
SERVICE_USER = "www-data"


class ServerError(Exception):
    """A server did not start, stop or answer as it must."""


def free_port() -> int:
    with socket.socket() as probe:
        probe.bind(("127.0.0.1", 0))
        return probe.getsockname()[1]


class Server:
    name = ""
    access_log = "access.log"  # in the server's folder

    def __init__(self, folder: Path, root: Path):
        self.folder = folder
        self.root = root
        self.port = free_port()
        self._process: subprocess.Popen | None = None

    def configure(self, extra: str) -> list[str]:
        """Writes the configuration, with the scenarios' extra lines; the command that runs it in the foreground."""
        raise NotImplementedError

    def version(self) -> str:
        raise NotImplementedError

    @property
    def session(self) -> int:
        assert self._process
        return self._process.pid

    def url(self, path: str) -> str:
        return f"http://127.0.0.1:{self.port}{path}"

    def start(self, extra: str = "") -> None:
        self.folder.mkdir(parents=True, exist_ok=True)
        command = self.configure(extra.replace("@ROOT@", str(self.root)))
        with open(self.folder / "output", "wb") as output:
            # Without a locale: some servers keep it from their scripts, and to perl it makes a tenth of its start.
            self._process = subprocess.Popen(command, cwd=self.folder, stdin=subprocess.DEVNULL, stdout=output,
                                             stderr=subprocess.STDOUT, start_new_session=True,
                                             env={"PATH": "/usr/sbin:/usr/bin:/sbin:/bin"})
        deadline = time.monotonic() + START_SECONDS
        while time.monotonic() < deadline:
            self.check_alive()
            try:
                socket.create_connection(("127.0.0.1", self.port), timeout=1).close()
                return
            except OSError:
                time.sleep(0.05)
        raise ServerError(f"{self.name} does not listen after {START_SECONDS} seconds:\n{self._output()}")

    def check_alive(self) -> None:
        if self._process.poll() is not None:
            raise ServerError(f"{self.name} ended with {self._process.returncode}:\n{self._output()}")

    def stop(self) -> None:
        if not self._process or self._process.poll() is not None:
            return
        self._process.terminate()
        try:
            self._process.wait(STOP_SECONDS)
        except subprocess.TimeoutExpired:
            os.killpg(self._process.pid, signal.SIGKILL)
            self._process.wait()
            raise ServerError(f"{self.name} did not stop within {STOP_SECONDS} seconds") from None

    def logged_lines(self) -> int:
        lines = 0
        with open(self.folder / self.access_log, "rb") as log:
            while block := log.read(1 << 20):
                lines += block.count(b"\n")
        return lines

    def _output(self) -> str:
        return (self.folder / "output").read_text(errors="replace")[-2000:]

    def _first_line(self, *command: str) -> str:
        done = subprocess.run(command, stdin=subprocess.DEVNULL, capture_output=True, text=True, check=False)
        return (done.stdout + done.stderr).strip().splitlines()[0]


class OxRemote(Server):
    name = "ox_remote"
    access_log = "ox_remote.log"
    binary = Path()  # set by the command line

    def configure(self, extra: str) -> list[str]:
        # It finds everything beside itself, its pid file included.
        program = self.folder / "ox_remote"
        shutil.copy2(self.binary, program)
        (self.folder / "oxm_oxx").mkdir(exist_ok=True)
        (self.folder / "oxm_oxx" / "oxm_oxx.ini").write_text("[interface]\n")
        ids = "[unix]\nuid=0\ngid=0\n" if os.geteuid() == 0 else ""
        (self.folder / "ox_remote.ini").write_text(
            f"{ids}[RemoteConfiguration]\nWebAddress=127.0.0.1\nWebPort={self.port}\nWebLogging=1\n"
            f"WebMaxConnectionsPerAddress=0\n{extra}\n")
        return [str(program), "-debug"]

    def version(self) -> str:
        return "ox_remote, " + self._first_line("sha256sum", str(self.binary))[:12]


class Nginx(Server):
    name = "nginx"

    def configure(self, extra: str) -> list[str]:
        user = f"user {SERVICE_USER};" if os.geteuid() == 0 else ""
        temporary = "".join(f"{kind}_temp_path {self.folder}/{kind};\n"
                            for kind in ("client_body", "proxy", "fastcgi", "uwsgi", "scgi"))
        (self.folder / "nginx.conf").write_text(f"""\
{user}
worker_processes auto;
daemon off;
pid {self.folder}/pid;
error_log {self.folder}/error.log;
events {{ worker_connections {OPEN_FILES // 2}; }}
http {{
    include /etc/nginx/mime.types;
    default_type application/octet-stream;
    sendfile on;
    tcp_nopush on;
    keepalive_timeout 0;
    access_log {self.folder}/access.log;
    {temporary}
    server {{
        listen 127.0.0.1:{self.port};
        root {self.root};
        {extra}
    }}
}}
""")
        return [shutil.which("nginx") or "/usr/sbin/nginx", "-c", str(self.folder / "nginx.conf"),
                "-e", str(self.folder / "error.log")]

    def version(self) -> str:
        return self._first_line("/usr/sbin/nginx", "-v").removeprefix("nginx version: ")


class Lighttpd(Server):
    name = "lighttpd"

    def configure(self, extra: str) -> list[str]:
        user = f'server.username = "{SERVICE_USER}"\nserver.groupname = "{SERVICE_USER}"' if os.geteuid() == 0 else ""
        if user:
            shutil.chown(self.folder, SERVICE_USER)  # it opens its logs after it dropped root
        (self.folder / "lighttpd.conf").write_text(f"""\
server.modules = ( "mod_accesslog", "mod_staticfile" )
server.bind = "127.0.0.1"
server.port = {self.port}
server.document-root = "{self.root}"
server.pid-file = "{self.folder}/pid"
server.errorlog = "{self.folder}/error.log"
accesslog.filename = "{self.folder}/access.log"
server.max-keep-alive-requests = 0
server.max-fds = {OPEN_FILES}
server.max-connections = {OPEN_FILES // 2}
{user}
include_shell "/usr/share/lighttpd/create-mime.conf.pl"
{extra}
""")
        return ["/usr/sbin/lighttpd", "-D", "-f", str(self.folder / "lighttpd.conf")]

    def version(self) -> str:
        return self._first_line("/usr/sbin/lighttpd", "-v").split(" (")[0]


class Apache(Server):
    name = "apache"

    def configure(self, extra: str) -> list[str]:
        user = f"User {SERVICE_USER}\nGroup {SERVICE_USER}" if os.geteuid() == 0 else ""
        # The event numbers are those of Debian's mpm_event.conf.
        (self.folder / "apache.conf").write_text(f"""\
ServerRoot {self.folder}
ServerName 127.0.0.1
Listen 127.0.0.1:{self.port}
PidFile {self.folder}/pid
DefaultRuntimeDir {self.folder}
ErrorLog {self.folder}/error.log
LoadModule mpm_event_module /usr/lib/apache2/modules/mod_mpm_event.so
LoadModule authz_core_module /usr/lib/apache2/modules/mod_authz_core.so
LoadModule mime_module /usr/lib/apache2/modules/mod_mime.so
TypesConfig /etc/mime.types
{user}
StartServers 2
MinSpareThreads 25
MaxSpareThreads 75
ThreadLimit 64
ThreadsPerChild 25
MaxRequestWorkers 150
MaxConnectionsPerChild 0
KeepAlive Off
HostnameLookups Off
LogFormat "%h %l %u %t \\"%r\\" %>s %O \\"%{{Referer}}i\\" \\"%{{User-Agent}}i\\"" combined
CustomLog {self.folder}/access.log combined
DocumentRoot {self.root}
<Directory {self.root}>
    Options FollowSymLinks
    AllowOverride None
    Require all granted
</Directory>
{extra}
""")
        return ["/usr/sbin/apache2", "-D", "FOREGROUND", "-f", str(self.folder / "apache.conf")]

    def version(self) -> str:
        return self._first_line("/usr/sbin/apache2", "-v").removeprefix("Server version: ")


SERVERS: list[type[Server]] = [OxRemote, Nginx, Lighttpd, Apache]
