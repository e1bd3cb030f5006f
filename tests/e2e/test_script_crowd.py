"""Two dozen scripts at once change users, have profiles read again and ask the remote service, while browsers read
reports. Everybody knows what he must get: each worker has users and a profile of his own, and one field of one user of
the browsers. What others see of a change is the old or the new while it is under way, and the new from its answer on.

A few rounds of it always run; the minute runs with the other soak tests (OX_SOAK=1) and prints its figures.
"""

import collections
import random
import re
import time
from urllib.parse import parse_qsl, urlencode

import pytest

from crowd import ALWAYS, FIELDS, FILES, NAMES, STEADY, WORKERS, Place, remote_answer, work
from engines import check_page, children, engines, output_files, script
from harness import (
    REPLY_401,
    SANITIZER,
    SLOWDOWN,
    Background,
    descriptors,
    resident_kib,
    stays_true,
    thread_count,
    wait_until,
)
from test_script_commands import (
    ADD,
    CHANGE,
    DELETE,
    DONE,
    FAILED,
    GET,
    LIST,
    LIST_PROFILES,
    TEST_PROFILE,
    UNREACHABLE,
    values,
)

REMOTE = 99
REFRESHES = (32, 33, 34, 35)
ENGINES = 16  # that run at once
CONTESTED = ("contested0", "contested1")  # users whom every worker adds and deletes


