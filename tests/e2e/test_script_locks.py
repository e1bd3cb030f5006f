"""The lock through which scripts take turns, and messages that are not as they should be."""

import re
import time

import pytest

from engines import (
    READ_TOKEN,
    REPLY_500_SCRIPT,
    check_page,
    engines,
    no_remote_service,
    script,
    take_steps,
    use_steps,
)
from harness import Background, Client, SLOWDOWN, request_text, wait_until

READ, WRITE = 60, 61
UNLOCK, LOCK, TRY = "0", "1", "2"
GRANTED = {READ: (0, READ_TOKEN), WRITE: (0, "OK")}
REFUSED = (-1, "ERROR")


@pytest.fixture
def site(site):
    use_steps(site)
    no_remote_service(site)
    site.serve()
    return site


class Other:
    """A second script that carries out its steps at the same time. Each step may be followed by a mark, a file."""

    def __init__(self, site, *steps):
        self.site, self.answers = site, None
        self.load = Background(lambda _: self._run(steps), 1)

    def _run(self, steps):
        self.answers = take_steps(self.site, *steps)

    def wait_mark(self, name):
        wait_until(lambda: (self.site.root / name).exists() or self.load.errors, f"the mark {name}")

    def join(self):
        self.load.join()
        return self.answers


def holder(site, command):
    other = Other(site, ("call", command, LOCK, ""), ("touch", "held"), ("await", "go"), ("call", command, UNLOCK, ""))
    other.wait_mark("held")
    return other


def tries(site, *commands):
    return take_steps(site, *(("call", command, TRY, "") for command in commands))


def free(site):
    """Nobody holds the lock."""
    return tries(site, WRITE) == [GRANTED[WRITE]]


def test_a_writer_keeps_everybody_out(site):
    other = holder(site, WRITE)
    assert tries(site, WRITE, READ) == [REFUSED, REFUSED]
    (site.root / "go").touch()
    assert other.join() == [GRANTED[WRITE]] * 2
    assert free(site)


def test_readers_share_and_keep_writers_out(site):
    other = holder(site, READ)
    assert tries(site, WRITE, READ, READ) == [REFUSED, GRANTED[READ], GRANTED[READ]]
    assert take_steps(site, ("call", READ, LOCK, ""), ("call", READ, UNLOCK, "")) == [GRANTED[READ]] * 2
    assert tries(site, WRITE) == [REFUSED], "the first reader still holds it"
    (site.root / "go").touch()
    assert other.join() == [GRANTED[READ]] * 2
    assert free(site)


@pytest.mark.parametrize("held,wanted", [(WRITE, WRITE), (WRITE, READ), (READ, WRITE)])
def test_a_script_waits_until_the_lock_is_free(site, held, wanted):
    other = holder(site, held)
    waiting = Other(site, ("touch", "asks"), ("call", wanted, LOCK, ""), ("touch", "has"), ("call", wanted, UNLOCK, ""))
    waiting.wait_mark("asks")
    end = time.monotonic() + 0.5
    while time.monotonic() < end:
        assert not (site.root / "has").exists()
        assert site.get("/hello.htm").status == 200
        time.sleep(0.02)  # leaves the processor to the scripts
    (site.root / "go").touch()
    released = time.monotonic()
    waiting.wait_mark("has")
    assert time.monotonic() - released < 1.0 * SLOWDOWN
    assert other.join() == [GRANTED[held]] * 2 and waiting.join() == [GRANTED[wanted]] * 2


def test_tokens_exclude_each_other_under_load(site):
    """Each writer adds one to a number in a file; a reader never sees it half written."""
    (site.root / "number").write_text("0:0")
    script(site, "add.pl", """
for _ in range(20):
    assert call(61, "1", "") == (0, b"OK")
    number = open("number").read().split(":")
    assert number[0] == number[1], number
    open("number", "w").write(str(int(number[0]) + 1) + ":")
    open("number", "a").write(str(int(number[0]) + 1))
    assert call(61, "0", "") == (0, b"OK")
    assert call(60, "1", "")[0] == 0
    number = open("number").read().split(":")
    assert number[0] == number[1], number
    assert call(60, "0", "")[0] == 0
output("done")
""")

    def load(_):
        for _ in range(3):
            check_page(site.raw(request_text("/add.pl")), b"done")

    Background(load, 8).join(timeout=120 * SLOWDOWN)
    assert (site.root / "number").read_text() == "480:480"
    assert free(site)


