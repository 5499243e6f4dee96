"""Usage: tests/reliability/interruption_real [COMMAND...]

Kills the updater, or everything that runs on the head, at each command of an update of package and board in turn, right
before the command and right behind it, on the bench unit with the real tools. Then the updater runs again on the unit
as it was left. That run must end as a first run on a unit with that package, board, marker and stick does, and
dpkg --audit must say nothing but where AUDITED expects it. Prints a line for each interruption, and fails at any
difference. COMMAND is one of the names in the lines.
"""

import contextlib
import copy
import os
import subprocess
import sys
from concurrent.futures import ThreadPoolExecutor
from dataclasses import dataclass
from functools import cache
from pathlib import Path

from bench import scenario
from bench.build import BUILD, build
from bench.real.files import search_path
from bench.real.unit import RealUnit, forbidden
from bench.runner import run_on, temporary_folder
from bench.scenario import Scenario
from bench.unit import State, UnitError
from tests.reliability.disturbed import outcome
from tests.reliability.interruption_test import COMMANDS

ROOT = Path(__file__).resolve().parents[2]

SPEED = 2000  # times shorter waits, each 0.2 s at least
AT_ONCE = 3

# Behind the updater's own commands those of apt, in the middle of the installation.
POINTS = COMMANDS | {"unpack": ("dpkg", "*--unpack*"), "configure": ("dpkg", "*--configure*")}
# Everything on the head has this root; the board and the bench have others.
KILLS = {
    "updater": 'read -r updater </run/unit.pid; kill -s KILL "$updater"',
    # The updater first: it must not go on while its command is already gone.
    "unit": """read -r updater </run/unit.pid
kill -s KILL "$updater"
for process in /proc/[0-9]*; do
    [ "$(/usr/bin/readlink "$process/root")" = / ] && [ "${process#/proc/}" != $$ ] && kill -s KILL "${process#/proc/}"
done
kill -s KILL $$""",
}
# The package lies unpacked but was not configured. The next run finds its version installed and leaves it so.
AUDITED = {("unit", "unpack", "after"), ("unit", "configure", "before")}


@dataclass(frozen=True)
class Interruption:
    """Who is killed, at which command, before or after it takes effect."""

    killed: str
    point: str
    moment: str


class InterruptedUnit(RealUnit):
    """A real unit that kills itself once, and on which the updater can run again."""

    def __init__(self, what: Scenario, folder: Path, interruption: Interruption | None) -> None:
        super().__init__(what, folder, SPEED, BUILD, "the updater is killed and started again by the test")
        self._interruption = interruption
        self._started = False

    def start(self) -> None:
        """Makes the unit the first time, and starts the updater."""
        if not self._started:
            self._started = True
            super().start()
            return
        for name in ("log", "calls", "panel", "status"):
            (self._out / name).unlink(missing_ok=True)
        for played in self._out.glob("played-*"):
            played.unlink()
        (self._out / "again").write_text("\n")

    def ended(self) -> int | None:
        """None while anything runs on the head, or on the board besides its server, then the updater's status."""
        status = super().ended()
        return None if status is None or self._running("head") > 0 or self._running("board") > 1 else status

    def close(self) -> None:
        """The unit is kept for the next run."""

    def end(self) -> None:
        """Ends the unit."""
        super().close()

    def audit(self) -> str:
        """What dpkg finds wrong with the head's packages."""
        database = self._root() / "head/var/lib/dpkg"
        command = ["dpkg", f"--admindir={database}", "--audit"]
        return subprocess.run(command, capture_output=True, text=True, check=True).stdout

    def _running(self, root: str) -> int:
        """How many processes have `root`."""
        count = 0
        for process in Path("/proc").glob("[0-9]*"):
            with contextlib.suppress(OSError):  # has ended, or is somebody else's
                count += os.readlink(process / "root") == f"{self._folder}/unit/{root}"
        return count

    def _add_programs(self) -> str:
        command = super()._add_programs()
        if self._interruption is None:
            return command
        tools = self._folder / "head/opt/bench/interrupting"
        tools.mkdir()
        (tools / "armed").touch()
        tool, arguments = POINTS[self._interruption.point]
        kill = KILLS[self._interruption.killed]
        before, after = (kill, "") if self._interruption.moment == "before" else ("", kill)
        (tools / tool).write_text(f"""#!/bin/sh
PATH={search_path(self._settings)}
case "$*" in
{arguments}) rm /opt/bench/interrupting/armed 2>/dev/null || exec {tool} "$@" ;;
*) exec {tool} "$@" ;;
esac
{before}
{tool} "$@"
status=$?
{after}
exit "$status"
""")
        (tools / tool).chmod(0o755)
        if tool == "dpkg":
            configuration = self._folder / "head/etc/apt/apt.conf.d/70interrupting"
            configuration.write_text('Dir::Bin::dpkg "/opt/bench/interrupting/dpkg";\n')
        return command.replace(" PATH=", " PATH=/opt/bench/interrupting:", 1)


