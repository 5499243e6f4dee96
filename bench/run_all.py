"""Runs many scenarios side by side and shows how each came out."""

import subprocess
import threading
import time
from concurrent.futures import ThreadPoolExecutor, as_completed
from dataclasses import dataclass

from bench.compare import differences
from bench.runner import NotServed, UnitMaker, run_on, temporary_folder
from bench.scenario import Scenario
from bench.unit import UnitError


@dataclass
class Row:
    """How one scenario came out."""

    scenario: Scenario
    unit: str  # the kind of unit it ran on
    seconds: float  # with set-up
    text: str
    wrong: list[str]


def run_one(maker: UnitMaker, what: Scenario, stop: threading.Event) -> Row:
    """Runs the scenario `what` and shows nothing. Ends early when `stop` is set."""
    begin = time.monotonic()

    def row(kind: str, text: str, wrong: list[str]) -> Row:
        return Row(what, kind, time.monotonic() - begin, text, wrong)

    def check(*_: object) -> None:
        if stop.is_set():
            raise UnitError("stopped")

    with temporary_folder() as folder:
        try:
            check()
            unit = maker.make(what, folder)
            wrong = differences(what, run_on(unit, check, maker.speed))
        except NotServed as error:
            return row("none", f"not run: {error}", [])
        except (UnitError, OSError, subprocess.SubprocessError) as error:
            return row("none", "FAILED", [str(error)])
    return row(unit.kind, "DIFFERENT" if wrong else "as it says", wrong)


def run_all(maker: UnitMaker, scenarios: list[Scenario], at_once: int) -> bool:
    """Runs `scenarios`, `at_once` at a time, and prints a table. True when none came out other than its file says."""
    stop = threading.Event()
    begin = time.monotonic()
    wrong = 0
    # The longest first: none of them is left to run alone at the end.
    order = sorted(scenarios, key=lambda what: what.setup.board.link not in ("dies", "lost"))
    print(f"{'scenario':38} {'unit':8} {'time':>7}  result")
    with ThreadPoolExecutor(at_once) as workers:
        try:
            for done in as_completed([workers.submit(run_one, maker, what, stop) for what in order]):
                row = done.result()
                print(f"{row.scenario.name:38} {row.unit:8} {row.seconds:5.1f} s  {row.text}")
                for line in row.wrong:
                    print(f"    {line}")
                print(end="", flush=True)
                wrong += bool(row.wrong)
        finally:
            stop.set()
    print(f"{len(scenarios)} scenarios, {wrong} wrong, {time.monotonic() - begin:.0f} s")
    return not wrong