@pytest.mark.parametrize(
    "end,page",
    [
        ("", b""),
        ("say_exit()\n", b""),
        ("os.close(1)\n", b""),
        ("os._exit(3)\n", None),
        ("os.kill(os.getpid(), 9)\n", None),
    ],
)
@pytest.mark.parametrize("operations", ["60/1 60/1", "60/2 60/1 60/2", "61/1", "61/2", "60/1 60/0 60/1"])
def test_what_a_script_leaves_locked_is_free_afterwards(site, operations, end, page):
    calls = [operation.split("/") for operation in operations.split()]
    text = "".join(f"assert call({command}, '{what}', '')[0] == 0\n" for command, what in calls)
    script(site, "leave.pl", text + end)
    raw = site.raw(request_text("/leave.pl"))
    if page is None:
        assert raw == REPLY_500_SCRIPT
    else:
        check_page(raw, page)
    assert free(site)


@pytest.mark.parametrize(
    "first,second", [(READ, WRITE), (WRITE, READ), (WRITE, WRITE)], ids=["read-write", "write-read", "write-write"]
)
def test_a_script_never_waits_for_itself(site, first, second):
    started = time.monotonic()
    answers = take_steps(site, ("call", first, LOCK, ""), ("call", second, LOCK, ""), ("call", second, TRY, ""))
    assert answers == [GRANTED[first], REFUSED, REFUSED]
    assert time.monotonic() - started < 2 * SLOWDOWN
    assert free(site)


@pytest.mark.parametrize("held", [READ, WRITE])
def test_what_a_script_does_not_hold_it_cannot_give_back(site, held):
    """The answer is that of a good return; the lock stays with its holder."""
    other = holder(site, held)
    answers = take_steps(site, ("call", READ, UNLOCK, ""), ("call", WRITE, UNLOCK, ""), ("call", WRITE, TRY, ""))
    assert answers == [GRANTED[READ], GRANTED[WRITE], REFUSED]
    (site.root / "go").touch()
    assert other.join() == [GRANTED[held]] * 2
    assert take_steps(site, ("call", READ, UNLOCK, ""), ("call", WRITE, TRY, "")) == [GRANTED[READ], GRANTED[WRITE]]
    assert free(site)


def test_a_waiting_script_whose_engine_dies_waits_no_longer(site):
    other = holder(site, WRITE)
    script(site, "dies.pl", "send(61, '1', '')\nos.kill(os.getpid(), 9)\n")
    started = time.monotonic()
    assert site.raw(request_text("/dies.pl")) == REPLY_500_SCRIPT
    assert time.monotonic() - started < 3 * SLOWDOWN
    (site.root / "go").touch()
    assert other.join() == [GRANTED[WRITE]] * 2
    assert free(site)


@pytest.mark.parametrize(
    "command,text,line",
    [(60, "x", 275), (60, "", 275), (60, "9", 297), (61, "-1", 243), (61, "3", 265), (61, "10", 265)],
)
def test_a_lock_message_without_a_known_number_is_the_end_of_the_server(make_site, command, text, line):
    """A script that sends it is wrong in itself; the engines end with the server."""
    site = make_site()
    use_steps(site)
    server = site.serve(shell="ulimit -c 0")
    script(site, "wrong.pl", f"call({command}, {text!r}, 'second')\n")
    script(site, "waits.pl", "open('runs', 'w').close()\ntime.sleep(100)\n")
    with Client(site.port) as client, Client(site.port) as other:
        other.send(request_text("/waits.pl"))
        wait_until(lambda: (site.root / "runs").exists(), "the other script runs")
        client.send(request_text("/wrong.pl"))
        assert server.wait_exit() == -6
    wait_until(lambda: engines(site) == [], "the engines have ended")
    expression = {275: r"\(__ctype_b\[\(int\) \(\(\*pszArgs\)\)\] & \(unsigned short int\) _ISdigit\)"}
    expression[243] = expression[275]
    pattern = rf".*\./ox_remote_dll/src/remotescript:{line}: .*: Assertion `{expression.get(line, '.*')}' failed\."
    assert any(re.fullmatch(pattern, text) for text in site.status()), site.status()
    site.expect("status", pattern, times=1)


