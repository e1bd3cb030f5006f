"""Scripts whose command waits for the remote service: the wait ends with the run, and holds nobody else up."""

import contextlib
import socket
import threading
import time

import pytest

from engines import (
    REPLY_500_SCRIPT,
    check_page,
    children,
    engines,
    output_files,
    remote_request,
    script,
    take_steps,
    use_player,
    use_steps,
)
from harness import SLOWDOWN, Background, Client, is_listening, request_text, wait_until
from test_script_stop import expect_cut, started

UNREACHABLE = -9
HANGING = 15  # scripts, of the sixteen that run at once
LONG = 60  # seconds of patience with the remote service: more than any test here takes


class RemoteService:
    """Takes any number of connections at once and reads a request from each. It is silent until it may speak, then
    every request gets the same answer."""

    def __init__(self):
        self.listener = socket.create_server(("127.0.0.1", 0), backlog=64)
        self.port = self.listener.getsockname()[1]
        self.requests = []
        self.left = 0  # clients that went without an answer
        self.may_speak = threading.Event()
        self._lock = threading.Lock()
        self._connections = []
        threading.Thread(target=self._accept, daemon=True).start()

    def _accept(self):
        with contextlib.suppress(OSError):
            while True:
                connection, _ = self.listener.accept()
                self._connections.append(connection)
                threading.Thread(target=self._serve, args=(connection,), daemon=True).start()

    def _serve(self, connection):
        with contextlib.suppress(OSError), connection:
            request = remote_request(connection)
            if not request:
                return
            with self._lock:
                self.requests.append(request)
            connection.settimeout(0.02)
            while not self.may_speak.is_set():
                try:
                    if connection.recv(1) == b"":
                        with self._lock:
                            self.left += 1
                        return
                except TimeoutError:
                    continue
            connection.sendall(b"0|done|EOT")

    def wait_asked(self, count=1):
        wait_until(lambda: len(self.requests) >= count, "the remote service is asked")

    def close(self):
        self.may_speak.set()
        self.listener.close()
        for connection in self._connections:
            connection.close()


@pytest.fixture
def service():
    service = RemoteService()
    yield service
    service.close()


@pytest.fixture
def site(site, service):
    use_player(site)
    script(site, "page.pl", "write-output page\nexitmsg\n")
    script(site, "remote.pl", "send 99 ctx a=b\nanswer\nwrite-answer\nexitmsg\n")
    site.main_ini.write_text(f"[interface]\nersaddress=127.0.0.1:{service.port}\n")
    return site


def expect_nothing_left(site, server):
    server.wait_idle()
    assert engines(site) == [] and children(server.pid) == {} and output_files(site) == []


# ------------------------------------------------------------------------------------------------- the end of the run


@pytest.mark.parametrize("head,limit", [("", 5), ("ignore 2\n", 10)], ids=["obedient", "deaf"])
def test_the_time_limit_ends_a_wait_for_the_remote_service(site, service, head, limit):
    """After two seconds, or five more for an engine that does not obey; the service would have 8 and 60."""
    patience = LONG if head else 8
    site.configure(web={"WebScriptTimeout": 2, "ErsTimeout": patience, "ErsRetries": 1})
    script(site, "remote.pl", head + "send 99 ctx a=b\nanswer\nforever\n")
    server = site.serve()
    before = time.monotonic()
    assert site.raw(request_text("/remote.pl")) == REPLY_500_SCRIPT
    assert 2 <= time.monotonic() - before < limit * (SLOWDOWN if head else 1)
    assert service.requests == [b"ctx|99|a=b|EOT"]
    wait_until(lambda: service.left == 1, "the service is left")
    expect_nothing_left(site, server)


def test_an_engine_that_ends_ends_its_wait_for_the_remote_service(site, service):
    """All sixteen places are free again soon, and what the engines wrote last was asked for."""
    site.configure(web={"ErsTimeout": LONG, "ErsRetries": 1})
    script(site, "dies.pl", "send 99 %4 a=b\nexit 3\n")
    script(site, "dies_late.pl", "send 99 %4 a=b\nwait-file go\nkill 9\n")
    server = site.serve()
    before = time.monotonic()
    assert site.raw(request_text("/dies.pl")) == REPLY_500_SCRIPT
    assert time.monotonic() - before < 2 * SLOWDOWN

    pages = []
    load = Background(lambda _: pages.append(site.raw(request_text("/dies_late.pl"))), 16)
    service.wait_asked(17)
    (site.root / "go").touch()
    before = time.monotonic()
    load.join()
    assert time.monotonic() - before < 4 * SLOWDOWN
    assert pages == [REPLY_500_SCRIPT] * 16
    check_page(site.raw(request_text("/page.pl")), b"page")
    assert len(set(service.requests)) == 17, "each was asked for once"
    wait_until(lambda: service.left == 17, "the service is left")
    expect_nothing_left(site, server)


