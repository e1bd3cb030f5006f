"""Compares ox_remote with other web servers under load; started by tools/bench, which installs and builds.

scenarios.py says what is asked for, servers.py who is asked, load.py how, usage.py what it costs them, report.py
prints.

For each scenario and number of clients every server is measured once a round, one at a time while the others are idle,
and the order rotates from round to round, so that a slow moment of the machine falls on everybody alike. The figures
never make the exit status: it is 1 only when something could not be measured.
"""

import argparse
import contextlib
import os
import resource
import shutil
import sys
import tempfile
import time
from pathlib import Path

import load
import profiling
import report
import usage
from scenarios import SCENARIOS, Scenario
from servers import OPEN_FILES, SERVERS, OxRemote, Server, ServerError

CLIENTS = [1, 16, 64, 256]
SETTLE_SECONDS = 0.3  # between two measurements, for the ends of cut connections


def measure(server: Server, scenario: Scenario, clients: int, seconds: int) -> dict:
    server.check_alive()
    cpu, (busy, idle) = usage.cpu_seconds(server.session), usage.machine_seconds()
    with usage.MemoryWatch(server.session) as memory:
        result = load.run(server.url(scenario.path), scenario.size, clients, seconds, scenario.ab_options)
    cpu = usage.cpu_seconds(server.session) - cpu
    busy, idle = (after - before for after, before in zip(usage.machine_seconds(), (busy, idle)))
    server.check_alive()
    machine = max(busy + idle, 0.001)
    generators = min(clients, os.cpu_count() or 1)
    return {
        "requests_per_second": result.rate,
        "p50_ms": result.p50,
        "p99_ms": result.p99,
        "good": result.good,
        "failed": result.failed,
        "failures": result.failures,
        # By bytes: requests that the end of the run cut cost time too.
        "server_cpu_us_per_request": 1e6 * cpu / max(result.bytes / scenario.size, 1),
        "server_cpu_share": cpu / machine,
        "generator_cpu_share": result.cpu / machine,
        "other_share": max(0.0, (busy - cpu - result.cpu) / machine),
        "idle_share": idle / machine,
        "generator_bound": result.cpu > 0.95 * generators * machine / (os.cpu_count() or 1),
        "peak_memory_bytes": memory.peak,
    }


def run_cell(servers: list[Server], scenario: Scenario, clients: int, options: argparse.Namespace, turn: int) -> dict:
    """All rounds of one scenario and number of clients, by server name."""
    rounds: dict[str, list[dict]] = {server.name: [] for server in servers}
    errors: dict[str, str] = {}
    for number in range(options.rounds):
        first = (number + turn) % len(servers)
        for server in servers[first:] + servers[:first]:
            if server.name in errors:
                continue
            try:
                rounds[server.name].append(measure(server, scenario, clients, options.seconds * scenario.stretch))
            except (load.LoadError, ServerError) as error:
                errors[server.name] = str(error)
            time.sleep(SETTLE_SECONDS)
    cells = {}
    for server in servers:
        if server.name in errors:
            cells[server.name] = {"error": errors[server.name]}
        else:
            cells[server.name] = report.summary(rounds[server.name]) | {
                "generator_bound": any(entry["generator_bound"] for entry in rounds[server.name]),
                "rounds": rounds[server.name]}
    return cells


def compare(servers: list[Server], scenarios: list[Scenario], options: argparse.Namespace) -> bool:
    """Prints every cell; false when one could not be measured."""
    measured = True
    results = []
    machine = report.machine()
    print(f"{machine['processors']} processors ({machine['model']}), Linux {machine['kernel']}; "
          f"{options.rounds} round(s) of {options.seconds} s")
    print("; ".join(server.version() for server in servers))
    report.print_legend()
    for scenario in scenarios:
        able = [server for server in servers if scenario.serves(server.name)]
        for server in able:
            load.check(server.url(scenario.path), scenario.size, scenario.ab_options)
        for turn, clients in enumerate(options.clients):
            cells = run_cell(able, scenario, clients, options, turn)
            report.print_cell(scenario.title, clients, cells)
            measured = measured and not any("error" in cell for cell in cells.values())
            results.append({"scenario": scenario.name, "clients": clients, "servers": cells})
    if options.json:
        parameters = {"rounds": options.rounds, "seconds": options.seconds, "generator": "ab, HTTP/1.0, no keep-alive"}
        report.write_json(options.json, servers, parameters, results)
    for server in servers:
        server.stop()
        good = sum(result["servers"].get(server.name, {}).get("requests", 0) for result in results)
        lines = server.logged_lines()
        if lines < good:
            print(f"{server.name} logged {lines} lines for {good} answered requests: its figures are not fair")
            measured = False
    return measured


