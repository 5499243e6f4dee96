"""Runs many scenarios in parallel, shows the result of each, and writes their pages."""

import subprocess
import threading
import time
from concurrent.futures import ThreadPoolExecutor, as_completed
from dataclasses import dataclass
from pathlib import Path

from bench.compare import differences
from bench.runner import NotServed, UnitMaker, run_on, temporary_folder
from bench.scenario import Scenario
from bench.show.gallery import index
from bench.show.page import page, page_name, write_page
from bench.show.text import Summary
from bench.unit import UnitError


@dataclass
class Row:
    """The result of one scenario."""

    scenario: Scenario
    unit: str  # the kind of unit it ran on
    seconds: float  # with set-up
    text: str
    wrong: list[str]
    summary: Summary | None = None  # of a run


def run_one(maker: UnitMaker, what: Scenario, stop: threading.Event) -> Row:
    """Runs the scenario `what` and shows nothing. Ends early when `stop` is set."""
    begin = time.monotonic()

    def row(kind: str, text: str, wrong: list[str], summary: Summary | None = None) -> Row:
        return Row(what, kind, time.monotonic() - begin, text, wrong, summary)

    def check(*_: object) -> None:
        if stop.is_set():
            raise UnitError("stopped")

    with temporary_folder() as folder:
        try:
            check()
            unit = maker.make(what, folder)
            result = run_on(unit, check, maker.speed)
            summary = Summary(what, unit.name, result, differences(what, result))
        except NotServed as error:
            return row("none", f"not run: {error}", [])
        except (UnitError, OSError, subprocess.SubprocessError) as error:
            return row("none", "FAILED", [str(error)])
    return row(unit.kind, "DIFFERENT" if summary.wrong else "as expected", summary.wrong, summary)


def run_all(maker: UnitMaker, scenarios: list[Scenario], at_once: int, gallery: Path | None) -> bool:
    """Runs `scenarios`, `at_once` at a time, and prints a table. Writes their pages and an index of them into the
    folder `gallery`. True when the result of each is as its file expects."""
    stop = threading.Event()
    begin = time.monotonic()
    rows = []
    # The longest first, so that none of them runs alone at the end.
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
                rows.append(row)
                if gallery and row.summary:
                    write_page(gallery / page_name(row.scenario), page(row.summary, maker.speed, maker.build))
        finally:
            stop.set()
    wrong = sum(bool(row.wrong) for row in rows)
    print(f"{len(scenarios)} scenarios, {wrong} wrong, {time.monotonic() - begin:.0f} s")
    if gallery:
        missing = [(row.scenario.name, " ".join([row.text, *row.wrong])) for row in rows if not row.summary]
        write_page(gallery / "index.html", index([row.summary for row in rows if row.summary], missing))
        print(f"Pages: {gallery / 'index.html'}")
    return not wrong
