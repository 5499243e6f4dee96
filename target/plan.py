"""Scenario files of the target test. docs/target-test.md tells how to add one."""

import copy
import re
from dataclasses import dataclass
from pathlib import Path
from typing import Any

import tomllib

from bench import scenario as bench
from bench.expected import expected_log

FOLDER = Path(__file__).parent / "scenarios"

# What a file may say beside `summary`, `like` and `expect`: the default and what else is allowed.
SETTINGS: dict[str, tuple[Any, Any]] = {
    # what befalls the updater while the package's maintainer script is at work
    "event": ("nothing", ["nothing", "crash", "stop", "out-of-memory", "power-cut"]),
    "script_seconds": (0, int),  # that the package's maintainer script takes
    "needs_newer_updater": (False, bool),  # the offered package depends on a newer harl-updater, which is offered too
}

# What must come out beside what the bench scenario says.
EXPECT: dict[str, tuple[Any, Any]] = {
    "result": ("success", str),  # the service manager's word for the unit's end
    "package_status": ("installed", str),  # the package manager's
    "updater": ("same", ["same", "newer"]),  # version of harl-updater against the one before
}

# What the target test can make of a bench scenario's unit; everything else must stand as in bench/scenario.py.
SUPPORTED = {
    "package": ["installed", "offered"],
    "mirrors": ["refresh"],
    "board": ["installed", "link"],
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
    settings: dict[str, Any]
    expect: dict[str, Any]


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

    expect = content.pop("expect", {})
    like.expect |= {key: expect.pop(key) for key in list(expect) if key in bench.EXPECT}
    # The journal drops blanks and carriage returns at the ends of lines.
    like.expect["log"] = "\n".join(re.sub(r"(\\r| )+$", "", line) for line in expected_log(like.expect["log"]))
    check_unit(path, like)
    settings = merged(path, "", SETTINGS, content)
    if settings["event"] != "nothing" and settings["script_seconds"] < 1:
        raise PlanError(f"{path}: script_seconds: must be 1 or more with event = {settings['event']!r}")
    return Plan(path.stem, summary, like, settings, merged(path, "expect.", EXPECT, expect))


def merged(path: Path, prefix: str, known: dict[str, tuple[Any, Any]], values: dict[str, Any]) -> dict[str, Any]:
    """The defaults of `known` with `values` over them. Raises PlanError."""
    for key, value in values.items():
        if key not in known:
            raise PlanError(f"{path}: {prefix}{key}: not known; the keys are {', '.join(known)}")
        allowed = known[key][1]
        if isinstance(allowed, list) and value not in allowed:
            raise PlanError(f"{path}: {prefix}{key}: must be one of {', '.join(allowed)}, not {value!r}")
        if isinstance(allowed, type) and type(value) is not allowed:
            raise PlanError(f"{path}: {prefix}{key}: must be a {allowed.__name__}, not {value!r}")
    return {key: default for key, (default, _) in known.items()} | values


def check_unit(path: Path, like: bench.Scenario) -> None:
    """Refuses a bench scenario whose unit the target test cannot make. Raises PlanError."""
    for section, values in like.unit.items():
        for key, value in values.items():
            if key not in SUPPORTED.get(section, []) and value != bench.UNIT[section][key][0]:
                raise PlanError(f"{path}: like: {like.name} has {section}.{key} = {value!r}, which cannot be made here")
    if like.unit["board"]["link"] not in ("up", "down"):
        raise PlanError(f"{path}: like: the target test knows a board link that is up or down, no other")
