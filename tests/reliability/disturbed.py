"""Stand-in units with disturbances: the updater starts under other circumstances, a tool does more than it
should, or the unit is used a second time."""

import contextlib
import os
import shutil
from pathlib import Path

from bench.compare import seen_log
from bench.makers.files import write_script
from bench.runner import Result
from bench.scenario import Scenario
from bench.standin.unit import StandInUnit

SPEED = 2000  # times shorter waits, each 0.2 s at least


class DisturbedUnit(StandInUnit):
    """A stand-in unit whose updater is started by shell lines, and which can be started a second time.

    `circumstances` are shell lines that run before the updater takes the shell's place, such as "ulimit -n 4";
    `redirection` is the updater's own, such as ">/dev/full"; `runner` precedes its name.
    """

    def __init__(self, what: Scenario, folder: Path, build: Path, circumstances: str = "", redirection: str = "",
                 runner: str = "") -> None:
        wrapped = folder / "build"
        (wrapped / "bench").mkdir(parents=True)
        shutil.copy(build / "bench/call_recorder.so", wrapped / "bench")
        shutil.copy(build / "harl-updater", wrapped / "updater")
        script = f"""
{circumstances}
exec {runner} /usr/bin/env LD_PRELOAD={wrapped}/bench/call_recorder.so {wrapped}/updater {redirection}
"""
        write_script(wrapped / "harl-updater", script)
        super().__init__(what, folder, SPEED, wrapped)
        self._made = False
        self._changed_tools: dict[str, str] = {}

    def change_tool(self, tool: str, lines: str) -> None:
        """Runs shell `lines` in place of a tool; in them, real "$@" is the stand-in tool itself."""
        self._changed_tools[tool] = f'real() {{ "$UNIT/real/{tool}" "$@"; }}\n{lines}\n'

    def start(self) -> None:
        """Makes the unit the first time, and starts the updater."""
        if self._made:
            self.update()
            return
        self._made = True
        super().start()

    def ended(self) -> int | None:
        """None while the updater runs, or a command that it left running, then its status."""
        status = super().ended()
        return None if status is not None and self._updater and group_lives(self._updater.pid) else status

    def restore_tools(self) -> None:
        """Undoes every change of a tool."""
        for tool in self._changed_tools:
            (self._folder / "bin" / tool).unlink()
            (self._folder / "real" / tool).rename(self._folder / "bin" / tool)
        self._changed_tools = {}

    def signal(self, number: int) -> None:
        """Sends a signal to the updater alone."""
        if self._updater and self._updater.poll() is None:
            os.kill(self._updater.pid, number)

    def _make_head(self) -> None:
        super()._make_head()
        (self._folder / "real").mkdir()
        for tool, text in self._changed_tools.items():
            (self._folder / "bin" / tool).rename(self._folder / "real" / tool)
            write_script(self._folder / "bin" / tool, text)


def group_lives(group: int) -> bool:
    """Whether a process of `group` still runs; a zombie does not."""
    for process in Path("/proc").glob("[0-9]*"):
        with contextlib.suppress(OSError):  # has just ended
            # After the name in parentheses: state, parent, group; proc(5).
            state, _, its_group = (process / "stat").read_text(errors="replace").rpartition(")")[2].split()[:3]
            if int(its_group) == group and state != "Z":
                return True
    return False


def observed(result: Result) -> dict[str, object]:
    """The result of a run: how it ended, what it did, and the state of the unit."""
    run, state = result.run, result.state
    return {
        "status": result.status,
        "commands": [call.text for call in run.commands()],
        "waits": [call.seconds for call in run.waits()],
        "log": seen_log(run),
        "panel": run.panel.pattern(run.calls[-1].start if run.calls else 0),
        "panel faults": run.panel.faults,
        **vars(state),
    }
