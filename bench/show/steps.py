"""The steps of an update: which ones a unit should take, which it has taken, and what remains."""

import os
import re
from dataclasses import dataclass
from itertools import groupby

from bench.expected import COMMANDS
from bench.makers.packages import candidate
from bench.makers.sticks import version_of
from bench.observation import Call, Run
from bench.scenario import Setup

SOUND = "sound"
ATTEMPTS = 20  # of the upload
# What is done in each step, as a user would say it. A step is a name of COMMANDS, the sound, or a wait in seconds.
TITLES: dict[str | int, str] = {
    "stop-harl": "stop harl",
    "refresh-mirrors": "refresh the mirrors",
    "read-package": "compare the package",
    "install-package": "install the package",
    "read-board": "read the board",
    "list-stick": "read the stick",
    "upload-board": "upload to the board",
    "install-board": "run the board's script",
    780: "wait for the board",
    "remove-marker": "remove the marker",
    SOUND: "play the sound",
    30: "show the outcome",
    "release-stick": "release the stick",
    "start-harl": "start harl",
    10: "wait for harl",
    "stop-updater": "stop the updater",
}
NAMES = {text: name for name, text in COMMANDS.items()}


@dataclass(frozen=True)
class Row:
    """A step as it is shown."""

    title: str
    detail: str
    kind: str  # "done", "failed", "runs", "expected" or "skipped"
    wait: float = 0  # s, that remain


def plan(setup: Setup, package: str, board: str) -> list[str | int]:
    """The steps of an update of the remote head when nothing breaks; `package` and `board` are the installed versions.

    None of the main head's, which depend on what its operator chooses.
    """
    if setup.updater.program == "main":
        return []
    offered = candidate(package, setup.package.offered, setup.package.downgrades)
    on_stick = [version_of(directory) for directory in setup.stick.directories[:1]]
    left_out: set[str | int] = set()
    if package == offered:
        left_out.add("install-package")
    if [board] == on_stick:
        left_out |= {"upload-board", "install-board", 780}
    if {"install-package", "install-board"} <= left_out:
        left_out.add("remove-marker")
    return [step for step in TITLES if step not in left_out]


def step_of(call: Call) -> str | int:
    """The step that a call of the updater belongs to."""
    if call.call == "nanosleep":
        return call.seconds
    return SOUND if call.text.startswith("aplay ") else NAMES.get(call.text, call.text)


def taken(run: Run) -> list[list[Call]]:
    """The commands and waits so far, in order; successive ones of a step are together."""
    waits = run.waits()
    calls = [call for call in run.calls if not call.text.startswith("i2cset ")]
    own = [call for call in calls if call.call != "nanosleep" or call in waits]
    return [list(group) for _, group in groupby(own, step_of)]


def rows(planned: list[str | int], run: Run, moment: float, runs: bool) -> list[Row]:
    """The steps at `moment` (s), taken or not; `runs` says whether the updater does."""
    shown: list[Row] = []
    rest = list(planned)
    for calls in taken(run):
        step = step_of(calls[0])
        if step in rest:
            place = rest.index(step)
            shown += [Row(TITLES[missed], "skipped", "skipped") for missed in rest[:place]]
            rest = rest[place + 1 :]
        shown.append(_row(step, calls, moment, runs))
    remaining = "expected" if runs else "skipped"
    waits = [step if isinstance(step, int) else 0 for step in rest]
    return shown + [Row(TITLES[step], remaining, remaining, wait) for step, wait in zip(rest, waits)]


def headline(shown: list[Row], runs: bool) -> str:
    """Whether the updater runs, and how many of the steps remain."""
    if not runs:
        skipped = sum(row.kind == "skipped" for row in shown)
        return f"The updater is not running: {skipped} of {len(shown)} steps skipped"
    remaining = sum(row.kind == "expected" for row in shown)
    waits = sum(row.wait for row in shown)
    return f"The updater is running: {remaining} of {len(shown)} steps remain, with {waits:.0f} s of waits"


def _row(step: str | int, calls: list[Call], moment: float, runs: bool) -> Row:
    last = calls[-1]
    title = TITLES.get(step, str(step))
    if step == SOUND:
        title = re.sub(r".*RESULT_(\w+)\.wav", lambda match: f"play the {match[1].lower()} sound", last.text)
    if step == "upload-board" and len(calls) > 1:
        title = f"upload, try {len(calls)} of {ATTEMPTS}"
    if last.end is None:
        if not runs:
            # The last command ends the updater that waits for it.
            return Row(title, "done", "done") if step == "stop-updater" else Row(title, "cut short", "failed")
        left = last.left(moment)
        detail = f"{left:.0f} s left" if last.call == "nanosleep" else f"{moment - last.start:.1f} s so far"
        return Row(title, detail, "runs", left)
    took = f"{last.end - calls[0].start:.1f} s"
    if last.call == "nanosleep" or last.status == 0:
        return Row(title, took, "done")
    return Row(title, f"{took}, {status_text(last.status)}", "failed")


def status_text(status: int | None) -> str:
    """How a command ended, from its raw status."""
    if status is None or status < 0:
        return "no status"
    code = os.waitstatus_to_exitcode(status)
    return f"exit {code}" if code >= 0 else f"signal {-code}"
