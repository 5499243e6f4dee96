"""Runs many scenarios side by side and shows how each came out."""

import threading
import time
from concurrent.futures import ThreadPoolExecutor, as_completed
from dataclasses import dataclass

from compare import differences
from scenario import Scenario
from session import Result, UnitMaker, run_on, temporary_folder
from unit import UnitError


@dataclass
class Outcome:
    """How one scenario came out."""

    scenario: Scenario
    unit: str  # what kind of unit it ran on
    result: Result | None
    seconds: float  # with set-up
    wrong: list[str]


def run_one(maker: UnitMaker, what: Scenario, stop: threading.Event) -> Outcome:
    """Runs the scenario `what` and shows nothing. Ends early, with a UnitError, when `stop` is set."""
    begin = time.monotonic()

    def check(*_: object) -> None:
        if stop.is_set():
            raise UnitError("stopped")

    result = None
    with temporary_folder() as folder:
        unit = maker.make(what, folder)
        try:
            check()
            result = run_on(unit, check, maker.speed)
            wrong = differences(what, result)
        except UnitError as error:
            wrong = [str(error)]
    return Outcome(what, unit.kind, result, time.monotonic() - begin, wrong)


def run_all(maker: UnitMaker, scenarios: list[Scenario], at_once: int) -> bool:
    """Runs `scenarios`, `at_once` at a time, and prints a table. True when all came out as they say."""
    stop = threading.Event()
    begin = time.monotonic()
    failed = 0
    print(f"{'scenario':38} {'unit':9} {'time':>7}  result")
    with ThreadPoolExecutor(at_once) as workers:
        try:
            # The longest first: none of them is left to run alone at the end.
            waiting = sorted(scenarios, key=lambda what: what.unit["board"]["link"] not in ("dies", "lost"))
            for done in as_completed([workers.submit(run_one, maker, what, stop) for what in waiting]):
                outcome = done.result()
                failed += bool(outcome.wrong)
                text = "DIFFERENT" if outcome.wrong else "as it says"
                print(f"{outcome.scenario.name:38} {outcome.unit:9} {outcome.seconds:5.1f} s  {text}")
                for line in outcome.wrong:
                    print(f"    {line}")
                print(end="", flush=True)
        finally:
            stop.set()
    print(f"{len(scenarios)} scenarios, {failed} different, {time.monotonic() - begin:.0f} s")
    return not failed
