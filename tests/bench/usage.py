"""Processor time and memory of all processes of a server, from /proc.

A server's processes are those of its session: each server is started as the leader of a session of its own.
"""

import os
import threading

TICK = os.sysconf("SC_CLK_TCK")


def _stat(pid: str) -> list[str] | None:
    try:
        with open(f"/proc/{pid}/stat", encoding="latin-1") as file:
            return file.read().rpartition(")")[2].split()
    except (FileNotFoundError, ProcessLookupError):
        return None


def _members(session: int) -> list[tuple[int, list[str]]]:
    members = []
    for name in os.listdir("/proc"):
        if name.isdigit() and (fields := _stat(name)) and int(fields[3]) == session:
            members.append((int(name), fields))
    return members


def cpu_seconds(session: int) -> float:
    """User and system time of the processes, with that of ended ones (their parents inherit it)."""
    return sum(sum(int(ticks) for ticks in fields[11:15]) for _, fields in _members(session)) / TICK


def memory_bytes(session: int) -> int:
    """Resident memory; a page that several processes share counts once (the sum of their proportional shares)."""
    total = 0
    for pid, _ in _members(session):
        try:
            with open(f"/proc/{pid}/smaps_rollup", encoding="ascii") as file:
                total += next(int(line.split()[1]) for line in file if line.startswith("Pss:")) * 1024
        except (FileNotFoundError, ProcessLookupError, StopIteration):
            continue
    return total


def machine_seconds() -> tuple[float, float]:
    """Busy and idle time of all processors since boot."""
    with open("/proc/stat", encoding="ascii") as file:
        ticks = [int(text) for text in file.readline().split()[1:9]]
    idle = ticks[3] + ticks[4]
    return (sum(ticks) - idle) / TICK, idle / TICK


class MemoryWatch:
    """Takes the highest of memory_bytes, looked at a few times a second, between enter and exit."""

    INTERVAL = 0.25

    def __init__(self, session: int):
        self.peak = 0
        self._session = session
        self._done = threading.Event()
        self._thread = threading.Thread(target=self._watch)

    def __enter__(self) -> "MemoryWatch":
        self._thread.start()
        return self

    def __exit__(self, *_) -> None:
        self._done.set()
        self._thread.join()

    def _watch(self) -> None:
        while True:
            self.peak = max(self.peak, memory_bytes(self._session))
            if self._done.wait(self.INTERVAL):
                return
