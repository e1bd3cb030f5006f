"""What the server has to answer to a request: worked out from the rules, and kept apart from how the server does it.

An `Oracle` knows the files of an installation, its users, its profiles and the failed logins so far. It is told each
request and its answer, byte for byte, and raises `Wrong` when the answer is not the one that the rules demand.

When exactly the server looks at its clock is not known, only that it does so between a request and its answer. Where
that decides (a lock-out that is just ending), the oracle keeps every state that the answers so far allow.
"""

import calendar
import math
import re
import time

from engines import REPLY_500_SCRIPT
from harness import REPLY_400, REPLY_401, REPLY_403, REPLY_404, REPLY_413, REPLY_LOCKED_OUT, http_time

INLINE_LIMIT = 32_766  # bytes of a request that are read before its body must have been announced
BODY_LIMIT = 2_064_384
PATH_LIMIT = 8_192
PAIR_LIMIT = 256  # a name and a password with the colon stay below
RECORD_NAME = 127  # a longer name counts its failures with the empty one's
FAILURES, LOCKED_SECONDS = 4, 60
IMAGE_SECONDS = 2_592_000
META_BYTES, BLOCK = 2_000, 20_480
PATH_MAX, NAME_MAX = 4_096, 255
CLOCK_SLACK = 0.02  # seconds by which a coarse clock may lag behind

WEB, DATA, SCRIPTS = b"wwwroot", b"oxm_oxx/datfiles", b"scripts"
TYPES = {
    b"htm": b"text/html",
    b"gif": b"image/gif",
    b"xls": b"application/msexcel",
    b"doc": b"application/msword",
    b"jar": b"application/java-archive",
    b"oxw": b"application/ox-docutil",
}
ALPHABET = b"ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/"
HEX = b"0123456789abcdefABCDEF"
OUTPUT_NAME = re.compile(rb"\./\.oxscript:([0-9a-f]+)\n")

# Scripts of the playing engine: one writes its arguments and its input, one ends badly, one does nothing.
ECHO = b"# SOURCE-OF-A-SCRIPT\nread length\nwrite-output ECHO\\n%1\\n%2\\n%3\\n%4\\n%5\\n%6\\n%7\\n%8\\n\nwrite-body\n"
FAIL = b"# SOURCE-OF-A-SCRIPT\nexit 5\n"
NOTHING = b"# SOURCE-OF-A-SCRIPT\n"


class Wrong(AssertionError):
    """An answer that is not the one of the rules."""


# ---------------------------------------------------------------------------------------------------------- requests


class Request:
    """A request as the server must take it apart; `refusal` is the whole answer to one that it cannot."""

    def __init__(self, data):
        self.refusal = None
        self.incomplete = False  # the server waits for more than was sent
        self.method = self.url = self.path = self.query = self.extension = self.version = b""
        self.user = self.password = self.since = b""
        text, body = self._read(data)
        if self.refusal is None and not self._parse(text, body):
            self.refusal = REPLY_400

    def _read(self, data):
        end = data.find(b"\r\n\r\n")
        if not 0 <= end <= INLINE_LIMIT - 4:
            if len(data) >= INLINE_LIMIT:
                self.refusal = REPLY_413
            return data, b""
        end += 4
        at = data.find(b"Content-Length")
        if at < 0:
            at = data.find(b"Content-length")
        if not 0 <= at < end:
            return data[:end], b""
        length = re.match(rb" ?(\d*)", data[at + len(b"Content-Length") + 1 :])[1]
        length = int(length or b"0")
        if length > BODY_LIMIT and len(data) >= INLINE_LIMIT:
            self.refusal = REPLY_413
        self.incomplete = end + length > len(data)
        return data[:end], b"" if self.incomplete else data[end : end + length]

    def _parse(self, text, body):
        line = text.lstrip(b" ")
        token, _, rest = line.partition(b" ")
        for method in (b"GET", b"POST", b"HEAD"):
            if token and method.startswith(token.upper()):
                self.method = method
                break
        else:
            return False
        rest = rest.lstrip(b" ")
        match = re.match(rb"[^ \r\n]*", rest)
        url, rest = match[0], rest[match.end() + 1 :]
        if not url.startswith(b"/"):
            return False
        path, question, self.query = url.partition(b"?")
        self.url = path
        if not question and self.method == b"POST":
            self.query = body
        if len(path) >= PATH_LIMIT:
            return False
        self.path = unescape(path).partition(b"\0")[0]
        self.extension = self.path.rpartition(b".")[2] if b"." in self.path else b""
        version = re.match(rb"[^ \r\n]*", rest)[0]
        if len(version) == 8 and version[:5].lower() == b"http/":
            self.version = version
        rest = rest[len(version) :]
        if rest:
            rest = rest.lstrip(b" ")
            if not rest.startswith(b"\r\n"):
                return False
        self.since = header(rest, b"If-Modified-Since") or b""
        credentials = header(rest, b"Authorization")
        if credentials is not None and credentials.startswith(b"Basic"):
            pair = decode_base64(credentials[5:])
            if len(pair) < PAIR_LIMIT:
                self.user, _, self.password = pair.partition(b":")
        return True


