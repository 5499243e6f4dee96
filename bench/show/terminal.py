"""Shows a run on a terminal: the log scrolls above; below are panel, services, stick, board and current wait."""

import contextlib
import sys
import time
from typing import Protocol

from bench.show.text import paint
from bench.observation import Run, now
from bench.panel import color_name, led_name
from bench.unit import State, UnitError

REDRAW = 0.1  # s
LOOK = 0.3  # s, between two readings of the unit's state
# Control sequences of ECMA-48 and DEC's autowrap mode, which every current terminal knows.
NO_WRAP, WRAP = "\x1b[?7l", "\x1b[?7h"
ERASE_BELOW = "\x1b[J"


def up(lines: int) -> str:
    """Moves the cursor to the start of the line `lines` above."""
    return f"\x1b[{lines}F" if lines else ""


def panel_rows(leds: dict[int, int]) -> list[str]:
    """The front panel: all LEDs above their names; without colours, a letter for each lit one."""
    names = [led_name(led).removeprefix("0x") for led in leds]
    width = sum(len(name) + 2 for name in names)
    lights = ""
    for name, color in zip(names, map(color_name, leds.values())):
        light = "○" if color == "off" else "●" if paint("", color) else color[0].upper()
        lights += paint(light.center(len(name) + 2), color)
    return [
        f"┌{'─' * width}┐",
        f"│{lights}│",
        f"│{''.join(f' {name} ' for name in names)}│",
        f"└{'─' * width}┘",
    ]


def activity(run: Run, moment: float) -> str:
    """What the updater does at `moment` (s): a wait and its remaining time, or a command and its duration so far."""
    waits = [call for call in run.waits() if call.end is None]
    if waits:
        here = max(0.0, waits[-1].start + waits[-1].real - moment)
        left = waits[-1].seconds * here / waits[-1].real if waits[-1].real else 0
        return f"waits {waits[-1].seconds} s, {left:.0f} s remain ({here:.1f} s here)"
    commands = [call for call in run.calls if call.call != "nanosleep" and call.end is None]
    own = [call for call in commands if not call.text.startswith("i2cset ")] or commands
    return f"runs, for {moment - own[-1].start:.1f} s: {own[-1].text}" if own else "between two commands"


class HasState(Protocol):
    """What the display shows."""

    def state(self) -> State:
        """The unit as it is now."""


class LiveDisplay:
    """The display on a terminal. Use it in a `with`, whose end removes the lower part."""

    def __init__(self, unit: HasState) -> None:
        self._unit = unit
        self._state: State | None = None
        self._looked = self._drawn = float("-inf")
        self._lines = 0

    def __enter__(self) -> "LiveDisplay":
        return self

    def __exit__(self, *_: object) -> None:
        with contextlib.suppress(OSError):
            sys.stdout.write(up(self._lines) + ERASE_BELOW)
            sys.stdout.flush()
        self._lines = 0

    def show(self, run: Run, log: str) -> None:
        """Shows the new part of the log, and the unit as it is."""
        moment = time.monotonic()
        if not log and moment - self._drawn < REDRAW:
            return
        if moment - self._looked > LOOK:
            with contextlib.suppress(OSError, UnitError):  # just being made or ended
                self._state = self._unit.state()
            self._looked = moment
        self._drawn = moment
        rows = self._rows(run)
        block = "".join(f"{row}\n" for row in rows)
        sys.stdout.write(f"{up(self._lines)}{ERASE_BELOW}{log}{NO_WRAP}{block}{WRAP}")
        sys.stdout.flush()
        self._lines = len(rows)

    def _rows(self, run: Run) -> list[str]:
        moment, state = now(), self._state
        rows = panel_rows(run.panel.shown(moment))
        if state:
            rows.append(
                f"harl: {state.harl}   harl-updater: {state.updater}   "
                f"stick: {'mounted' if state.stick else 'not mounted'}   "
                f"board: {state.board or '(cannot be read)'}   package: {state.package}"
            )
        return [*rows, f"The updater {activity(run, moment)}"]
