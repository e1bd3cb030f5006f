"""A random walk: requests of every kind, good and hostile, whose answers the oracle knows byte for byte.

Four walkers go at once. Each has users, profiles and throw-away names of its own, so that it knows what it may expect
whatever the others do. While they walk, scripts change their users and profiles. Whatever the oracle says, nobody may
see a byte of a profile that is not his, and nobody at all a byte of what is not to be served.

The walk is the same for the same seed. These variables set it and the number of requests:

    OX_WALK_SEED=1234 OX_WALK_REQUESTS=20000 pytest test_walk.py

The long walk runs with the other soak tests (OX_SOAK=1).
"""

import collections
import os
import re
import time

import pytest

import oracle
from engines import output_files
from harness import SANITIZER, Background, descriptors, resident_kib, thread_count
from walkers import Place, Walker

DEFAULT_SEED = 20261120  # one walk for everybody; another number is another walk
WALKERS = 4
REQUESTS = 3_000
SOAK_REQUESTS = 100_000

# Every kind of answer comes up; a walk that misses one is no good walk.
KINDS = ["page", "304", "nothing", "400", "401", "403", "404", "413", "locked out", "script", "empty script", "500"]


def from_environment(name, default):
    return int(os.environ.get(name, default))


def walk(site, requests, patient=False):
    """All walkers to their ends, and the logs against what was answered."""
    seed = from_environment("OX_WALK_SEED", DEFAULT_SEED)
    requests = from_environment("OX_WALK_REQUESTS", requests)
    place = Place(site, seed)
    walkers = [Walker(place, number, requests // WALKERS, patient) for number in range(WALKERS)]
    place.start()
    server, started, warm = place.server, time.monotonic(), None
    files = len(descriptors(server.pid))
    load = Background(lambda number: walkers[number].walk(), WALKERS)
    while not load.errors and any(thread.is_alive() for thread in load.threads):
        time.sleep(0.02)
        if warm is None and sum(walker.made for walker in walkers) > requests // 3:
            warm = resident_kib(server.pid)
    load.join(timeout=3_600)
    elapsed = time.monotonic() - started
    kinds = sum((walker.kinds for walker in walkers), collections.Counter())
    server.wait_idle()
    site.get("/hello.htm")  # the next connection is what sweeps the last sessions
    server.wait_idle()
    grown = resident_kib(server.pid) - warm if warm else 0
    print(
        f"\nOX_WALK_SEED={seed}: {sum(walker.made for walker in walkers)} requests in {elapsed:.1f} s, "
        f"RSS {grown:+d} KiB since the first third\n{dict(kinds.most_common())}"
    )
    assert len(descriptors(server.pid)) == files
    assert thread_count(server.pid) == server.threads
    return place, walkers, kinds, grown


def check_logs(place, walkers, kinds):
    """Each answer has its line in the access log, with its user, its URL, its status and its bytes. The message log
    says which names were locked out and how often a directory was asked for, and nothing else."""
    site = place.site
    wanted = sum((walker.access for walker in walkers), collections.Counter())
    size = (site.web / "hello.htm").stat().st_size
    wanted["-", "GET /hello.htm HTTP/1.0", "200", str(size)] += 1  # the one behind the walk
    found = collections.Counter()
    for line in site.access():
        match = re.fullmatch(r'127\.0\.0\.1 - (.+) \[[^\[\]]*\] "([^"]*)" (\d{3}) (\d+)', line)
        assert match, line
        refused = match[3] in ("400", "413")
        found[match.group(3, 4) if refused else match.groups()] += 1
    assert found - wanted == collections.Counter() and wanted - found == collections.Counter()
    locked = sum((walker.locked_names for walker in walkers), collections.Counter())
    lines = collections.Counter(site.err())
    form = "User {} locked out for 1 minutes. Too many failed logins."
    wanted = {form.format(oracle.log_text(name)): times for name, times in locked.items()}
    assert {line: times for line, times in lines.items() if line.endswith("failed logins.")} == wanted
    assert sum(times for line, times in lines.items() if line.startswith("Reply error")) == kinds["nothing"]
    outputs = sorted(number for walker in walkers for number in walker.outputs)
    assert len(set(outputs)) == len(outputs), "two scripts wrote to one file"
    assert output_files(site) == []


def test_a_random_walk(site):
    place, walkers, kinds, _ = walk(site, REQUESTS)
    check_logs(place, walkers, kinds)
    if "OX_WALK_REQUESTS" not in os.environ:
        assert [kind for kind in KINDS if kinds[kind] == 0] == []


@pytest.mark.soak
def test_a_long_random_walk(site):
    place, walkers, kinds, grown = walk(site, SOAK_REQUESTS, patient=True)
    check_logs(place, walkers, kinds)
    assert [kind for kind in KINDS if kinds[kind] == 0] == []
    if not SANITIZER:
        assert grown < 4_096