def unescape(path):
    """Each escape becomes its byte; what an escape has become is not looked at again."""
    return re.sub(rb"%([0-9a-fA-F]{2})", lambda match: bytes([int(match[1], 16)]), path)


def header(text, name):
    """The first place where the name stands counts, also inside of another name."""
    at = text.find(name)
    if at < 0 or text[at + len(name) : at + len(name) + 1] != b":":
        return None
    value = text[at + len(name) + 1 :]
    return re.match(rb" ?([^\r\n]*)", value)[1]


def decode_base64(text):
    """Whatever stands in front of the first foreign byte counts, padded or not."""
    text = text.lstrip(b" \t")
    digits = []
    for byte in text:
        if byte not in ALPHABET:
            break
        digits.append(ALPHABET.index(byte))
    bits = "".join(f"{digit:06b}" for digit in digits)
    whole = bytes(int(bits[at : at + 8], 2) for at in range(0, len(bits) - 7, 8))
    return whole.partition(b"\0")[0]


def number(text):
    match = re.match(rb"\s*([+-]?\d+)", text)
    return int(match[1]) if match else 0


def parse_time(text):
    """Seconds of a date in one of the three forms of browsers, 0 where it is none."""
    blank = text.find(b" ")
    if blank < 0:
        return 0
    at = blank + 1
    if text[at : at + 1] == b" ":
        at += 1
    year = None
    if not text[at : at + 1].isdigit():
        if len(text) < 23:
            return 0
        month = month_of(text[at:])
        day_at = at + 4
        if text[day_at : day_at + 1] == b" ":
            day_at += 1
        day = number(text[day_at:])
        clock = day_at + 2
        if text[clock : clock + 1] == b" ":
            clock += 1
    else:
        if len(text) < 29:
            return 0
        day = number(text[at:])
        month = month_of(text[at + 3 :])
        year = number(text[at + 7 :])
        if year <= 69:
            year += 2000
        elif year <= 99:
            year += 1900
        elif year < 1900:
            return 0
        clock = text.find(b" ", at + 7) + 1
        if clock == 0:
            return 0
    if day > 31 or month > 11:
        return 0
    hours, minutes, seconds = (number(text[clock + skip :]) for skip in (0, 3, 6))
    if hours >= 24 or minutes >= 60 or seconds >= 60:
        return 0
    if year is None:
        year = number(text[clock + 9 :])
        if year < 1900:
            return 0
    return calendar.timegm((year, month + 1, day, hours, minutes, seconds))


def month_of(text):
    names = [b"jan", b"feb", b"mar", b"apr", b"may", b"jun", b"jul", b"aug", b"sep", b"oct", b"nov", b"dec"]
    name = text[:3].lower()
    return names.index(name) if name in names else 13


# ------------------------------------------------------------------------------------------------------------- files


class Tree:
    """The files that a URL may reach, by their path below the installation."""

    def __init__(self, root):
        self.root = root
        self.files = {}
        self.directories = {b""}

    def add(self, path, content, mtime):
        self.files[path] = (content, mtime)
        while b"/" in path:
            path = path.rpartition(b"/")[0]
            self.directories.add(path)

    def find(self, start, path):
        """What the system finds for `path` below `start`: the place of a file or a directory, or None."""
        if len(self.root + b"/" + start + path) >= PATH_MAX:
            return None
        place = start
        for part in path.split(b"/"):
            if place not in self.directories or len(part) > NAME_MAX:
                return None
            if part == b"..":
                place = place.rpartition(b"/")[0]
            elif part not in (b"", b"."):
                place = place + b"/" + part if place else part
        return place if place in self.files or place in self.directories else None


def extension_of(path):
    name = path.rpartition(b"/")[2]
    return name.rpartition(b".")[2] if b"." in name else b""


