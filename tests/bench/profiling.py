"""Where the time of ox_remote goes under load: perf where it works, and the system calls by strace."""

import re
import shutil
import subprocess
import tempfile
from pathlib import Path

import load
from scenarios import Scenario
from servers import OxRemote

SECONDS = 8
STRACE_SECONDS = 3
CLIENTS = 64
LINES = 45


def _perf_scope(server: OxRemote) -> list[str] | None:
    """What perf may record; None when it does not work here."""
    if not shutil.which("perf"):
        return None
    # The whole machine rather than the process: perf's own work for each new thread of a process it follows would show
    # up large.
    for scope in (["-a"], ["-p", str(server.session)]):
        probe = ["perf", "record", "-q", "-o", str(server.folder / "probe.data"), *scope, "--", "true"]
        if subprocess.run(probe, stdin=subprocess.DEVNULL, capture_output=True, check=False).returncode == 0:
            return scope
    return None


def _under(tracer: list[str], server: OxRemote, scenario: Scenario, seconds: int) -> load.Load:
    """Runs the load while a tracer, which ends with SIGINT, is attached to the server."""
    with tempfile.TemporaryFile() as messages:
        attached = subprocess.Popen(tracer, stdin=subprocess.DEVNULL, stdout=messages, stderr=messages)
        try:
            result = load.run(server.url(scenario.path), scenario.size, CLIENTS, seconds, scenario.ab_options)
        finally:
            attached.send_signal(2)
            attached.wait()
    return result


def _report(data: Path, key: str, *options: str) -> list[str]:
    command = ["perf", "report", "--stdio", "-q", "-i", str(data), "--sort", key, "-g", "none", *options]
    command += ["--percent-limit", "0.3"]
    done = subprocess.run(command, stdin=subprocess.DEVNULL, capture_output=True, text=True, check=False)
    lines = [re.sub(r"[ -]+$", "", line) for line in done.stdout.splitlines()]
    return [line for line in lines if line and not line.startswith("#")] or [done.stderr.strip()]


def _print_perf(data: Path) -> None:
    # Without the program among the sort keys the filter would let in what others did in the same functions.
    own = ["--comm", OxRemote.name, "--percentage", "relative"]
    print("\nBy program (swapper is idle time):")
    print("\n".join(_report(data, "comm", "--no-children")))
    print("\nThe server, by part:")
    print("\n".join(_report(data, "comm,dso", "--no-children", *own)))
    print("\nThe server, by what the kernel was asked for (with all that follows from it):")
    entry = re.compile(r"^ +([\d.]+)% .*\] (?:__x64_sys_|__do_sys_|ksys_|do_(?=writev$)|asm_exc_(?=page_fault$))(\w+)$")
    shares: dict[str, float] = {}
    for line in _report(data, "comm,symbol", "--children", *own):
        if found := entry.match(line):
            shares[found[2]] = max(float(found[1]), shares.get(found[2], 0))
    for name, share in sorted(shares.items(), key=lambda item: -item[1]):
        print(f"{share:>9.2f}%  {name}")
    print("\nThe server, by function:")
    print("\n".join(_report(data, "comm,dso,symbol", "--no-children", *own)[:LINES]))


def profile(server: OxRemote, scenario: Scenario) -> None:
    print(f"{scenario.title}, {CLIENTS} clients, a new connection per request")
    plain = load.run(server.url(scenario.path), scenario.size, CLIENTS, STRACE_SECONDS, scenario.ab_options)
    print(f"without a tracer: {plain.rate:.0f} requests/s, p50 {plain.p50:.2f} ms, p99 {plain.p99:.2f} ms, "
          f"{plain.failed} failed")
    if scope := _perf_scope(server):
        data = server.folder / "perf.data"
        result = _under(["perf", "record", "-q", "-F", "997", "-g", *scope, "-o", str(data)], server, scenario, SECONDS)
        print(f"under perf: {result.rate:.0f} requests/s, {result.failed} failed")
        _print_perf(data)
    else:
        print("perf does not work here; the system calls alone follow.")
    counts = server.folder / "strace.txt"
    result = _under(["strace", "-c", "-f", "-q", "-o", str(counts), "-p", str(server.session)], server, scenario,
                    STRACE_SECONDS)
    print(f"\nSystem calls, under strace at {result.rate:.0f} requests/s (most of the time is the tracer's):")
    print(f"{'% time':>7}{'us/call':>9}{'calls':>10}{'per request':>13}{'errors':>8}  call")
    row = re.compile(r"^ *([\d.]+) +[\d.]+ +(\d+) +(\d+) +(\d*) *(\w+)$")
    for line in counts.read_text().splitlines():
        if (found := row.match(line)) and found[5] != "total":
            share, each, calls, errors, name = found.groups()
            print(f"{share:>7}{each:>9}{calls:>10}{int(calls) / max(result.good, 1):>13.2f}{errors or 0:>8}  {name}")
