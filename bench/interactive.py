"""bench/run --interactive: the user plays with a unit while the updater runs on it."""

import contextlib
import os
import signal
import time
from collections.abc import Callable
from pathlib import Path

from bench.observation import Run, now
from bench.outcomes import meaning_of
from bench.panel import Panel
from bench.processes import children, descendants, words
from bench.scenario import Scenario
from bench.show.screen import Screen, View
from bench.show.steps import plan
from bench.show.text import panel_line, shortened
from bench.unit import PARTS, Unit, UnitError

LOOK = 0.2  # s, between two readings of the unit's state
FACTOR = 3  # of the speed, for each key
PART_KEYS = {"p": "power", "s": "stick", "b": "board", "l": "link", "m": "mirrors", "a": "sound", "i": "bus"}
KEYS = (
    "p power  s stick  b board  l link  m mirrors  a sound  i bus: each on and off",
    "u update  h/k hang/kill command  x kill updater  +/- speed  ! shell  q end",
)


class Watch:
    """The screen beside a run that nobody changes. Use it in a `with`, whose end leaves the log on the terminal."""

    def __init__(self, unit: Unit, what: Scenario, speed: float) -> None:
        planned = plan(what.setup, what.setup.package.installed, what.setup.board.installed)
        self._unit = unit
        self._screen = Screen()
        self._view = View(what, unit.name, Run(unit.files), unit.parts(), planned, speed)
        self._drawn = float("-inf")

    def __enter__(self) -> "Watch":
        self._screen.__enter__()
        return self

    def __exit__(self, *_: object) -> None:
        self._screen.__exit__()
        print(self._view.run.log, end="", flush=True)

    def show(self, run: Run, _: str) -> None:
        """Shows the run so far."""
        if time.monotonic() - self._drawn < LOOK:
            return
        self._drawn = time.monotonic()
        self._view.run = run
        with contextlib.suppress(OSError, UnitError):  # just being made or ended
            self._view.state = self._unit.state()
        self._screen.draw(self._view)


class Play:
    """A unit, and what the user has done to it."""

    def __init__(self, unit: Unit, what: Scenario, speed: float, screen: Screen) -> None:
        self._unit = unit
        self._screen = screen
        self._hung: list[int] = []  # processes of the command that hangs
        self._looked = float("-inf")
        self._setup = what.setup
        self.lines: list[str] = []  # how each update ended
        self._view = View(what, unit.name, Run(unit.files), unit.parts(), [], speed, keys=KEYS)
        self._actions: dict[str, Callable[[], str]] = {
            "u": self._update,
            "h": self._hang,
            "k": self._kill_command,
            "x": self._kill_updater,
            "+": lambda: self._set_speed(FACTOR),
            "-": lambda: self._set_speed(1 / FACTOR),
            "!": self._shell,
        }

    def run(self) -> None:
        """Until the user ends it. Raises UnitError."""
        self._unit.set_speed(self._view.speed)
        self._unit.start()
        self._plan()
        while (key := self._screen.key()) != "q":
            if key:
                self._press(key)
            self._look()
            self._screen.draw(self._view)

    def _look(self) -> None:
        """Looks at what has happened."""
        view = self._view
        view.run.update()
        if time.monotonic() - self._looked > LOOK:
            with contextlib.suppress(OSError):  # just changing
                view.state = self._unit.state()
            self._looked = time.monotonic()
        if view.runs and (status := self._unit.ended()) is not None:
            view.run.update()
            self._end(f"signal {-status}" if status < 0 else f"status {status}")

    def _press(self, key: str) -> None:
        """What the key is for; a word about it appears."""
        try:
            if key in PART_KEYS:
                self._view.message = self._switch(PART_KEYS[key])
            elif key in self._actions:
                self._view.message = self._actions[key]()
        except (UnitError, OSError) as error:
            self._view.message = str(error)
        self._looked = float("-inf")

    def _switch(self, part: str) -> str:
        self._unit.switch(part)
        view = self._view
        view.parts = self._unit.parts()
        if part == "power" and not view.parts["power"]:
            if view.runs:
                self._end("power cut")
            view.run.update()  # the panel's last bytes
            view.run.panel = Panel()
            return "power off: everything on the head is dead; p boots it again"
        return f"{part}: {PARTS[part][0 if view.parts[part] else 1]}"

    def _update(self) -> str:
        if self._view.runs:
            return "the updater is already running"
        if not self._view.parts["power"]:
            return "there is no power: p switches it on"
        self._plan()
        self._unit.update()
        self._view.run = Run(self._unit.files, panel=self._view.run.panel)
        self._view.runs = True
        return "the updater starts"

    def _hang(self) -> str:
        if self._hung:
            self._signal(self._hung, signal.SIGCONT)
            self._hung = []
            return "the command continues"
        self._hung = self._command()
        if not self._hung:
            return "no command is running"
        self._signal(self._hung, signal.SIGSTOP)
        return f"{self._name(self._hung)} hangs; h lets it continue"

    def _kill_command(self) -> str:
        processes = self._command()
        if not processes:
            return "no command is running"
        name = self._name(processes)
        self._signal(processes, signal.SIGKILL)
        self._hung = []
        return f"{name} killed"

    def _kill_updater(self) -> str:
        updater = self._unit.updater()
        if not updater:
            return "the updater is not running"
        self._signal([updater], signal.SIGKILL)
        return "updater killed; what it started continues"

    def _set_speed(self, factor: float) -> str:
        self._view.speed = max(1.0, self._view.speed * factor)
        self._unit.set_speed(self._view.speed)
        return f"waits are {shortened(self._view.speed)}"

    def _shell(self) -> str:
        if not self._view.parts["power"]:
            return "there is no power: p switches it on"
        command, environment = self._unit.shell()
        self._screen.lend(command, environment, "\nA shell on the head. The update continues. exit returns.")
        return "back from the shell"

    def _plan(self) -> None:
        state = self._view.state = self._unit.state()
        self._view.planned = plan(self._setup, state.package, state.board)
        self._hung = []

    def _end(self, how: str) -> None:
        """The update is over."""
        panel = self._view.run.panel
        self._view.runs = False
        self._looked = float("-inf")
        self._view.message = f"{how}: {meaning_of(panel.pattern(now()))}; u updates again"
        self.lines.append(f"Update {len(self.lines) + 1}: {how}, panel {panel_line(panel.shown(now()))}")

    def _command(self) -> list[int]:
        """The processes of the command that the updater waits for; not those of the panel, which come and go."""
        updater = self._unit.updater()
        found: list[int] = []
        for child in children(updater) if updater else []:
            if not any("i2cset" in word for word in words(child)):
                found += [child, *descendants(child)]
        return found

    @staticmethod
    def _signal(processes: list[int], number: int) -> None:
        for process in processes:
            with contextlib.suppress(ProcessLookupError):
                os.kill(process, number)

    @staticmethod
    def _name(processes: list[int]) -> str:
        """The command line, as far as the last of its processes tells it."""
        return Path(words(processes[-1])[0]).name if words(processes[-1]) else "the command"


def play(unit: Unit, what: Scenario, speed: float) -> list[str]:
    """Lets the user play with the unit. Returns a line for each update. Raises UnitError."""
    with Screen() as screen:
        player = Play(unit, what, speed, screen)
        try:
            player.run()
        finally:
            unit.close()
    return player.lines