def declared_type(content):
    """The content type that a page declares in its own head."""
    text = content[:META_BYTES].partition(b"\0")[0]
    lower = text.lower()
    start = lower.find(b"<head>")
    end = lower.find(b"</head>", start + 6)
    if start < 0 or end < 0:
        return b""
    head = lower[start + 6 : end]
    found = b""
    at = head.find(b"<")
    while at >= 0:
        match = re.match(rb"<[ \t]*meta", head[at:])
        if match:
            tag = rb'[ \t]*http-equiv[ \t]*=[ \t]*"[ \t]*([^"]*)"[ \t]*content[ \t]*=[ \t]*"[ \t]*([^"]*)"'
            match = re.match(tag, head[at + match.end() :])
            if match and match[1].startswith(b"content-type"):
                found = match[2]
        at = head.find(b"<", at + 1)
    return found


# ------------------------------------------------------------------------------------------------------ failed logins


class Span:
    """From a request to its answer: what the server does, it does in between."""

    def __init__(self):
        self.wall, self.start = time.time(), time.monotonic()

    def end(self):
        self.stop = time.monotonic()
        self.seconds = range(int(self.wall - CLOCK_SLACK), int(time.time()) + 1)  # which a date may name
        return self


class Record:
    """One possible state of a name's failures, and one possible answer to whether its time is over. The server counts
    whole seconds, and nobody knows when they begin."""

    def __init__(self, state, span, over):
        self.state = state  # (between which times the last failure was, failures), or None
        self.span = span
        self.over = over
        self.locks = False  # whether this failure is the one that locks the name out

    @staticmethod
    def possible(state, span):
        """Whether the time may be over, and whether it may still run."""
        if state is None:
            return [True]
        first, last, _ = state
        still = math.floor(span.start - last - CLOCK_SLACK) < LOCKED_SECONDS
        over = math.ceil(span.stop - first + CLOCK_SLACK) >= LOCKED_SECONDS
        return [False] * still + [True] * over

    def locked(self):
        if self.state is None or self.state[2] < FAILURES:
            return False
        if not self.over:
            return True
        self.state = None
        return False

    def fail(self):
        count = 1 if self.state is None or self.over else self.state[2] + 1
        self.state = (self.span.start, self.span.stop, count)
        self.locks = count >= FAILURES


# ----------------------------------------------------------------------------------------------------------- answers


class Answer:
    """An answer of one kind. `count` is the number of file bytes in it, `locks` whether it locks a name out."""

    def __init__(self, kind, status, text):
        self.kind, self.status, self.text, self.count = kind, status, text, 0
        self.locks = False

    def fits(self, raw, seconds):
        return raw == self.text

    def show(self, seconds):
        return self.text


CANNED = {
    REPLY_400: ("400", 400),
    REPLY_401: ("401", 401),
    REPLY_403: ("403", 403),
    REPLY_404: ("404", 404),
    REPLY_413: ("413", 413),
    REPLY_LOCKED_OUT: ("locked out", 403),
    REPLY_500_SCRIPT: ("500", 500),
}


def canned(text):
    return Answer(*CANNED[text], text)


def nothing():
    """A directory: it opens, but it cannot be read, and a header is only sent with a first block."""
    return Answer("nothing", 200, b"")


class Page(Answer):
    def __init__(self, kind, content, content_type, *, expires=False, mtime=None, dynamic=False):
        super().__init__(kind, 200, None)
        self.content = content
        self.type = declared_type(content[:BLOCK]) or content_type
        self.expires, self.mtime, self.dynamic = expires, mtime, dynamic
        self.count = len(content)

    def show(self, seconds):
        head = b"HTTP/1.0 200 OK\r\nServer: Orvex HTTP Server V3.5c\r\nAllow: GET, POST\r\n"
        head += b"Content-Type: " + self.type + b"\r\n"
        if self.dynamic:
            head += b"Cache-Control: no-cache\r\nPragma: no-cache\r\n"
        head += date_line(b"Date", seconds[0])
        if self.expires:
            head += date_line(b"Expires", seconds[0] + IMAGE_SECONDS)
        if self.mtime is not None:
            head += date_line(b"Last-Modified", self.mtime)
        return head + b"\r\n" + self.content

    def fits(self, raw, seconds):
        return any(raw == self.show([second]) for second in seconds)


