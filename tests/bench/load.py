"""The load generator: `ab`, as many processes of it as there are processors, the clients shared out among them.

Why ab: it opens a connection per request, its times begin before the connect, and it takes the end of the connection
as the end of a body without Content-Length, which is how ox_remote ends its replies. (wrk counts a read error for every
such reply and its times leave the connect out.) One process of it is slower than the fastest server; hence several.
"""

import bisect
import os
import re
import subprocess
import tempfile
from dataclasses import dataclass
from pathlib import Path

MAX_RATE = 200_000  # requests a second that one ab has room to record
SOCKET_TIMEOUT = 30  # seconds


class LoadError(Exception):
    """The generator could not measure."""


@dataclass(frozen=True)
class Load:
    rate: float  # good requests a second
    good: int
    failed: int
    bytes: int  # of bodies, those of requests that the end of the run cut included
    p50: float  # milliseconds
    p99: float
    cpu: float  # seconds of processor time of the generator
    failures: list[str]  # what kinds, in ab's words


@dataclass(frozen=True)
class _Part:
    seconds: float
    complete: int
    failed: int
    bytes: int
    times: list[float]  # milliseconds at 0, 1, ... 100 per cent
    failures: list[str]


def check(url: str, size: int, options: list[str]) -> None:
    """One request as it will be measured; raises LoadError when the answer is not the wanted one."""
    with tempfile.TemporaryDirectory() as folder:
        name = Path(folder) / "0"
        part = _read(_start(url, ["-n", "1", *options], name).wait(), name, size)
        if part.failed:
            raise LoadError(f"{url}: " + ", ".join(part.failures))


def run(url: str, size: int, clients: int, seconds: int, options: list[str]) -> Load:
    count = min(clients, os.cpu_count() or 1)
    shares = [clients // count + (1 if i < clients % count else 0) for i in range(count)]
    with tempfile.TemporaryDirectory() as folder:
        limits = ["-t", str(seconds), "-n", str(MAX_RATE * seconds)]
        running = [_start(url, [*limits, "-c", str(share), *options], Path(folder) / str(i))
                   for i, share in enumerate(shares)]
        cpu = 0.0
        for process in running:
            _, status, used = os.wait4(process.pid, 0)
            process.returncode = os.waitstatus_to_exitcode(status)
            cpu += used.ru_utime + used.ru_stime
        parts = [_read(process.returncode, Path(folder) / str(i), size) for i, process in enumerate(running)]
    good = sum(part.complete - part.failed for part in parts)
    return Load(
        rate=sum((part.complete - part.failed) / part.seconds for part in parts),
        good=good,
        failed=sum(part.failed for part in parts),
        bytes=sum(part.bytes for part in parts),
        p50=_percentile(parts, 50),
        p99=_percentile(parts, 99),
        cpu=cpu,
        failures=[text for part in parts for text in part.failures],
    )


def _start(url: str, options: list[str], name: Path) -> subprocess.Popen:
    command = ["ab", "-q", "-r", "-s", str(SOCKET_TIMEOUT), "-e", f"{name}.csv", *options, url]
    with open(f"{name}.out", "wb") as output:
        return subprocess.Popen(command, stdin=subprocess.DEVNULL, stdout=output, stderr=subprocess.STDOUT)


def _read(status: int, name: Path, size: int) -> _Part:
    text = Path(f"{name}.out").read_text(encoding="latin-1")

    def number(label: str, default: float | None = None) -> float:
        found = re.search(rf"^{label}:\s+([\d.]+)", text, re.MULTILINE)
        if found:
            return float(found[1])
        if default is None:
            raise LoadError("ab gave no result: " + " / ".join(text.strip().splitlines()[-3:]))
        return default

    if status != 0:
        raise LoadError(f"ab ended with {status}: " + " / ".join(text.strip().splitlines()[-3:]))
    complete = int(number("Complete requests"))
    if complete == 0:
        raise LoadError("not one request was answered in time; more --seconds are needed")
    failures = re.findall(r"^ +\((Connect: .*)\)", text, re.MULTILINE)
    failures += re.findall(r"^((?:Non-2xx responses|Write errors): +\d+)", text, re.MULTILINE)
    failed = int(number("Failed requests") + number("Non-2xx responses", 0) + number("Write errors", 0))
    length = int(number("Document Length"))
    if length != size:  # that of ab's first reply, which it holds the others against
        failures.append(f"body of {length} bytes instead of {size}")
        failed = complete
    rows = Path(f"{name}.csv").read_text(encoding="ascii").splitlines()[1:]
    times = [float(row.split(",")[1]) for row in rows]
    failed = min(failed, complete)  # ab may count one broken request under two kinds
    return _Part(number("Time taken for tests"), complete, failed, int(number("HTML transferred")), times, failures)


def _percentile(parts: list[_Part], percent: float) -> float:
    """The time within which so many per cent of all parts' requests were served."""
    if len(parts) == 1:
        return parts[0].times[int(percent)]
    low, high = min(part.times[0] for part in parts), max(part.times[-1] for part in parts)
    wanted = percent / 100 * sum(part.complete for part in parts)
    for _ in range(50):
        middle = (low + high) / 2
        if sum(part.complete * _share(part.times, middle) for part in parts) < wanted:
            low = middle
        else:
            high = middle
    return high


def _share(times: list[float], limit: float) -> float:
    """The share of requests served within the limit, straight between the whole per cents."""
    above = bisect.bisect_right(times, limit)
    if above == 0:
        return 0.0
    if above == len(times):
        return 1.0
    return (above - 1 + (limit - times[above - 1]) / (times[above] - times[above - 1])) / (len(times) - 1)
