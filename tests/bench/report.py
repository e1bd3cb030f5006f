"""What is printed, and the JSON."""

import json
import os
import platform
from pathlib import Path
from statistics import median

from servers import Server

MB = 1024 * 1024
SUBJECT = "ox_remote"
BUSY_SHARE = 0.15  # other programs took so much that the figures say little


def summary(rounds: list[dict]) -> dict:
    """One cell of one server over its rounds: medians, but the sum of failures and the highest memory."""
    cell = {key: median(entry[key] for entry in rounds) for key in
            ("requests_per_second", "p50_ms", "p99_ms", "server_cpu_us_per_request", "server_cpu_share",
             "generator_cpu_share", "other_share", "idle_share")}
    cell["failed"] = sum(entry["failed"] for entry in rounds)
    cell["requests"] = sum(entry["good"] for entry in rounds)
    cell["peak_memory_bytes"] = max(entry["peak_memory_bytes"] for entry in rounds)
    cell["failures"] = sorted({text for entry in rounds for text in entry["failures"]})
    return cell


def ratios(subject: dict, other: dict) -> dict:
    keys = ("requests_per_second", "p50_ms", "p99_ms", "server_cpu_us_per_request", "peak_memory_bytes")
    return {key: subject[key] / other[key] if other[key] else None for key in keys}


def print_legend() -> None:
    print("""\
req/s, p50, p99: medians over the rounds. CPU/req: user and system time of all the server's processes. memory: the
highest sum of proportional shares of resident memory. srv, gen, other, idle: shares of the whole machine's processor
time that the server took, that the load generator took, that kernel threads and other programs took, and that nobody
wanted. The kernel's loopback work is booked to whichever side it interrupts. Without idle time the generator's share is
part of what limits the rate, for every server alike.""")


def _remarks(cell: dict) -> str:
    """What makes the figures of a cell doubtful."""
    remarks = "  generator at its limit" if cell["generator_bound"] else ""
    if cell["other_share"] > BUSY_SHARE:
        remarks += "  machine busy elsewhere"
    return remarks


def print_cell(title: str, clients: int, cells: dict[str, dict]) -> None:
    print(f"\n{title}, {clients} client{'s' if clients > 1 else ''}")
    print(f"  {'':<10}{'req/s':>10}{'p50 ms':>10}{'p99 ms':>10}{'failed':>8}{'CPU/req us':>12}{'memory MB':>11}"
          f"{'srv %':>8}{'gen %':>7}{'other %':>9}{'idle %':>8}")
    for name, cell in cells.items():
        if "error" in cell:
            print(f"  {name:<10} not measured: {cell['error']}")
            continue
        print(f"  {name:<10}{cell['requests_per_second']:>10.1f}{cell['p50_ms']:>10.2f}{cell['p99_ms']:>10.2f}"
              f"{cell['failed']:>8}{cell['server_cpu_us_per_request']:>12.1f}{cell['peak_memory_bytes'] / MB:>11.1f}"
              f"{100 * cell['server_cpu_share']:>8.0f}{100 * cell['generator_cpu_share']:>7.0f}"
              f"{100 * cell['other_share']:>9.0f}{100 * cell['idle_share']:>8.0f}{_remarks(cell)}")
        for text in cell["failures"]:
            print(f"  {'':<10}  failures: {text}")
    subject = cells.get(SUBJECT, {"error": ""})
    for name, cell in cells.items():
        if name != SUBJECT and "error" not in cell and "error" not in subject:
            of = {key: "-" if value is None else f"{value:.2f}" for key, value in ratios(subject, cell).items()}
            print(f"  {SUBJECT} / {name + ':':<10} req/s {of['requests_per_second']}, p50 {of['p50_ms']}, "
                  f"p99 {of['p99_ms']}, CPU/req {of['server_cpu_us_per_request']}, memory {of['peak_memory_bytes']}")


def machine() -> dict:
    model = next((line.split(":", 1)[1].strip() for line in Path("/proc/cpuinfo").read_text().splitlines()
                  if line.startswith("model name")), platform.machine())
    return {"processors": os.cpu_count(), "model": model, "kernel": platform.release()}


def write_json(path: Path, servers: list[Server], parameters: dict, results: list[dict]) -> None:
    document = {"machine": machine(), "versions": {server.name: server.version() for server in servers},
                "parameters": parameters, "results": results}
    path.write_text(json.dumps(document, indent=1) + "\n")