class EchoPage(Answer):
    """The page of a script that writes its arguments; the number of its output file is the server's affair."""

    def __init__(self, before, after):
        super().__init__("script", 200, None)
        self.before, self.after = before, after
        self.output = None
        self.page = None

    def fits(self, raw, seconds):
        match = OUTPUT_NAME.search(raw)
        if match is None:
            return False
        self.output = int(match[1], 16)
        self.page = Page("script", self.before + match[0] + self.after, TYPES[b"htm"], dynamic=True)
        self.count = self.page.count
        return self.page.fits(raw, seconds)

    def show(self, seconds):
        return self.page.show(seconds) if self.page else self.before + b"./.oxscript:?\n" + self.after


class NotModified(Answer):
    def __init__(self, expires):
        super().__init__("304", 304, None)
        self.expires = expires

    def show(self, seconds):
        head = b"HTTP/1.0 304 Not Modified\r\n" + date_line(b"Date", seconds[0])
        if self.expires:
            head += date_line(b"Expires", seconds[0] + IMAGE_SECONDS)
        return head + b"Server: Orvex HTTP Server V3.5c\r\n\r\n"

    def fits(self, raw, seconds):
        return any(raw == self.show([second]) for second in seconds)


def date_line(name, second):
    return name + b": " + http_time(second).encode() + b"\r\n"


# ------------------------------------------------------------------------------------------------------------ oracle


