"""Scenario files of the target test. docs/target-test.md explains how to add one."""

import copy
import re
from dataclasses import dataclass, field, fields, replace
from pathlib import Path
from typing import Any, Literal

import tomllib

from bench import scenario as bench
from bench.expected import expected_log
from bench.fields import FieldError, fill

FOLDER = Path(__file__).parent / "scenarios"


Event = Literal[
    "nothing",
    "crash",
    "stop",
    "out-of-memory",
    "give-back-killed",
    "give-back-out-of-memory",
    "power-cut",
    "power-cut-before-application",
]
NOT_IN_SCRIPT = ("nothing", "power-cut-before-application")


@dataclass
class Settings:
    """The keys of a file besides `summary`, `like` and `expect`."""

    # an event while the package's maintainer script runs, or right before the application starts
    event: Event = "nothing"
    script_seconds: int = 0  # that the package's maintainer script takes
    package_files: int = 1  # that the offered package has
    needs_newer_updater: bool = False  # the offered package depends on a newer harl-updater, which is offered too
    board_script_limit: int = 0  # s, of the hand-over, instead of the shipped one; 0: the shipped one
    shortest_wait: int = 5  # s, of the updater's shortened waits; each pause of the flashing takes this long
    # moments at which the disk is copied as a power cut leaves it: parts of the length of an earlier run, in one boot
    power_cuts: list[float] = field(default_factory=list)
    times_flashing: bool = False  # after the run: phases of the flashing, with and without the hand-over

    def is_cut(self) -> bool:
        """Whether the machine loses its power."""
        return self.event.startswith("power-cut")


@dataclass
class Expect:
    """The expected result, besides that of the bench scenario."""

    result: str = "success"  # the service manager's result of the service
    package_status: str = "installed"  # the package manager's state
    updater: Literal["same", "newer"] = "same"  # version of harl-updater compared with the one before


# What the target test can make of a bench scenario's setup; everything else must be a default of bench/scenario.py.
SUPPORTED = {
    "package": ["installed", "offered"],
    "mirrors": ["refresh"],
    "board": ["installed", "link", "script"],
    "head": ["marker"],
    "updater": ["stopped"],
}


class PlanError(Exception):
    """A scenario that does not exist or cannot be used; the text is one line with the file and the reason."""


@dataclass
class Plan:
    """One scenario: the bench scenario that it is like, with its own expectations merged in, and what it adds."""

    name: str
    summary: str
    like: bench.Scenario
    whole_log: list[str]  # the records that the bench scenario expects
    settings: Settings
    expect: Expect


def names() -> list[str]:
    """The names of all scenarios, in order."""
    return sorted(path.stem for path in FOLDER.glob("*.toml"))


def load(name: str) -> Plan:
    """Reads the scenario `name`. Raises PlanError."""
    if name not in names():
        raise PlanError(f"no scenario {name!r}: target/run --list shows all")
    return read(FOLDER / f"{name}.toml")


def read(path: Path) -> Plan:
    """Reads the scenario file `path`. Raises PlanError."""
    try:
        content = tomllib.loads(path.read_text(encoding="utf-8"))
        summary, like = content.pop("summary"), copy.deepcopy(bench.load(content.pop("like")))
    except (OSError, UnicodeError, tomllib.TOMLDecodeError, bench.ScenarioError) as error:
        raise PlanError(f"{path}: {error}") from error
    except KeyError as error:
        raise PlanError(f"{path}: {error.args[0]}: is missing") from error

    try:
        expect: dict[str, Any] = content.pop("expect", {})
        known = {field.name for field in fields(bench.Expect)}
        own = {key: expect.pop(key) for key in list(expect) if key in known}
        whole_log = journaled(like.expect.log)
        like.expect = bench.expectations(vars(like.expect) | own)
        settings, expected = fill(Settings, "", content), fill(Expect, "expect.", expect)
    except FieldError as error:
        raise PlanError(f"{path}: {error}") from error
    like.expect = replace(like.expect, log="\n".join(journaled(like.expect.log)))
    check_setup(path, like)
    if settings.event not in NOT_IN_SCRIPT and settings.script_seconds < 1:
        raise PlanError(f"{path}: script_seconds: must be 1 or more with event = {settings.event!r}")
    return Plan(path.stem, summary, like, whole_log, settings, expected)


def journaled(log: str) -> list[str]:
    """The expected records as the journal keeps them: without blanks and carriage returns at the ends of lines."""
    return [re.sub(r"(\\r| )+$", "", line) for line in expected_log(log)]


def check_setup(path: Path, like: bench.Scenario) -> None:
    """Refuses a bench scenario whose unit the target test cannot make. Raises PlanError."""
    usual = bench.Setup()
    for section in fields(usual):
        default = getattr(usual, section.name)
        for key, value in vars(getattr(like.setup, section.name)).items():
            if key not in SUPPORTED.get(section.name, []) and value != getattr(default, key):
                what = f"{section.name}.{key} = {value!r}"
                raise PlanError(f"{path}: like: {like.name} has {what}, which cannot be made here")
    if like.setup.board.link not in ("up", "down"):
        raise PlanError(f"{path}: like: the target test knows a board link that is up or down, no other")
    if like.setup.board.script not in ("works", "never-returns"):
        raise PlanError(f"{path}: like: the target test knows a board's script that works or never returns, no other")