# ------------------------------------------------------------------------------------------------------------ messages

# Waits until the server has read what was written before: one read is one message.
TAKEN = """
import fcntl, termios
def taken():
    while struct.unpack("i", fcntl.ioctl(1, termios.FIONREAD, b"0000"))[0]: time.sleep(0.002)
"""
NOT_ANSWERED = r"A message of the scripting engine \({} bytes\) is not answered: .*\."


def test_messages_without_an_answer(site):
    sizes = [1, 3, 4, 6, 8]
    script(site, "odd.pl", TAKEN + f"""
for size in {sizes}:
    raw(struct.pack("=i", 22).ljust(8, b"\\0")[:size])
    taken()
raw(struct.pack("=i", 22) + b"x" * 4092)
taken()
raw(struct.pack("=i", 22) + b"x" * 4091 + b"\\0")
taken()
raw(struct.pack("=i", 22) + b"\\0" + b"x" * 4091)
taken()
assert call(99, "", "") == (-2, b"")
assert call(60, "2", "") == (0, b"{READ_TOKEN}")
output("done")
""")
    check_page(site.raw(request_text("/odd.pl")), b"done")
    for size in sizes:
        site.expect("status", NOT_ANSWERED.format(size), times=1)
    site.expect("status", NOT_ANSWERED.format(4096), times=3)


def test_messages_at_the_bounds_are_answered(site):
    script(site, "bounds.pl", """
def answered(message):
    raw(message)
    return answer()
number = struct.pack("=i", 99)
assert answered(number + b"\\0" * 5) == (-2, b"")
assert answered(number + b"x" * 4090 + b"\\0\\0") == (-2, b"")
assert answered(number + b"\\0" + b"x" * 4090 + b"\\0") == (-2, b"")
assert answered(number + b"\\0" + b"x" * 4090) == (-2, b""), "the last zero may be missing"
assert answered(struct.pack("=i", 60) + b"2\\0xyz") == (0, b"%s"), "and in a short message as well"
assert answered(struct.pack("=i", 60) + b"2xyzxyz") == (0, b"%s"), "of both texts"
assert answered(number + b"a\\0b\\0" + b"rubbish" * 20) == (-2, b"")
output("done")
""" % (READ_TOKEN, READ_TOKEN))
    check_page(site.raw(request_text("/bounds.pl")), b"done")


def test_a_text_without_its_zero_never_shows_the_message_before(site):
    site.add_user("alice", "pw", 5)
    site.servers[0].reset()
    script(site, "old.pl", """
assert call(24, "", "username=alice") == (0, b"permissions=5")
raw(struct.pack("=i", 24) + b"\\0user")
assert answer() == (-1, b"")
output("done")
""")
    check_page(site.raw(request_text("/old.pl")), b"done")


@pytest.mark.parametrize(
    "message,ends",
    [
        ("EXIT", True),
        ("EXITxyz", True),
        ("EXIT\\0\\0\\0\\0\\0\\0", True),
        ("exit\\0\\0\\0\\0\\0\\0", False),
        ("EXI", False),
        (" EXIT\\0\\0\\0\\0\\0", False),
    ],
)
def test_the_last_word_of_an_engine(site, message, ends):
    """Behind it nothing is served any more."""
    script(site, "word.pl", TAKEN + f"""
raw(b"{message}")
taken()
if {ends}:
    try:
        os.write(1, struct.pack("=i", 99).ljust(9, b"\\0"))
        output(os.read(0, 100))
    except BrokenPipeError:
        output("closed")
else:
    if {message.count("0") > 1}:
        assert answer() == (-2, b"")
    assert call(99, "", "") == (-2, b"")
    output("served")
""")
    raw = site.raw(request_text("/word.pl"))
    body = raw.partition(b"\r\n\r\n")[2]
    assert body in ((b"", b"closed") if ends else (b"served",)), raw
    site.allow("status", NOT_ANSWERED.format(3))