class Oracle:
    def __init__(self, tree, users, profiles, directory_mtime):
        self.tree = tree
        self.users = users  # name -> (password, permissions); an empty password lets any in
        self.profiles = profiles  # identifier -> names
        self.failures = {}  # name -> the states that its record may have
        self.directory_mtime = directory_mtime  # directories change at times that nobody asks for

    # --- who may see what

    def accepts(self, name, password):
        entry = self.users.get(name)
        return entry is not None and entry[0] in (b"", password)

    def permits(self, name, profile):
        if profile not in self.profiles:
            profile += b".wlp"
        return profile in self.profiles and name in [*self.profiles[profile], b"admin"]

    def record_name(self, name):
        return name if len(name) <= RECORD_NAME else b""

    def failures_at_most(self, name, now):
        """The failures that may count when one more comes now, by the monotonic clock."""
        states = [state for state in self.failures.get(self.record_name(name), ()) if state is not None]
        return max((count for _, last, count in states if last + LOCKED_SECONDS + 2 > now), default=0)

    # --- the answer

    def judge(self, data, raw, span):
        """The answer of the rules to `data`, which `raw` must be; what it means is remembered."""
        request = Request(data)
        seconds = span.seconds
        name = self.record_name(request.user)
        fitting, wrong = set(), []
        answer = None
        for state in self.failures.get(name, {None}):
            for over in Record.possible(state, span):
                record = Record(state, span, over)
                demanded = self.route(request, record)
                if demanded.fits(raw, seconds):
                    answer = demanded
                    answer.locks = record.locks
                    fitting.add(record.state)
                else:
                    wrong.append(demanded)
        if answer is None:
            expected = "\n      or ".join(sorted({repr(demanded.show(seconds)[:1500]) for demanded in wrong}))
            states = sorted(map(str, self.failures.get(name, ())))
            failures = f"failures of {name!r} at {span.start}: {states}"
            raise Wrong(f"expected {expected}\n     got {raw[:1500]!r}\n {failures}")
        if fitting == {None}:
            self.failures.pop(name, None)
        else:
            self.failures[name] = fitting
        return request, answer

    def route(self, request, record):
        if request.refusal is not None:
            return canned(request.refusal)
        path, user = request.path, request.user
        if b"../" in path:
            return canned(REPLY_404)
        if path == b"/public.pl" and user != b"anonymous":
            return canned(REPLY_401)
        if path == b"/private.pl" and user == b"anonymous":
            return canned(REPLY_401)

        locked = user != b"" and record.locked()
        good = user != b"" and not locked and self.accepts(user, request.password)
        report = path[1:8] == b"reports" and path[8:9] in (b"", b"/")
        profile = path.split(b"/")[2] if path.count(b"/") > 1 else b""
        if report and not good and self.accepts(b"anonymous", b"") and self.permits(b"anonymous", profile):
            return self.static_file(DATA, request)

        known, permissions = False, 0
        if path.count(b"/") > 1:
            if user == b"":
                return canned(REPLY_401)
            if locked:
                return canned(REPLY_LOCKED_OUT)
            if not good:
                record.fail()
                return canned(REPLY_LOCKED_OUT if record.locks else REPLY_401)
            known, permissions = True, self.users[user][1]

        if request.extension != b"pl":
            if not report:
                return self.static_file(WEB, request)
            if not permissions & 1 and not self.permits(user, profile):
                return canned(REPLY_403)
            return self.static_file(DATA, request)

        parameters = b"NULL"
        if known:
            parameters = b"username=%s&permissions=%d" % (escape_name(user), permissions)
        if path.startswith(b"/cgi-bin/"):
            return self.script(SCRIPTS, path[8:], request, parameters)
        return self.script(WEB, path, request, parameters)

    def static_file(self, start, request):
        path = request.path + (b"default.htm" if request.path.endswith(b"/") else b"")
        place = self.tree.find(start, path)
        if place is None:
            return canned(REPLY_404)
        content, mtime = self.tree.files.get(place, (None, self.directory_mtime))
        extension = extension_of(path)
        if request.since and parse_time(request.since) >= mtime:
            return NotModified(extension == b"gif")
        if content is None:
            return nothing()
        return Page("page", content, TYPES.get(extension, b""), expires=extension == b"gif", mtime=mtime)

    def script(self, start, path, request, parameters):
        if any(byte <= 0x20 or byte == 0x7F for byte in path):
            return canned(REPLY_404)
        place = self.tree.find(start, path)
        if place is None:
            return canned(REPLY_404)
        text = self.tree.files.get(place, (NOTHING, 0))[0]  # the engine plays a directory like an empty script
        if text == FAIL:
            return canned(REPLY_500_SCRIPT)
        if text == NOTHING:
            return Page("empty script", b"", TYPES[b"htm"], dynamic=True)
        assert text == ECHO, text
        root = self.tree.root
        before = b"ECHO\nOX_WEBSERVER\n%s\nNULL\n" % (root + b"/" + start + path)
        after = b"%s/ox_script\n%s\n%d\n%s\n%s" % (root, root, len(request.query), parameters, request.query)
        return EchoPage(before, after)

    # --- what scripts change

    def add_user(self, name, password, permissions):
        refused = (
            name in self.users
            or not 0 < len(name) <= 255
            or name != name.strip(b" ")
            or any(byte < 0x20 or byte == 0x7F or byte in b":&=" for byte in name)
            or len(password) > 351
        )
        if refused:
            return b"-1 \n"
        self.users[name] = (password, permissions)
        return b"0 \n"

    def delete_user(self, name):
        return b"-1 \n" if self.users.pop(name, None) is None else b"0 \n"

    def change_user(self, name, password=None, permissions=None):
        """A change of nobody changes nothing and is no failure."""
        if name in self.users:
            old = self.users[name]
            self.users[name] = (
                old[0] if password is None else password,
                old[1] if permissions is None else permissions,
            )
        return b"0 \n"

    def read_user(self, name):
        return b"0 permissions=%d\n" % self.users[name][1] if name in self.users else b"-1 \n"

    def refresh_profile(self, identifier, names):
        """`names` is what its file says now, None where there is no file."""
        if names is None:
            self.profiles.pop(identifier, None)
        else:
            self.profiles[identifier] = names
        return b"0 \n"

    def test_profile(self, name, profile):
        return b"0 \n" if self.permits(name, profile) else b"-1 \n"


def names_in(text):
    """The names in the list of a profile file; blanks in front of a name do not count, all others do."""
    names = []
    text = text.strip(b" ")
    while text := text.lstrip(b" ,"):
        name, _, text = text.partition(b",")
        names.append(name)
    return names


def escape_name(name):
    """A name as it stands in the parameters of a script."""
    return b"".join(
        b"%%%02X" % byte if byte <= 0x20 or byte == 0x7F or byte in b"&=%+" else bytes([byte]) for byte in name
    )


def log_text(text):
    """A text from a client as it stands in the message log."""
    return "".join(f"\\x{byte:02x}" if byte < 0x20 or byte == 0x7F else chr(byte) for byte in text)


def access_line(request, answer):
    """What an access-log line says behind its time, with the name in front; a request that is refused as a whole only
    shows in its status."""
    if request.refusal is not None:
        return (str(answer.status), "0")
    name = log_text(request.user).replace('"', "\\x22") or "-"
    url = log_text(request.url).replace('"', "\\x22")
    line = f"{request.method.decode()} {url} {log_text(request.version)}"
    return (name, line, str(answer.status), str(answer.count))