def parse_arguments() -> argparse.Namespace:
    def numbers(text: str) -> list[int]:
        values = [int(part) for part in text.split(",")]
        if min(values) < 1:
            raise ValueError
        return values

    def names(known: list[str]):
        def parse(text: str) -> list[str]:
            for name in (parts := text.split(",")):
                if name not in known:
                    raise argparse.ArgumentTypeError(f"{name} is none of {', '.join(known)}")
            return parts
        return parse

    parser = argparse.ArgumentParser(prog="tools/bench", formatter_class=argparse.ArgumentDefaultsHelpFormatter,
                                     description="Measures ox_remote against nginx, lighttpd and Apache.")
    parser.add_argument("--rounds", type=int, default=3, help="times that every cell is measured")
    parser.add_argument("--seconds", type=int, default=3, help="of a measurement (slow scenarios take a multiple)")
    parser.add_argument("--quick", action="store_true", help="one round of one second")
    parser.add_argument("--clients", type=numbers, default=CLIENTS, help="numbers of clients, comma between")
    known = [scenario.name for scenario in SCENARIOS]
    parser.add_argument("--scenarios", type=names(known), default=known, help="which, comma between")
    known = [server.name for server in SERVERS]
    parser.add_argument("--servers", type=names(known), default=known, help="which, comma between")
    parser.add_argument("--json", type=Path, metavar="FILE", help="write everything measured there")
    parser.add_argument("--profile", action="store_true", help="show where ox_remote's time goes instead")
    parser.add_argument("--binary", type=Path, help="the ox_remote to measure instead of building one")
    parser.add_argument("--keep", action="store_true", help="leave the scratch folder")
    options = parser.parse_args()
    if options.quick:
        options.rounds, options.seconds = 1, 1
    if options.rounds < 1 or options.seconds < 1:
        parser.error("--rounds and --seconds must be at least 1")
    if options.profile:
        options.servers = [OxRemote.name]
    if OxRemote.name in options.servers and not (options.binary and os.access(options.binary, os.X_OK)):
        parser.error(f"no executable ox_remote at {options.binary}")
    return options


def raise_open_files() -> None:
    soft, hard = resource.getrlimit(resource.RLIMIT_NOFILE)
    wanted = OPEN_FILES if hard == resource.RLIM_INFINITY else min(OPEN_FILES, hard)
    if soft < wanted:
        resource.setrlimit(resource.RLIMIT_NOFILE, (wanted, hard))


def run(options: argparse.Namespace, scratch: Path) -> bool:
    root = scratch / OxRemote.name / "wwwroot"
    root.mkdir(parents=True)
    # Servers that drop root must reach the files.
    scratch.chmod(0o755)
    scenarios = [scenario for scenario in SCENARIOS if scenario.name in options.scenarios]
    for scenario in SCENARIOS[:1] if options.profile else scenarios:
        scenario.prepare(scenario, root)
    OxRemote.binary = options.binary
    servers = [kind(scratch / kind.name, root) for kind in SERVERS if kind.name in options.servers]
    with contextlib.ExitStack() as running:
        for server in servers:
            running.callback(server.stop)
            server.start("\n".join(scenario.extra_config.get(server.name, "") for scenario in scenarios))
        if options.profile:
            profiling.profile(servers[0], SCENARIOS[0])
            return True
        return compare(servers, scenarios, options)


def main() -> int:
    os.umask(0o022)
    sys.stdout.reconfigure(line_buffering=True)
    options = parse_arguments()
    raise_open_files()
    scratch = Path(tempfile.mkdtemp(prefix="ox_bench."))
    try:
        return 0 if run(options, scratch) else 1
    except (load.LoadError, ServerError, OSError) as error:
        print(f"tools/bench: could not measure: {error}", file=sys.stderr)
        return 1
    except KeyboardInterrupt:
        return 130
    finally:
        if options.keep:
            print(f"scratch folder: {scratch}")
        else:
            shutil.rmtree(scratch, ignore_errors=True)


if __name__ == "__main__":
    sys.exit(main())
