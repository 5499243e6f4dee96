"""bench/run: runs one update of the real updater on a unit that a scenario describes, with its log and its panel."""

import argparse
import io
import math
import os
import signal
import sys
from pathlib import Path

from bench import scenario
from bench.build import BUILD, build
from bench.command import status_of
from bench.compare import differences
from bench.interactive import Watch, play
from bench.show.text import PlainDisplay, Summary, print_summary, terminal
from bench.show.page import page, write_page
from bench.runner import KINDS, UnitMaker, run_on, temporary_folder
from bench.run_all import run_all
from bench.unit import PROGRAMS


def run(maker: UnitMaker, what: scenario.Scenario, page_file: Path | None) -> int:
    """Runs the scenario `what`, shows it and writes the page `page_file`. Returns the status of the command."""
    with temporary_folder() as folder:
        unit = maker.make(what, folder)
        print(f"{what.name}: {what.summary}\nUnit: {unit.name}\n", flush=True)
        shown: Watch | PlainDisplay = Watch(unit, what, maker.speed) if terminal() else PlainDisplay()
        with shown as display:
            result = run_on(unit, display.show, maker.speed)
    summary = Summary(what, unit.name, result, differences(what, result))
    print_summary(summary)
    if page_file:
        write_page(page_file, page(summary, maker.speed, maker.build))
        print(f"Page: {page_file}")
    return 1 if summary.wrong else 0


def play_with(maker: UnitMaker, what: scenario.Scenario) -> int:
    """Lets the user play with the scenario's unit. Returns the status of the command."""
    with temporary_folder() as folder:
        lines = play(maker.make(what, folder), what, maker.speed)
    print("\n".join(lines))
    return 0


def writable(file: Path) -> bool:
    """Whether `file` can be written, or made."""
    if os.path.exists(file):
        return not os.path.isdir(file) and os.access(file, os.W_OK)
    return os.path.isdir(file.parent) and os.access(file.parent, os.W_OK)


def arguments() -> argparse.Namespace:
    """The command line."""
    parser = argparse.ArgumentParser(prog="bench/run", description=__doc__)
    which = parser.add_mutually_exclusive_group()
    which.add_argument("scenario", nargs="?", default="package-and-board", help="default: %(default)s")
    which.add_argument("--list", action="store_true", help="show all scenarios")
    which.add_argument("--all", action="store_true", help="run all scenarios and show a table")
    parser.add_argument("--interactive", action="store_true", help="play with the unit while the updater runs on it")
    parser.add_argument(
        "--jobs", type=int, default=os.cpu_count(), metavar="N", help="with --all: N at a time (default: %(default)s)"
    )
    parser.add_argument(
        "--unit",
        choices=KINDS,
        default="best",
        help="the real tools or stand-ins for all of them (default: the real ones where this machine allows it)",
    )
    parser.add_argument(
        "--speed",
        type=float,
        default=300,
        metavar="N",
        help="shorten the updater's waits N times (default: %(default)s)",
    )
    parser.add_argument(
        "--build",
        type=Path,
        metavar="FOLDER",
        help="use the build in FOLDER as it is (default: build/default, built first)",
    )
    parser.add_argument("--full-length", action="store_true", help="keep every wait: up to 14 minutes")
    parser.add_argument(
        "--record",
        type=Path,
        metavar="FILE",
        help="write the run as an HTML page with its timeline; with --all, a page for each scenario and an index into "
        "the folder FILE",
    )
    given = parser.parse_args()
    if not 1 <= given.speed < math.inf:
        parser.error("--speed: must be a number, 1 or more")
    if given.build and not os.path.isfile(given.build / PROGRAMS["remote"]):
        parser.error(f"--build: {given.build} holds no {PROGRAMS['remote']}: build it there or leave --build out")
    if given.record and given.all:
        try:
            given.record.mkdir(parents=True, exist_ok=True)
        except OSError as error:
            parser.error(f"--record: {given.record} cannot be a folder: {error.strerror}")
    elif given.record and not writable(given.record):
        parser.error(f"--record: {given.record} cannot be written")
    if given.interactive and (given.all or given.list or given.record):
        parser.error("--interactive: not together with --all, --list or --record")
    if given.interactive and not (sys.stdin.isatty() and sys.stdout.isatty()):
        parser.error("--interactive: needs a terminal for input and output")
    if given.jobs < 1:
        parser.error("--jobs: must be 1 or more")
    if given.full_length:
        given.speed = 1
    return given


def main() -> int:
    """The command."""
    given = arguments()
    if isinstance(sys.stdout, io.TextIOWrapper):
        sys.stdout.reconfigure(errors="replace")
    for number in (signal.SIGTERM, signal.SIGHUP):
        signal.signal(number, lambda number, _: sys.exit(128 + number))
    return status_of(lambda: show(given))


def show(given: argparse.Namespace) -> int:
    """Lists or runs what the command line asks for. Returns the status."""
    if given.list:
        for name in scenario.names():
            print(f"{name:38}  {scenario.load(name).summary}")
        return 0
    wanted = [scenario.load(name) for name in (scenario.names() if given.all else [given.scenario])]
    if not given.build:
        build(*(["harl-updater-tool"] if given.record else []))
    maker = UnitMaker(given.unit, given.speed, (given.build or BUILD).resolve())
    if given.all:
        return 0 if run_all(maker, wanted, given.jobs, given.record) else 1
    if given.interactive:
        return play_with(maker, wanted[0])
    return run(maker, wanted[0], given.record)


sys.exit(main())
