"""Shows a run: the log as it comes, the panel whenever it changes, and at the end the outcome."""

import os
import sys

from observe import Run
from panel import color_name, led_name
from scenario import Scenario
from session import Result

ANSI = {"off": "2", "blue": "1;34", "pass": "1;32", "fail": "1;31"}


def colored() -> bool:
    """Whether the output takes colours."""
    return sys.stdout.isatty() and "NO_COLOR" not in os.environ and os.environ.get("TERM", "dumb") != "dumb"


def panel_line(leds: dict[int, int]) -> str:
    """The panel as a line: all LEDs in their colours, or in words those that are lit."""
    if colored():
        return " ".join(f"\x1b[{ANSI.get(color_name(color), '1;35')}m● {led_name(led)}\x1b[0m" for led, color in leds.items())
    return ", ".join(f"{led_name(led)} {color_name(color)}" for led, color in leds.items() if color) or "dark"


class PlainDisplay:
    """One line after the other, for a pipe or a plain terminal."""

    def __init__(self) -> None:
        self._changes = 0

    def show(self, run: Run, log: str) -> None:
        """Shows what is new: `log`, and the panel's changes."""
        sys.stdout.write(log)
        for change in run.changes[self._changes :]:
            print(f"    panel: {panel_line(change.leds)}")
        self._changes = len(run.changes)
        sys.stdout.flush()


def print_outcome(scenario: Scenario, result: Result) -> None:
    """The summary at the end of a run."""
    run, state = result.run, result.state
    begin = run.calls[0].start if run.calls else 0
    before = scenario.unit
    print("\nCommands")
    for call in run.commands():
        took = f"{call.end - call.start:6.2f} s" if call.end is not None else "   ended"
        print(f"  {call.start - begin:7.2f} s  {took}  {call.text}")
    print("\nWaits: " + (", ".join(f"{call.seconds} s in {call.real:.1f} s" for call in run.waits()) or "none"))
    print(f"Panel: {panel_line(run.changes[-1].leds if run.changes else {})}")
    print(f"Sound: {', '.join(state.sounds) or 'none'}")
    print(f"Package: {before['package']['installed']} -> {state.package}")
    print(f"Board: {before['board']['installed']} -> {state.board}")
    print(f"First-boot marker: {'there' if state.marker else 'gone'}, stick: {'mounted' if state.stick else 'released'}, harl: {state.harl}")
    print(f"Updater: status {result.status}, {result.seconds:.1f} s")
