"""Shows a run as lines of text: the log as it grows, each change of the panel, and the summary at the end."""

import curses
import os
import sys
from dataclasses import dataclass
from functools import cache

from bench.observation import Run, now
from bench.outcomes import meaning_of
from bench.panel import color_name, lit
from bench.runner import Result
from bench.scenario import Scenario

ANSI = {"off": "2", "blue": "1;34", "pass": "1;32", "fail": "1;31"}
OTHER_COLOR = "1;35"


@cache
def terminal() -> bool:
    """Whether the output is a terminal that can move its cursor."""
    if not sys.stdout.isatty():
        return False
    try:
        curses.setupterm()
    except curses.error:  # a terminal that nobody knows
        return False
    return curses.tigetstr("cup") is not None


def colored() -> bool:
    """Whether the output supports colours. NO_COLOR: see https://no-color.org"""
    return terminal() and curses.tigetnum("colors") > 0 and not os.environ.get("NO_COLOR")


def paint(text: str, color: str) -> str:
    """`text` in the colour of a LED, where the output supports colours."""
    return f"\x1b[{ANSI.get(color, OTHER_COLOR)}m{text}\x1b[0m" if colored() else text


def panel_line(leds: dict[int, int]) -> str:
    """The LEDs that are lit, in words."""
    return ", ".join(f"{led} {color}" for led, color in lit(leds).items()) or "dark"


def shortened(speed: float) -> str:
    """How long the waits are at this speed."""
    return f"{f'{speed:.1f}'.removesuffix('.0')} times shorter" if speed > 1 else "at full length"


class PlainDisplay:
    """One line after the other, for a pipe or a plain terminal."""

    def __init__(self) -> None:
        self._changes = 0

    def __enter__(self) -> "PlainDisplay":
        return self

    def __exit__(self, *_: object) -> None:
        pass

    def show(self, run: Run, log: str) -> None:
        """Shows what is new: `log`, and the panel's changes."""
        sys.stdout.write(log)
        for change in run.changes[self._changes :]:
            print(f"    panel: {panel_line(change.leds)}")
        self._changes = len(run.changes)
        sys.stdout.flush()


@dataclass
class Summary:
    """What is printed about a run at its end."""

    scenario: Scenario
    unit: str  # what is real and what is a stand-in
    result: Result
    wrong: list[str]  # the differences from what the scenario expects

    @property
    def outcome(self) -> str:
        """What the operator learns from the panel, in words."""
        return meaning_of(self.result.run.panel.pattern(now()))

    def rows(self) -> list[tuple[str, str]]:
        """Names and values."""
        result, state, before = self.result, self.result.state, self.scenario.setup
        status = f"ended by signal {-result.status}" if result.status < 0 else f"exit status {result.status}"
        return [
            ("Outcome", self.outcome),
            ("Panel", panel_line(result.run.panel.shown(now()))),
            ("Sound", ", ".join(state.sounds) or "none"),
            ("Package", f"{before.package.installed} -> {state.package}"),
            ("Board", f"{before.board.installed} -> {state.board or '(cannot be read)'}"),
            ("First-boot marker", "there" if state.marker else "gone"),
            ("Stick", "mounted" if state.stick else "released"),
            ("harl", state.harl),
            ("Updater", status),
            ("Wall time", f"{result.seconds:.1f} s, set-up included"),
        ]


def print_summary(summary: Summary) -> None:
    """The summary at the end of a run, with the commands and their times."""
    run = summary.result.run
    begin = run.calls[0].start if run.calls else 0
    print("\nCommands")
    for call in run.commands():
        took = f"{call.end - call.start:6.2f} s" if call.end is not None else "   ended"
        print(f"  {call.start - begin:7.2f} s  {took}  {call.text}")
    print("Waits: " + (", ".join(f"{call.seconds} s in {call.real:.1f} s" for call in run.waits()) or "none"))
    print()
    colors = [color_name(color) for color in run.panel.shown(now()).values() if color]
    for name, value in summary.rows():
        print(f"{name}: {paint(value, colors[0]) if colors and name == 'Outcome' else value}")
    for line in summary.wrong:
        print(f"DIFFERENCE: {line}")