def interrupt(what: Interruption) -> bool:
    """Interrupts an update, runs another one on the same unit and prints what became of it. True when it is as due."""
    with temporary_folder() as folder:
        unit = InterruptedUnit(scenario.load("package-and-board"), folder, what)
        try:
            run_on(unit, lambda run, log: None, SPEED)
            state = unit.state()
            second = outcome(run_on(unit, lambda run, log: None, SPEED))
            audit = unit.audit()
        finally:
            unit.end()
    due = first_run(state.package, state.board, state.marker, state.stick)
    wrong = [f"{key}: {second[key]!r}, not {due[key]!r}" for key in due if second[key] != due[key]]
    if bool(audit) != ((what.killed, what.point, what.moment) in AUDITED):
        wrong.append(f"dpkg --audit: {audit!r}")
    print(row(what, state, second, audit), *(f"\n  DIFFERENCE: {line}" for line in wrong), sep="", flush=True)
    return not wrong


def row(what: Interruption, state: State, second: dict[str, object], audit: str) -> str:
    """One line: the unit right behind the interruption, and what the next run shows and leaves."""
    panel = " ".join(f"{led} {color}" for led, color in second["panel"].items())  # type: ignore[attr-defined]
    return (
        f"{what.killed:8} {what.point:16} {what.moment:7} | {state.package:7} {state.board or '?':6} "
        f"{'there' if state.marker else 'gone':6} {'there' if state.stick else 'gone':6} {state.harl:8} | "
        f"{panel:22} {second['package']:7} {second['board']:6} {'stays' if second['marker'] else 'gone':6} "
        f"{'not configured' if audit else 'clean'}"
    )


@cache
def first_run(package: str, board: str, marker: bool, stick: bool) -> dict[str, object]:
    """What a first run makes of a unit in that state. Whether harl runs makes no difference: an update stops it."""
    what = copy.deepcopy(scenario.load("package-and-board"))
    what.unit["package"]["installed"] = package
    what.unit["board"]["installed"] = board
    what.unit["head"]["marker"] = marker
    what.unit["stick"]["inserted"] = stick
    with temporary_folder() as folder:
        unit = InterruptedUnit(what, folder, None)
        try:
            return outcome(run_on(unit, lambda run, log: None, SPEED))
        finally:
            unit.end()


def main() -> int:
    """The command."""
    points = sys.argv[1:] or list(POINTS)
    for name in points:
        if name not in POINTS:
            print(f"interruption_real: {name}: no such command. There are {', '.join(POINTS)}.", file=sys.stderr)
            return 2
    build()
    if reason := forbidden():
        sys.exit(f"interruption_real: this machine forbids namespaces: {reason}")
    print("killed   command          moment  | package board  marker stick  harl     | "
          "next run               package board  marker dpkg --audit")
    cases = [Interruption(killed, point, moment) for killed in KILLS for point in points
             for moment in ("before", "after")]
    try:
        with ThreadPoolExecutor(AT_ONCE) as pool:
            as_due = list(pool.map(interrupt, cases))
    except UnitError as error:
        sys.exit(f"interruption_real: {error}")
    print(f"{len(as_due)} interruptions, {as_due.count(False)} with a difference")
    return 0 if all(as_due) else 1


if __name__ == "__main__":
    sys.exit(main())