@pytest.mark.parametrize("head", ["", "ignore 2\nignore 15\n"], ids=["obedient", "deaf"])
def test_a_stop_does_not_wait_for_the_remote_service(site, service, head):
    """With as much patience as there is by default: 15 seconds."""
    script(site, "remote.pl", head + "send 99 ctx a=b\nanswer\nforever\n")
    server = site.serve()
    clients = started(site, 3, "/remote.pl")
    service.wait_asked(3)
    before = time.monotonic()
    code, out = site.run("-stop")
    assert code == 0 and out.endswith("The server has been stopped.\n")
    assert server.wait_exit() == 0
    took = time.monotonic() - before
    assert took < (9 if SLOWDOWN == 1 else 30), f"{took:.1f} s"
    assert engines(site) == [] and output_files(site) == []
    assert not site.pid_file.exists() and not is_listening(site.port)
    for client in clients:
        assert client.read_all() == b""
        client.close()
    wait_until(lambda: service.left == 3, "the service is left")
    expect_cut(site)


# ------------------------------------------------------------------------------------------------------------- a reset


def test_a_wait_for_the_remote_service_lives_through_a_reset(site, service):
    site.configure(web={"ErsTimeout": LONG, "ErsRetries": 1})
    server = site.serve()
    with started(site, 1, "/remote.pl")[0] as client:
        service.wait_asked()
        before = time.monotonic()
        server.reset()
        check_page(site.raw(request_text("/page.pl")), b"page")
        assert time.monotonic() - before < 10 * SLOWDOWN, "the reset waited for the service"
        assert service.left == 0
        service.may_speak.set()
        check_page(client.read_all(), b"0 done\n")
    expect_nothing_left(site, server)


def test_a_reset_keeps_the_remote_service_of_the_start(site, service):
    """Its address in the settings is read at the start only."""
    other = RemoteService()
    try:
        server = site.serve()
        site.main_ini.write_text(f"[interface]\nersaddress=127.0.0.1:{other.port}\n")
        server.reset()
        service.may_speak.set()
        other.may_speak.set()
        check_page(site.raw(request_text("/remote.pl")), b"0 done\n")
        assert service.requests == [b"ctx|99|a=b|EOT"]
        assert other.requests == []
    finally:
        other.close()
    expect_nothing_left(site, server)


def test_a_script_that_runs_during_a_reset_has_the_new_settings_afterwards(site, service):
    """The patience with the service is read again, both keys of it; its address is that of the server's start."""
    use_steps(site)
    site.configure(web={"ErsTimeout": LONG, "ErsRetries": 1})
    server = site.serve()
    answers, times = [], []

    def run(_):
        answers.extend(take_steps(site, ("touch", "began"), ("wait", "go"), ("call", 99, "ctx", "x")))
        times.append(time.monotonic())

    running = Background(run, 1)
    wait_until(lambda: (site.root / "began").exists(), "the script runs")
    site.configure(web={"ErsTimeout": 1, "ErsRetries": 3})
    site.main_ini.write_text("[interface]\nersaddress=\n")
    server.reset()
    before = time.monotonic()
    (site.root / "go").touch()
    running.join()
    assert answers == [(UNREACHABLE, f"statusdesc=Server is unavailable at 127.0.0.1:{service.port}.")]
    assert 3 <= times[0] - before < 15 * SLOWDOWN
    assert service.requests == [b"ctx|99|x|EOT"]


# -------------------------------------------------------------------------------------------------------- other scripts


def test_a_wait_for_the_remote_service_delays_no_other_scripts_command(site, service):
    """Neither the commands that are answered here nor those for the service itself."""
    site.configure(web={"ErsTimeout": LONG, "ErsRetries": 1})
    site.add_user("alice", "pw", 5)
    own = ["send 22 - -", "send 24 - username=alice", "send 60 1", "send 60 0", "send 61 1", "send 61 0"]
    script(site, "own.pl", "".join(f"{line}\nanswer\nwrite-answer\n" for line in own) + "exitmsg\n")
    site.serve()
    with contextlib.ExitStack() as waiting:
        hanging = [waiting.enter_context(client) for client in started(site, HANGING, "/remote.pl")]
        service.wait_asked(HANGING)
        times = []
        for _ in range(5):
            before = time.monotonic()
            raw = site.raw(request_text("/own.pl"))
            times.append(time.monotonic() - before)
            token = b"0 TOKEN RETREIVED SUCCESSFULLY\n"
            check_page(raw, b"0 u1=alice&p1=5\n0 permissions=5\n" + 2 * token + 2 * b"0 OK\n")
        print(f"\nbeside {HANGING} scripts that hang: {min(times) * 1000:.1f} to {max(times) * 1000:.1f} ms")
        assert max(times) < 2 * SLOWDOWN, times
        # Another one asks the service while they still wait.
        second = waiting.enter_context(Client(site.port))
        second.send(request_text("/remote.pl"))
        service.wait_asked(HANGING + 1)
        assert service.left == 0
        service.may_speak.set()
        for client in (*hanging, second):
            check_page(client.read_all(), b"0 done\n")
