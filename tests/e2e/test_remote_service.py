"""Answers of the remote service that are good, bad, late or none at all: what the script gets, when, and what is logged."""

import contextlib
import socket
import struct
import threading
import time

import pytest

from engines import call, remote_request, use_steps
from harness import SLOWDOWN, wait_until

UNREACHABLE = -9
SOON = 15 * SLOWDOWN  # seconds for a call that waits for nothing
LONG = 60 * SLOWDOWN  # more patience than any call here takes that does not wait in vain
LARGEST = 65533  # bytes of an answer that is taken
CANNOT_PARSE = ["oxxHttpServer::ProcessReply : unable to parse relpy."]
CANNOT_RECEIVE = "oxxHttpServer::ProcessReply : unable to receive request."
TOO_LARGE = ["oxxHttpServer::Receive: error reading request - the request was too large", CANNOT_RECEIVE]
RESET = ["oxxHttpServer::Receive: error - client disconnected - socket error = 104", CANNOT_RECEIVE]
TIMED_OUT = ["oxxHttpServer::Receive: error reading request from socket - socket error = 11", CANNOT_RECEIVE]


class Service:
    """Reads one request from each connection and answers as it is told; then it waits until the client has gone."""

    def __init__(self, answer):
        self.answer = answer
        self.requests = []
        self.left = 0  # connections whose client has gone
        self.listener = socket.create_server(("127.0.0.1", 0))
        self.port = self.listener.getsockname()[1]
        threading.Thread(target=self._accept, daemon=True).start()

    def _accept(self):
        with contextlib.suppress(OSError):
            while True:
                connection, _ = self.listener.accept()
                threading.Thread(target=self._serve, args=(connection,), daemon=True).start()

    def _serve(self, connection):
        with connection:
            connection.setsockopt(socket.IPPROTO_TCP, socket.TCP_NODELAY, 1)
            self.requests.append(remote_request(connection))
            with contextlib.suppress(OSError):
                self.answer(connection)
                while connection.fileno() >= 0 and connection.recv(4096):
                    pass
            self.left += 1


@pytest.fixture
def ask(site):
    """Asks a service that answers so: status and text, the seconds that it took, and the lines in the log."""
    services = []

    def run(answer, **patience):
        service = Service(answer)
        services.append(service)
        use_steps(site)
        site.configure(web=patience)
        site.main_ini.write_text(f"[interface]\nersaddress=127.0.0.1:{service.port}\n")
        site.allow("err", "oxxHttpServer::.*")  # which of them are there is compared below
        server = site.serve()
        before = time.monotonic()
        result = call(site, 99, "ctx", "a=b")
        took = time.monotonic() - before
        assert service.requests == [b"ctx|99|a=b|EOT"], "one request, of one connection"
        wait_until(lambda: service.left == 1, "the service is left")
        server.wait_idle()
        return result, took, [line for line in site.err() if "oxxHttpServer::" in line]

    yield run
    for service in services:
        service.listener.close()


def unreachable(site):
    port = site.main_ini.read_text().strip().rpartition(":")[2]
    return (UNREACHABLE, f"statusdesc=Server is unavailable at 127.0.0.1:{port}.")


def sends(data):
    return lambda connection: connection.sendall(data)


def sends_in_pieces(connection):
    for byte in b"12|in pieces|EOT":
        connection.sendall(bytes([byte]))
        time.sleep(0.02)


def sends_and_closes(data):
    def answer(connection):
        connection.sendall(data)
        connection.close()

    return answer


def sends_and_resets(data):
    def answer(connection):
        connection.sendall(data)
        connection.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, struct.pack("ii", 1, 0))
        connection.close()

    return answer


def of_size(size):
    return b"5|" + b"y" * (size - len(b"5||EOT")) + b"|EOT"


# ------------------------------------------------------------------------------------------------ answers that come


@pytest.mark.parametrize(
    "answer,expected",
    [
        (sends(b"0|done|EOT"), (0, "done")),
        (sends(b"-7||EOT"), (-7, "")),
        (sends_and_closes(b"3|bye|EOT"), (3, "bye")),
        (sends_in_pieces, (12, "in pieces")),
        (sends(of_size(LARGEST)), (5, "y" * (LARGEST - 6))),
    ],
    ids=["usual", "empty", "closed behind", "in pieces", "largest"],
)
def test_an_answer_is_taken_at_once(ask, answer, expected):
    result, took, lines = ask(answer, ErsTimeout=LONG, ErsRetries=1)
    assert result == expected and lines == []
    assert took < SOON


def test_an_answer_may_take_more_than_one_wait(ask):
    def late(connection):
        time.sleep(2.5)
        connection.sendall(b"3|late|EOT")

    result, took, lines = ask(late, ErsTimeout=1, ErsRetries=LONG)
    assert result == (3, "late") and lines == []
    assert 2.5 <= took < SOON


@pytest.mark.parametrize(
    "answer,expected",
    [
        (sends_and_closes(b""), CANNOT_PARSE),
        (sends_and_closes(b"\x80\xffHTTP/1.0 400 Bad Request\r\n\r\n"), CANNOT_PARSE),
        (sends_and_closes(b"0|half"), CANNOT_PARSE),
        (sends(b"x" * 17 + b"|EOT"), CANNOT_PARSE),
        (sends(b"0|x|EOT\n"), CANNOT_PARSE),
        (sends_and_resets(b"0|ha"), RESET),
        (sends(of_size(LARGEST + 1)), TOO_LARGE),
        (sends(of_size(70_000)), TOO_LARGE),
        (sends(of_size(10_000_000)), TOO_LARGE),
    ],
    ids=["closes", "garbage", "half", "status", "more", "reset", "one more", "large", "huge"],
)
def test_a_bad_answer_counts_as_none_at_once(site, ask, answer, expected):
    result, took, lines = ask(answer, ErsTimeout=LONG, ErsRetries=1)
    assert result == unreachable(site) and lines == expected
    assert took < SOON


# ------------------------------------------------------------------------------------------ answers that do not come


@pytest.mark.parametrize(
    "answer,expected",
    [(sends(b""), []), (sends(b"0|ha"), TIMED_OUT), (sends(b"0|x|EO"), TIMED_OUT)],
    ids=["nothing", "half", "almost"],
)
def test_a_silent_service_is_given_up_after_the_time_out_as_often_as_it_is_retried(site, ask, answer, expected):
    result, took, lines = ask(answer, ErsTimeout=1, ErsRetries=3)
    assert result == unreachable(site) and lines == expected
    assert 3 <= took < 3 + SOON


@pytest.mark.slow
def test_without_settings_a_silent_service_is_given_up_after_15_seconds(site, ask):
    result, took, lines = ask(sends(b""))
    assert result == unreachable(site) and lines == []
    assert 15 <= took < 15 + SOON