class Worker:
    def __init__(self, place, number):
        self.place, self.site, self.number = place, place.site, number
        self.random = random.Random(f"worker {number}")
        self.name, self.password, self.permissions = f"w{number}", "first", 2
        self.rounds = 0
        self.contested = collections.Counter()  # how many more there are of each by this worker's doing

    def work(self, goes_on):
        while goes_on(self) and not self.place.failed:
            self.rounds += 1
            self.live_a_life(f"{self.name}r{self.rounds}", f"old pw&{self.rounds}", f"new=pw+%41{self.rounds}")

    # --- one script

    def take(self, *calls):
        """Has one script make the calls, each a command, its arguments and the answer wanted (None: any)."""
        moves = ["write-output %8\\n"]
        for command, arguments, _ in calls:
            text = urlencode(arguments).replace("%", "\\x25")
            moves += [f"send {command} {self.name} {text or '-'}", "answer", "write-answer"]
        script(self.site, f"in/{self.name}.pl", "\n".join([*moves, "exitmsg", ""]))
        raw = self.place.ask(f"/in/{self.name}.pl", self.name, self.password)
        page = raw.partition(b"\r\n\r\n")[2]
        check_page(raw, page)
        head, *answers = page.decode().split("\n")[:-1]
        assert head == f"username={self.name}&permissions={self.permissions}"
        assert len(answers) == len(calls)
        for (command, arguments, wanted), answer in zip(calls, answers):
            assert wanted in (None, answer), f"{self.name}: {command} {arguments}: {answer[:500]}, not {wanted[:500]}"
        self.place.count("scripts")
        self.place.count("calls", len(calls))
        return answers

    def remote(self, how="", command=REMOTE, sizes=(0, 0, 0, 60_000), **arguments):
        """A call for the remote service, with the answer that it will give."""
        how = how or self.random.choice(("well", "well", "well", "late", "sliced", "broken"))
        self.place.count(f"{how} answers")
        arguments |= {"how": how, "status": self.random.choice((0, 7, -3)), "size": self.random.choice(sizes)}
        answer = remote_answer(self.name, command, urlencode(arguments))
        if how in ("broken", "silent"):
            answer = (UNREACHABLE, f"statusdesc=Server is unavailable at 127.0.0.1:{self.place.service.port}.")
        return command, arguments, "%d %s" % answer

    # --- a round

    def live_a_life(self, user, old, new):
        """From the making of a user to his deletion; his login fails twice, which locks nobody out."""
        mine = {"username": user}
        foreign = self.random.choice([number for number in range(WORKERS) if number != self.number])
        entry = {**mine, "password": old, "permissions": 4, "maxprofiles": 3, "logfileurl": f"http://x/a b?c=%{user}"}
        known = (GET, mine, f"{DONE} permissions=4")
        *_, listed = self.take((ADD, entry, f"{DONE} "), known, (ADD, entry, f"{FAILED} "), (LIST, {}, None))
        self.check_list(listed, user)
        self.check_file(entry)
        assert self.logs_in(user, old) and not self.sees(self.number, user, old)

        self.set_profile({user, *self.random.sample(NAMES[:-1], 3)}, user)
        assert self.sees(self.number, user, old) and not self.sees(foreign, user, old)

        change = {**mine, "password": new, "permissions": 1, "maxprofiles": self.rounds}
        known = (GET, mine, f"{DONE} permissions=1")
        self.take((CHANGE, change, f"{DONE} "), known, self.remote())
        self.check_file({**entry, **change})
        assert not self.logs_in(user, old) and self.sees(foreign, user, new)

        known = (GET, mine, f"{DONE} permissions=6")
        patient = self.remote("silent" if self.number == 0 and self.rounds % 10 == 5 else "")
        self.take((CHANGE, {**mine, "permissions": 6}, f"{DONE} "), known, self.remote(), patient)
        assert self.sees(self.number, user, new) and not self.sees(foreign, user, new)
        self.change_himself()
        self.change_a_field()
        self.contest()

        self.set_profile(self.random.choice((None, set(), set(self.random.sample(NAMES[:-1], 3)))), user)
        assert not self.sees(self.number, user, new) and self.logs_in(user, new)

        unknown = (GET, mine, f"{FAILED} ")
        self.take((DELETE, mine, f"{DONE} "), (DELETE, mine, f"{FAILED} "), unknown, (CHANGE, mine, f"{DONE} "))
        assert not self.logs_in(user, new) and not (self.site.users / f"{user}.usr").exists()
        self.place.count("rounds")

    def logs_in(self, user, password):
        raw = self.place.ask("/in/page.htm", user, password)
        assert raw == REPLY_401 or raw.endswith(b"\r\n\r\na page\n"), raw[:1000]
        return raw != REPLY_401

    def sees(self, number, user, password):
        return self.place.sees_report(number, self.random.choice(FILES), user, password)

    def check_list(self, answer, user):
        """It is whole and in order, and what this worker knows in it is right."""
        assert answer.startswith(f"{DONE} u1=")
        found = parse_qsl(answer[2:])
        names, permissions = [value for _, value in found[::2]], [int(value) for _, value in found[1::2]]
        keys = [key for number in range(len(names)) for key in (f"u{number + 1}", f"p{number + 1}")]
        assert [key for key, _ in found] == keys and len(permissions) == len(names)
        assert names == sorted(set(names)) and {*NAMES, "admin"} <= set(names)
        mine = {name: value for name, value in zip(names, permissions) if re.fullmatch(self.name + r"(r\d+)?", name)}
        assert mine == {self.name: self.permissions, user: 4}

    def check_file(self, entry):
        stored = values((self.site.users / f"{entry['username']}.usr").read_text())
        assert stored.keys() == entry.keys(), stored
        assert {key: stored[key] for key in stored if key != "password"} == {
            key: str(entry[key]) for key in entry if key != "password"
        }

    def set_profile(self, users, user):
        """Writes the profile's file, or takes it away, and has it read again."""
        name = f"p{self.number}.wlp"
        path = self.site.root / "profiles" / name
        with self.place.profiles[self.number].change(users):
            if users is None:
                path.unlink()
            else:
                beside = path.with_suffix(".new")
                beside.write_text("[Profile]\nUsers=" + ", ".join(sorted(users)) + "\n")
                beside.replace(path)
            named = self.random.choice((name, name.removesuffix(".wlp")))
            calls = [self.remote(command=self.random.choice(REFRESHES), profile_id=named)]
            for one in (user, "alice", "admin", "eve"):
                seen = users is not None and (one in users or one == "admin")
                calls.append((TEST_PROFILE, {"username": one, "profile_id": named}, f"{DONE if seen else FAILED} "))
            listed = f"profile_id={name}" if user in (users or ()) else ""
            calls += [self.remote("well", command, (0,), profile_id=f"p{STEADY}.wlp") for command in REFRESHES]
            self.take(*calls, (LIST_PROFILES, {"username": user}, f"{DONE} {listed}"))

    def change_himself(self):
        password, permissions = f"pw{self.rounds}", 2 * self.rounds
        arguments = {"username": self.name, "password": password, "permissions": permissions}
        self.take((CHANGE, arguments, f"{DONE} "))
        self.password, self.permissions = password, permissions

    def change_a_field(self):
        name, field = NAMES[self.number % len(NAMES)], FIELDS[self.number // len(NAMES)]
        value = {
            "permissions": 2 * self.rounds + (name == "chief"),
            "maxprofiles": self.rounds,
            "logfileurl": f"/{self.rounds}",
            "password": ALWAYS,
        }[field]
        calls = [(CHANGE, {"username": name, field: value}, f"{DONE} ")]
        if field == "permissions":
            calls.append((GET, {"username": name}, f"{DONE} permissions={value}"))
        with self.place.fields[name][field].change(value):
            self.take(*calls)

    def contest(self):
        name, adds = self.random.choice(CONTESTED), self.random.random() < 0.5
        arguments = {"username": name, "password": name, "permissions": 9}
        answer, found = self.take((ADD if adds else DELETE, arguments, None), (GET, arguments, None))
        assert answer in (f"{DONE} ", f"{FAILED} ") and found in (f"{DONE} permissions=9", f"{FAILED} ")
        self.contested[name] += (1 if adds else -1) * (answer == f"{DONE} ")


# --------------------------------------------------------------------------------------------------------- the crowd


def fill_the_house(place, workers, server):
    """All workers want the remote service at once; the engines of sixteen ask, and the others wait for a place."""
    service = place.service
    load = Background(lambda number: place.guard(lambda: workers[number].take(workers[number].remote("held"))), WORKERS)
    wait_until(lambda: len(service.held) == ENGINES or place.failed, "the places are taken")
    stays_true(lambda: len(service.held) == ENGINES, 0.3, "more engines than places")
    assert len(children(server.pid)) == ENGINES
    service.doors.set()
    load.join()
    assert len(service.held) == WORKERS


def look_at(place, server):
    """Its memory, descriptors and threads, when nothing is left of all requests."""
    assert place.ask("/hello.htm").startswith(b"HTTP/1.0 200 OK\r\n")  # a connection sweeps the last sessions
    server.wait_idle()
    assert children(server.pid) == {} and engines(place.site) == [] and output_files(place.site) == []
    return resident_kib(server.pid), len(descriptors(server.pid)), thread_count(server.pid)


def wanted_users(place, workers):
    """The users in the end, with all that is stored of them."""
    users = {worker.name: {"permissions": worker.permissions} for worker in workers}
    for name, fields in place.fields.items():
        users[name] = {field: history.value for field, history in fields.items() if history.value != ""}
    users["admin"] = {"permissions": 0}
    balance = {name: sum(worker.contested[name] for worker in workers) for name in CONTESTED}
    assert set(balance.values()) <= {0, 1}, f"{balance}: added or deleted twice"
    users |= {name: {"permissions": 9} for name, count in balance.items() if count == 1}
    return users


def check_users(place, workers):
    """The files, each of them whole, and what a script is told."""
    users = wanted_users(place, workers)
    assert {path.name for path in place.site.users.iterdir()} == {f"{name}.usr" for name in users}
    for name, entry in users.items():
        workers[0].check_file({"username": name, "password": "", **entry})
    names = enumerate(sorted(users), 1)
    listed = [f"u{number}={name}&p{number}={users[name]['permissions']}" for number, name in names]
    profiles = collections.defaultdict(list)
    for file, known in sorted((f"p{number}.wlp", known.value) for number, known in enumerate(place.profiles)):
        for name in () if known is None else {*known, "admin"}:
            profiles[name].append(f"profile_id={file}")
    calls = [(LIST_PROFILES, {"username": name}, f"{DONE} " + "&".join(profiles[name])) for name in (*NAMES, "admin")]
    for worker in workers:
        worker.take((LIST, {}, f"{DONE} " + "&".join(listed)), *calls)
    assert all(workers[0].logs_in(name, ALWAYS) for name in (*NAMES, "admin"))


@pytest.fixture
def place(site):
    place = Place(site)
    yield place
    place.service.close()


def crowd(place, warm, goes_on):
    """After `warm` rounds each: `goes_on` tells from a worker and the seconds so far whether he makes another one."""
    site, limit = place.site, 300 * SLOWDOWN
    # With one heap for all threads the memory tells what is kept, and nothing else.
    server = site.serve(env={"MALLOC_ARENA_MAX": "1"})
    workers = [Worker(place, number) for number in range(WORKERS)]
    fill_the_house(place, workers, server)
    work(place, workers, lambda worker: worker.rounds < warm, limit)
    before, counts = look_at(place, server), place.counts.copy()
    began = time.monotonic()
    work(place, workers, lambda worker: goes_on(worker, time.monotonic() - began), limit)
    elapsed = time.monotonic() - began
    after, counts = look_at(place, server), place.counts - counts
    print(f"\n{elapsed:.1f} s:", ", ".join(f"{count} {what}" for what, count in sorted(counts.items())))
    for what, old, new in zip(("RSS in KiB", "descriptors", "threads"), before, after):
        print(f"{what}: {old} -> {new}")
    assert place.service.faults == []
    site.expect("err", r"oxxHttpServer::ProcessReply : unable to parse relpy\.", times=place.counts["broken answers"])
    assert len(site.access()) == place.counts["requests"]
    assert after[1:] == before[1:] and after[2] == server.threads
    if not SANITIZER:
        assert after[0] - before[0] < 1024
    check_users(place, workers)
    server.stop()
    site.serve()
    check_users(place, workers)


def test_a_crowd_of_scripts(place):
    crowd(place, 1, lambda worker, _: worker.rounds < 2)


@pytest.mark.soak
def test_a_crowd_of_scripts_for_a_minute(place):
    crowd(place, 6, lambda _, elapsed: elapsed < 60)
