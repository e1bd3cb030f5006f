"""Scripting engines for the tests, scripts for them, and a look at the processes that run scripts.

Two engines can be installed as ox_script.bin. The playing engine (tests/engine, a program, named by OX_TEST_ENGINE)
plays the list of moves that it finds in the script file. The Python engine (tests/engine/engine.py) runs the script
file as Python. Both say in their own head what a script can do.
"""

import json
import os
import re
import shutil
from pathlib import Path

from harness import Reply, exchange, is_alive, process_status, request_text

B500 = (
    b"<html><HEAD><TITLE>500 Server Error</TITLE></HEAD>\r\n<BODY><H2>500 Server Error</H2>"
    b"An error occurred processing your request.<P></body></html>"
)
B500_SCRIPT = (
    b"<html><HEAD><TITLE>500 Server Error</TITLE></HEAD>\r\n<BODY><H2>500 Server Error - Script Failed</H2>"
    b"An error occured while processing a CGI script. The server was unable to continue processing your "
    b"request.<P></body></html>"
)
REPLY_500 = b"HTTP/1.0 500 Internal Server Error\r\nContent-Length: 142\r\n\r\n" + B500
REPLY_500_SCRIPT = b"HTTP/1.0 500 Internal Server Error\r\nContent-Length: 222\r\n\r\n" + B500_SCRIPT

DATE = rb"[A-Z][a-z]{2}, \d\d [A-Z][a-z]{2} \d{4} \d\d:\d\d:\d\d GMT"

PYTHON_ENGINE = Path(__file__).resolve().parent.parent / "engine" / "engine.py"
READ_TOKEN = "TOKEN RETREIVED SUCCESSFULLY"

# Carries out the steps of its input: calls, files made and files waited for. The page is the list of the answers.
STEPS = """
import json
answers = []
for kind, *what in json.loads(body()):
    if kind == "call":
        status, text = call(what[0], *(part.encode("latin-1") for part in what[1:]))
        answers.append([status, text.decode("latin-1")])
    elif kind == "touch":
        open(what[0], "w").close()
    else:
        deadline = time.monotonic() + 120
        while not os.path.exists(what[0]):
            assert time.monotonic() < deadline, what
            time.sleep(0.005)
output(json.dumps(answers))
"""


def install_engine(site, source, mode=0o755):
    """Puts a file, or a text, in the place of the engine in one step: engines that run keep theirs."""
    beside = site.root / "ox_script.new"
    if isinstance(source, Path):
        shutil.copy(source, beside)
    else:
        beside.write_bytes(source)
    beside.chmod(mode)
    if site.owner is not None:
        os.chown(beside, site.owner, site.owner)
    beside.replace(site.root / "ox_script.bin")


def use_python(site):
    install_engine(site, PYTHON_ENGINE)


def use_player(site):
    value = os.environ.get("OX_TEST_ENGINE", "")
    if not os.access(value, os.X_OK):
        raise RuntimeError(f"OX_TEST_ENGINE must name the playing engine of the tests, it is {value!r}")
    install_engine(site, Path(value))


def script(site, name, text):
    """A script below the web root."""
    return site.page(name, text.encode() if isinstance(text, str) else text)


def remote_request(connection):
    """What the server asks the remote service on this connection; nothing when it leaves before the end."""
    request = b""
    while not request.endswith(b"|EOT"):
        block = connection.recv(4096)
        if not block:
            return b""
        request += block
    return request


def no_remote_service(site):
    """Switches off the remote service, which gets the commands that this server does not know."""
    site.main_ini.write_text(site.main_ini.read_text().replace("ersaddress=127.0.0.1:1", "ersaddress="))


def post(site, path, body, *headers, **how):
    data = request_text(path, *headers, f"Content-Length: {len(body)}", method="POST") + body
    return Reply(exchange(site.port, data, **how))


def page_pattern(content, content_type=b"text/html"):
    """What the answer of a script looks like, byte for byte but for the date."""
    return (
        b"HTTP/1\\.0 200 OK\r\nServer: Orvex HTTP Server V3\\.5c\r\nAllow: GET, POST\r\nContent-Type: "
        + re.escape(content_type)
        + b"\r\nCache-Control: no-cache\r\nPragma: no-cache\r\nDate: "
        + DATE
        + b"\r\n\r\n"
        + re.escape(content)
    )


def check_page(raw, content, **how):
    assert re.fullmatch(page_pattern(content, **how), raw, re.S), f"{raw[:500]!r} ({len(raw)} bytes)"


def use_steps(site):
    use_python(site)
    script(site, "steps.pl", STEPS)


def take_steps(site, *steps, **how):
    """Has one script carry out the steps; the answers to its calls as (status, text)."""
    reply = post(site, "/steps.pl", json.dumps(steps).encode(), **how)
    assert reply.status == 200, reply.raw
    return [tuple(answer) for answer in json.loads(reply.body)]


def call(site, command, first="", second=""):
    return take_steps(site, ("call", command, first, second))[0]


def output_files(site):
    return sorted(path.name for path in site.root.iterdir() if path.name.startswith(".oxscript"))


def children(pid):
    """The living children and the zombies of a process, by their states."""
    found = {}
    for name in os.listdir("/proc"):
        fields = process_status(name) if name.isdigit() else None
        if fields is not None and fields.get("PPid") == str(pid):
            found[int(name)] = fields["State"][0]
    return found


def engines(site):
    """The pids of all processes that run in the installation's directory, other than its own program."""
    found = []
    for name in os.listdir("/proc"):
        try:
            if name.isdigit() and os.readlink(f"/proc/{name}/cwd") == str(site.root) and is_alive(int(name)):
                if os.readlink(f"/proc/{name}/exe") != str(site.exe):
                    found.append(int(name))
        except OSError:
            continue
    return found


def report_lines(text, kind):
    """The lines of one kind in the report that the playing engine writes about itself."""
    return [line[len(kind) + 1 :] for line in text.decode("latin-1").splitlines() if line.startswith(kind + " ")]


def process_fields(text):
    return {k: v.strip() for k, _, v in (line.partition(":") for line in report_lines(text, "status"))}

