"""A crowd for one server (test_script_crowd.py): workers whose scripts change users and profiles and ask the remote
service, browsers who read reports meanwhile, and what all of them know."""

import collections
import contextlib
import os
import random
import socketserver
import threading
import time
import traceback
from urllib.parse import parse_qs

from engines import check_page, remote_request, script, use_player
from harness import REPLY_403, SLOWDOWN, Background, basic, request_text

WORKERS = 24
BROWSERS = 8
PATIENCE = 9 + SLOWDOWN  # seconds that the remote service is given
NAMES = ("alice", "bob", "carol", "dora", "chief", "eve")  # the users of the browsers; nobody gives "eve" a profile
FIELDS = ("permissions", "maxprofiles", "logfileurl", "password")  # each field of each of them has a worker
ALWAYS = "secret"  # their password
FILES = ("x.htm", "deep/y.gif")
STEADY = WORKERS  # the number of a profile that is read again most often and never changes


class History:
    """A value that one thread changes while others look on. From `settled` on it may be any that is listed."""

    def __init__(self, value):
        self.values, self.settled = [value], 0

    @contextlib.contextmanager
    def change(self, value):
        self.values.append(value)
        yield
        self.settled = len(self.values) - 1

    @property
    def value(self):
        return self.values[self.settled]


def may_see(name, users):
    """`users` are those in the profile's file, None when there is no file."""
    return name == "chief" or (users is not None and (name in users or name == "admin"))


# ------------------------------------------------------------------------------------------------ the remote service


def remote_answer(context, command, argument):
    """(status, text): the argument says which status, and the text repeats the request, so that nobody takes another
    one's for his own."""
    wishes = parse_qs(argument)
    text = f"{context} {command} {argument} "
    return int(wishes["status"][0]), text * (int(wishes["size"][0]) // len(text) + 1)


class Answering(socketserver.StreamRequestHandler):
    disable_nagle_algorithm = True

    def handle(self):
        request = remote_request(self.request)
        assert request, "the server left before its request was whole"
        context, command, argument, _ = request.decode().split("|")
        status, text = remote_answer(context, command, argument)
        self.server.answer(self.request, parse_qs(argument)["how"][0], f"{status}|{text}|EOT".encode())


class Service(socketserver.ThreadingTCPServer):
    """The stand-in for the remote service: a request says how it is to be answered."""

    daemon_threads = True
    request_queue_size = 64

    def __init__(self):
        super().__init__(("127.0.0.1", 0), Answering)
        self.port = self.server_address[1]
        self.held, self.faults, self.doors = [], [], threading.Event()
        threading.Thread(target=self.serve_forever, args=(0.05,), daemon=True).start()

    def answer(self, connection, how, answer):
        if how == "held":
            self.held.append(answer)
            self.doors.wait()
        elif how == "late":
            time.sleep(random.uniform(0.02, 0.3))
        elif how == "silent":
            assert connection.recv(1) == b"", "more than a request"
        elif how == "broken":
            answer = answer[:-4]
        while answer and how != "silent":
            size = random.choice((1, 2, len(answer) // 2 + 1, len(answer))) if how == "sliced" else len(answer)
            connection.sendall(answer[:size])
            answer = answer[size:]
            time.sleep(0.002 if how == "sliced" else 0)

    def handle_error(self, request, client_address):
        self.faults.append(traceback.format_exc())

    def close(self):
        self.doors.set()
        self.shutdown()
        self.server_close()


# -------------------------------------------------------------------------------------------------------- the place


class Place:
    """The installation: a profile with reports and a user for each worker, the users of the browsers, the service."""

    def __init__(self, site):
        self.site, self.service = site, Service()
        self.profiles = [History(frozenset()) for _ in range(WORKERS)] + [History(frozenset(NAMES[:3]))]
        self.fields, self.reports = {}, {}
        self.failed, self.counts, self._lock = False, collections.Counter(), threading.Lock()
        use_player(site)
        script(site, "in/whoami.pl", "write-output %8\n")
        site.page("in/page.htm", b"a page\n")
        for number in range(WORKERS):
            site.add_user(f"w{number}", "first", 2)
        for number, users in enumerate(self.profiles):
            site.add_profile(f"p{number}.wlp", ",".join(users.value))
            for name in FILES:
                content = b"p%d %s " % (number, name.encode()) + os.urandom(random.choice((300, 100_000)))
                self.reports[number, name] = content
                site.add_report(f"p{number}/{name}", content)
        for name in NAMES:
            site.add_user(name, ALWAYS, int(name == "chief"))
            start = {"permissions": int(name == "chief"), "password": ALWAYS}
            self.fields[name] = {field: History(start.get(field, "")) for field in FIELDS}
        site.add_user("admin", ALWAYS)
        text = site.main_ini.read_text().replace("127.0.0.1:1\n", f"127.0.0.1:{self.service.port}\n")
        site.main_ini.write_text(text)
        site.configure(web={"ErsTimeout": PATIENCE, "ErsRetries": 1})

    def count(self, what, number=1):
        with self._lock:
            self.counts[what] += number

    def ask(self, path, *login):
        """The answer to a request, with a login or without one."""
        self.count("requests")
        return self.site.raw(request_text(path, *(basic(*login),) if login else ()))

    def sees_report(self, number, name, *login):
        """True for the report, byte for byte, False for the refusal."""
        raw = self.ask(f"/reports/p{number}/{name}", *login)
        if raw == REPLY_403:
            self.count("reports refused")
            return False
        content = self.reports[number, name]
        head, _, body = raw.partition(b"\r\n\r\n")
        assert head.startswith(b"HTTP/1.0 200 OK\r\n"), head[:1000]
        assert body == content, f"{len(body)} bytes instead of {len(content)}: {body[:30]!r}"
        self.count("reports read")
        return True

    def guard(self, actor):
        """Runs an actor; all others end soon when it fails."""
        try:
            actor()
        except BaseException:
            self.failed = True
            self.service.doors.set()
            raise


# -------------------------------------------------------------------------------------------------------- a browser


class Browser:
    def __init__(self, place, number):
        self.place, self.random, self.ending = place, random.Random(f"browser {number}"), False

    def read(self):
        while not self.ending and not self.place.failed:
            self.random.choice((self.read_report, self.read_report, self.read_report, self.read_own_name))()

    def read_report(self):
        name = self.random.choice((*NAMES, "admin"))
        number = self.random.choice((STEADY, self.random.randrange(WORKERS)))
        users = self.place.profiles[number]
        first = users.settled
        seen = self.place.sees_report(number, self.random.choice(FILES), name, ALWAYS)
        assert seen in {may_see(name, value) for value in users.values[first:]}, f"{name}, p{number}, {seen}"

    def read_own_name(self):
        name = self.random.choice(NAMES)
        permissions = self.place.fields[name]["permissions"]
        first = permissions.settled
        raw = self.place.ask("/in/whoami.pl", name, ALWAYS)
        page = raw.partition(b"\r\n\r\n")[2]
        check_page(raw, page)
        assert page in {b"username=%s&permissions=%d" % (name.encode(), v) for v in permissions.values[first:]}, page
        self.place.count("scripts")


def work(place, workers, goes_on, timeout):
    """The workers work as long as `goes_on` says to each, and browsers read meanwhile."""
    browsers = [Browser(place, number) for number in range(BROWSERS)]
    reading = Background(lambda number: place.guard(browsers[number].read), BROWSERS)
    working = Background(lambda number: place.guard(lambda: workers[number].work(goes_on)), WORKERS)
    try:
        working.join(timeout)
    finally:
        for browser in browsers:
            browser.ending = True
        reading.join()
