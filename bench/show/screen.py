"""The bench unit on a whole terminal, drawn with curses: panel, services, parts, steps, log and keys."""

import contextlib
import curses
import os
import signal
import subprocess
import sys
from dataclasses import dataclass

from bench.observation import Run, now, records_of
from bench.panel import color_name, led_name
from bench.scenario import Scenario
from bench.show.steps import Row, headline, rows
from bench.show.text import colored, shortened, terminal
from bench.unit import PARTS, State, UnitError

WIDTH, HEIGHT = 80, 24  # that everything fits into
POLL = 0.1  # s, between two looks at the keyboard
COLORS = {"blue": curses.COLOR_BLUE, "pass": curses.COLOR_GREEN, "fail": curses.COLOR_RED}
STEP_ROWS = 8
LOG_TAIL = 8000  # characters; more than the screen shows
Segment = tuple[str, int]  # text, attributes of curses


@dataclass
class View:
    """What the screen shows."""

    scenario: Scenario
    unit: str
    run: Run
    parts: dict[str, bool]
    planned: list[str | int]
    speed: float
    state: State | None = None
    runs: bool = True  # the updater
    message: str = ""
    keys: tuple[str, ...] = ()


class Screen:
    """The terminal, whole. Use it in a `with`, whose end gives the terminal back as it was."""

    def __init__(self) -> None:
        """Raises UnitError when the terminal cannot move its cursor."""
        if not terminal():
            kind = os.environ.get("TERM", "")
            raise UnitError(f"a terminal of the type {kind!r} is not known, or cannot move its cursor")

    def __enter__(self) -> "Screen":
        self._window = curses.initscr()
        try:
            curses.noecho()
            curses.cbreak()
            self._window.keypad(True)
            self._window.timeout(int(POLL * 1000))
            with contextlib.suppress(curses.error):  # a terminal whose cursor is always visible
                curses.curs_set(0)
            self._colors = self._start_colors()
        except BaseException:
            curses.endwin()
            raise
        return self

    def __exit__(self, *_: object) -> None:
        with contextlib.suppress(curses.error):
            curses.endwin()

    def key(self) -> str:
        """The key that was pressed, "" after a short time without one. Raises UnitError when the terminal is gone."""
        try:
            return str(self._window.get_wch())
        except curses.error:
            if not os.isatty(sys.stdin.fileno()):
                raise UnitError("the terminal was closed") from None
            return ""

    def lend(self, command: list[str], environment: dict[str, str], words: str) -> None:
        """Lends the terminal to a command, after `words`, until that ends."""
        curses.def_prog_mode()
        curses.endwin()
        print(words, flush=True)
        # Ctrl-C is the command's; and it may end without giving the terminal back to this process.
        before = signal.signal(signal.SIGINT, lambda *_: None)
        stopped = signal.signal(signal.SIGTTOU, signal.SIG_IGN)
        try:
            subprocess.run(command, env=environment or None, check=False)
            os.tcsetpgrp(sys.stdin.fileno(), os.getpgrp())
        finally:
            signal.signal(signal.SIGINT, before)
            signal.signal(signal.SIGTTOU, stopped)
        curses.reset_prog_mode()
        self._window.clear()

    def draw(self, view: View) -> None:
        """Shows the view; what does not fit is left out."""
        height, width = self._window.getmaxyx()
        lines = self._above(view)
        below: list[list[Segment]] = [[(view.message, curses.A_BOLD)], *([(text, 0)] for text in view.keys)]
        room = max(0, height - len(lines) - len(below))
        log = [[(text, 0)] for text in log_lines(view.run.log, room)]
        self._window.erase()
        blank: list[list[Segment]] = [[]] * (room - len(log))
        for row, segments in enumerate([*lines, *log, *blank, *below][:height]):
            column = 0
            for text, attributes in segments:
                with contextlib.suppress(curses.error):  # the last cell of the screen
                    self._window.addnstr(row, column, text, max(0, width - column), attributes)
                column += len(text)
        self._window.refresh()

    def _start_colors(self) -> dict[str, int]:
        """The attributes of the LEDs' colours."""
        if not colored():
            return {}
        curses.start_color()
        curses.use_default_colors()
        for number, color in enumerate(COLORS.values(), 1):
            curses.init_pair(number, color, -1)
        return {name: curses.color_pair(number) for number, name in enumerate(COLORS, 1)}

    def _above(self, view: View) -> list[list[Segment]]:
        """The lines above the log."""
        moment, state = now(), view.state
        title = f" {view.scenario.name}: {view.unit}"
        speed = f"waits {shortened(view.speed)} "
        title = title[: WIDTH - len(speed) - 1].ljust(WIDTH - len(speed)) + speed
        lines: list[list[Segment]] = [[(title, curses.A_REVERSE)], *self._panel(view.run.panel.shown(moment))]
        if state:
            services = f"harl {state.harl}  updater {state.updater}  stick {'' if state.stick else 'not '}mounted  "
            lines.append([(f"{services}package {state.package}  board {state.board or 'unknown'}", 0)])
        else:
            lines.append([])
        lines.append([])
        for part, works in view.parts.items():
            style = 0 if works else self._colors.get("fail", 0) | curses.A_REVERSE
            lines[-1] += [(f"{part} ", 0), (PARTS[part][0 if works else 1], style), ("  ", 0)]
        steps = rows(view.planned, view.run, moment, view.runs)
        lines.append([(headline(steps, view.runs), curses.A_UNDERLINE)])
        return [*lines, *self._steps(steps)]

    def _panel(self, leds: dict[int, int]) -> list[list[Segment]]:
        """The panel: all LEDs above their names. A lit one has the first letter of its colour, too."""
        lights: list[Segment] = [("|", 0)]
        names = ""
        for led, color in leds.items():
            name, shown = led_name(led).removeprefix("0x"), color_name(color)
            light = "." if shown == "off" else f"[{shown[0].upper()}]"
            attributes = 0 if shown == "off" else self._colors.get(shown, 0) | curses.A_REVERSE | curses.A_BOLD
            before = (len(name) + 2 - len(light)) // 2
            lights += [(" " * before, 0), (light, attributes), (" " * (len(name) + 2 - len(light) - before), 0)]
            names += f" {name} "
        edge = f"+{'-' * len(names)}+"
        return [[(edge, 0)], [*lights, ("|", 0)], [(f"|{names}|", 0)], [(edge, 0)]]

    def _steps(self, steps: list[Row]) -> list[list[Segment]]:
        """The steps in two columns, the latest ones when there is no room for all."""
        style = {
            "done": self._colors.get("pass", 0),
            "failed": self._colors.get("fail", 0) | curses.A_REVERSE,
            "runs": self._colors.get("blue", 0) | curses.A_BOLD,
            "expected": 0,
            "skipped": curses.A_DIM,
        }
        half = WIDTH // 2
        lines: list[list[Segment]] = [[] for _ in range(STEP_ROWS)]
        for number, row in enumerate(steps[-2 * STEP_ROWS :]):
            detail = row.detail[: half - 2]
            title = row.title[: half - len(detail) - 2].ljust(half - len(detail) - 1)
            lines[number % STEP_ROWS] += [(title, 0), (detail, style[row.kind]), (" ", 0)]
        return lines


def log_lines(log: str, count: int) -> list[str]:
    """The last `count` records of the log, a line each: the time, the operation, the message."""
    records = records_of(log[-LOG_TAIL:])
    found = [f"{record.time.split()[-1]} {record.operation}: {record.message}" for record in records[-count:]]
    return ["".join(letter if letter.isprintable() else " " for letter in line) for line in found if count]
