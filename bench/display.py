"""Shows a run as lines of text: the log as it comes, the panel whenever it changes, and at the end the summary."""

import os
import sys

from observe import Run, now
from panel import color_name, led_name
from scenario import Scenario
from session import Result

ANSI = {"off": "2", "blue": "1;34", "pass": "1;32", "fail": "1;31"}
OTHER_COLOR = "1;35"
# What the panel says at the end of an update.
OUTCOMES = {
    "REMOTE pass, MAIN pass": "nothing to update",
    "PASS pass": "updated",
    "REMOTE fail, MAIN fail": "the mirrors or a version could not be read",
    "FAIL fail": "the package or the board could not be installed",
}


def terminal() -> bool:
    """Whether the output is a terminal that can move its cursor."""
    return sys.stdout.isatty() and os.environ.get("TERM", "dumb") != "dumb"


def colored() -> bool:
    """Whether the output takes colours. NO_COLOR: see https://no-color.org"""
    return terminal() and not os.environ.get("NO_COLOR")


def paint(text: str, color: str) -> str:
    """`text` in the colour of a LED, where the output takes colours."""
    return f"\x1b[{ANSI.get(color, OTHER_COLOR)}m{text}\x1b[0m" if colored() else text


def panel_line(leds: dict[int, int]) -> str:
    """The LEDs that are lit, in words."""
    return ", ".join(f"{led_name(led)} {color_name(color)}" for led, color in leds.items() if color) or "dark"


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


def outcome(run: Run) -> str:
    """What the operator learns from the panel, in words."""
    return OUTCOMES.get(panel_line(run.panel.shown(now())), "none: the panel shows no outcome")


def print_outcome(scenario: Scenario, result: Result) -> None:
    """The summary at the end of a run."""
    run, state, before = result.run, result.state, scenario.unit
    begin = run.calls[0].start if run.calls else 0
    leds = run.panel.shown(now())
    print("\nCommands")
    for call in run.commands():
        took = f"{call.end - call.start:6.2f} s" if call.end is not None else "   ended"
        print(f"  {call.start - begin:7.2f} s  {took}  {call.text}")
    print("Waits: " + (", ".join(f"{call.seconds} s in {call.real:.1f} s" for call in run.waits()) or "none"))
    print(f"\nOutcome: {paint(outcome(run), next(filter(None, map(color_name, filter(None, leds.values()))), 'off'))}")
    print(f"Panel: {panel_line(leds)}")
    print(f"Sound: {', '.join(state.sounds) or 'none'}")
    print(f"Package: {before['package']['installed']} -> {state.package}")
    print(f"Board: {before['board']['installed']} -> {state.board or '(cannot be read)'}")
    print(f"First-boot marker: {'there' if state.marker else 'gone'}")
    print(f"Stick: {'mounted' if state.stick else 'released'}")
    print(f"harl: {state.harl}")
    print(f"Updater: {f'ended by signal {-result.status}' if result.status < 0 else f'exit status {result.status}'}")
    print(f"Wall time: {result.seconds:.1f} s, set-up included")
