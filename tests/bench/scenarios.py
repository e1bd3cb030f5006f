"""What is asked of the servers. A new scenario is one more entry of SCENARIOS."""

from collections.abc import Callable
from dataclasses import dataclass, field
from pathlib import Path

KB = 1024
MB = 1024 * KB


@dataclass(frozen=True)
class Scenario:
    name: str
    title: str
    path: str  # of the URL
    size: int  # bytes of a good reply's body; every other length counts as a failure
    prepare: Callable[["Scenario", Path], None]  # fills the web root that all servers share
    stretch: int = 1  # times the seconds of a cell: slow replies need longer runs for the same number of requests
    ab_options: list[str] = field(default_factory=list)  # say, ["-A", "user:password"]
    # Lines added to a server's configuration, by the server's name; see Server.configure for where they go.
    extra_config: dict[str, str] = field(default_factory=dict)
    only: frozenset[str] | None = None  # the servers that can answer it; None: all

    def serves(self, server_name: str) -> bool:
        return self.only is None or server_name in self.only


def page(scenario: Scenario, root: Path) -> None:
    """An HTML page of the scenario's size, filled up with text."""
    head = b"<html><head><title>Report</title></head><body>\n"
    tail = b"\n</body></html>\n"
    line = b"<p>The quick brown fox jumps over the lazy dog 0123456789.</p>\n"
    room = scenario.size - len(head) - len(tail)
    body = (line * (room // len(line) + 1))[:room]
    (root / scenario.path.lstrip("/")).write_bytes(head + body + tail)


SCENARIOS = [
    Scenario("1k", "1 KB file", "/1k.html", 1 * KB, page),
    Scenario("100k", "100 KB file", "/100k.html", 100 * KB, page),
    Scenario("10m", "10 MB file", "/10m.html", 10 * MB, page, stretch=2),
]
