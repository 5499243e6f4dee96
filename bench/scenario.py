"""Scenario files: what a unit is like before an update, and what must come out. docs/bench.md tells how to add one."""

import re
from dataclasses import dataclass
from pathlib import Path
from typing import Any

import tomllib

from bench.expected import expected_commands, expected_log

FOLDER = Path(__file__).parent / "scenarios"
TOOLS = ["systemctl", "umount", "rm", "ls", "apt", "apt-cache", "ssh", "scp", "i2cset", "aplay"]

# Section, key: what stands when a file says nothing, and what else it may say. A list is a choice; a type is any value
# of that type.
UNIT: dict[str, dict[str, tuple[Any, Any]]] = {
    "package": {
        "installed": ("1.2.0", str),  # "(none)": known but not installed
        "offered": ("1.3.0", str),  # by the repository; equal to installed, newer or older
        "known": (True, bool),  # False: no repository and no installation knows the package
        # fails: its maintainer script exits 1. asks: it has a question and nobody answers.
        # locked: another package tool holds the database for some seconds.
        "install": ("works", ["works", "fails", "asks", "locked"]),
    },
    "mirrors": {
        "refresh": ("works", ["works", "unreachable"]),  # unreachable: apt exits 100
    },
    "board": {
        "installed": ("2.1.0", str),
        # text of /root/App/AppExe/version.txt; "{version}" stands for `installed`. "" means that there is no file.
        "version_file": ("Name\tQuorb\r\nBrimvale\t{version}\r\n", str),
        # lost: gone after the version was read, before the first upload. dies: gone in the middle of the upload.
        "link": ("up", ["up", "down", "hangs", "slow", "lost", "dies"]),
        "login": ("accepted", ["accepted", "key-refused", "host-key-changed"]),
        "disk": ("free", ["free", "full"]),  # full: the archive does not fit
        "uploads_lost": (0, int),  # that many upload attempts fail before one succeeds
        # hangs-up: it ends the connection. never-returns: ended by the scenario some real seconds later.
        "script": ("works", ["works", "fails", "hangs-up", "never-returns"]),
    },
    "stick": {
        "inserted": (True, bool),
        "directories": (["quorb2.2.0"], list),  # version directories under debs/QUORB/armhf
        # debs/installTV. unreadable: ls exits with a code that no file system brings about.
        "teamviewer": ("absent", ["absent", "file", "directory", "unreadable"]),
        "pulled_out": ("never", ["never", "before-upload"]),
    },
    "head": {
        "marker": (True, bool),  # /root/RESOURCES/tavren1stboot
        "harl": ("known", ["known", "unknown"]),  # to the service manager
        "panel": ("present", ["present", "absent"]),  # the LED controller on its bus
        "sound": ("present", ["present", "absent"]),  # the sound device
        "teamviewer_script": ("works", ["works", "fails", "absent"]),
    },
    "tools": {
        "missing": ([], list),  # not on the search path
        "killed": ([], list),  # a signal ends them, with the shell that ran them
    },
    "updater": {
        "program": ("remote", ["remote", "main"]),  # main: the main-head driver
        "arguments": ([], list),
        "children": ("waited-for", ["waited-for", "ignored"]),  # ignored: started with SIGCHLD ignored
        # by the service manager. at-its-end: by its own last command. in-install: while the package is being installed.
        "stopped": ("at-its-end", ["never", "at-its-end", "in-install"]),
    },
}

EXPECT: dict[str, Any] = {
    "status": list,  # exit codes, or minus signal numbers, that the updater may end with
    # LED: colour at the end; LEDs that are not named are dark. any: whatever is lit has this colour.
    "panel": dict,
    "sound": ["", "pass", "fail"],  # the one sound that was played to its end
    "commands": list,  # all but the panel's and the sound's, in order: names in expected.py, " x20" repeats one
    "waits": list,  # s, in order, those of the flashing thread left out
    # of the update's thread, a line each: the operation's name, a colon, the message. "(name ...)" stands for a block
    # of expected.py, "(N more)" repeats the line above, "{name}" is a command of expected.py, "..." stands for any
    # records, and at a line's end for any rest of it.
    "log": str,
    "package": str,
    "board": str,
    "marker": bool,
    "stick": bool,
    "harl": ["active", "inactive", "unknown"],
}

# What an entry of each list may be.
ENTRIES: dict[str, Any] = {
    "stick.directories": str,
    "tools.missing": TOOLS,
    "tools.killed": TOOLS,
    "updater.arguments": str,
    "expect.status": int,
    "expect.commands": str,
    "expect.waits": int,
}


class ScenarioError(Exception):
    """A scenario that does not exist or cannot be used; the text is one line with the file and the reason."""


@dataclass
class Scenario:
    """One scenario: `unit[section][key]` is complete, with the defaults of UNIT; `expect` holds what the file says."""

    name: str
    summary: str
    only: str  # "real" or "stand-in": the one kind of unit that can serve it; "" both
    unit: dict[str, dict[str, Any]]
    expect: dict[str, Any]


def variables(unit: dict[str, dict[str, Any]]) -> dict[str, str]:
    """The unit of a scenario as variables for shell scripts, such as BOARD_LINK; lists as words."""
    found = {}
    for section, values in unit.items():
        for key, value in values.items():
            text = " ".join(value) if isinstance(value, list) else str(value)
            found[f"{section}_{key}".upper()] = text.lower() if isinstance(value, bool) else text
    return found


def names() -> list[str]:
    """The names of all scenarios, in order."""
    return sorted(path.stem for path in FOLDER.glob("*.toml"))


def load(name: str) -> Scenario:
    """Reads the scenario `name`: one of those in the folder, or a file's path ending in .toml. Raises ScenarioError."""
    if name.endswith(".toml"):
        return read(Path(name))
    if name not in names():
        raise ScenarioError(f"no scenario {name!r}: bench/run --list shows all")
    return read(FOLDER / f"{name}.toml")


def read(path: Path) -> Scenario:
    """Reads the scenario file `path`. Raises ScenarioError."""
    try:
        text = path.read_text(encoding="utf-8")
        content = tomllib.loads(text)
    except OSError as error:
        raise ScenarioError(f"{path}: {error.strerror}") from error
    except UnicodeError as error:
        raise ScenarioError(f"{path}: is no UTF-8 text: {error}") from error
    except tomllib.TOMLDecodeError as error:
        # The message ends in "(at line 3, column 7)" or "(at end of document)".
        place = re.search(r" \(at (?:line (\d+), column \d+|end of document)\)$", str(error))
        line = int(place[1]) if place and place[1] else len(text.splitlines())
        raise ScenarioError(f"{path}:{line}: {str(error)[: place.start()] if place else error}") from error

    def fail(key: str, reason: str) -> ScenarioError:
        return ScenarioError(f"{path}:{_line_of(text, key)}: {key}: {reason}")

    def check(key: str, value: Any, allowed: Any) -> None:
        if isinstance(allowed, list):
            if value not in allowed:
                raise fail(key, f"must be one of {', '.join(map(repr, allowed))}, not {value!r}")
        elif type(value) is not allowed:
            raise fail(key, f"must be of type {allowed.__name__}, not {value!r}")
        elif "\0" in str(value):
            raise fail(key, "must be without null characters")
        elif allowed is list:
            for entry in value:
                check(key, entry, ENTRIES[key])

    for key in ("summary", "expect"):
        if key not in content:
            raise fail(key, "is missing")
    summary, expect = content.pop("summary"), content.pop("expect")
    check("summary", summary, str)
    check("expect", expect, dict)
    only = content.pop("only", "")
    check("only", only, ["", "real", "stand-in"])
    unit = {section: {key: default for key, (default, _) in keys.items()} for section, keys in UNIT.items()}
    for section, values in content.items():
        if section not in UNIT:
            raise fail(section, f"not known; the sections are {', '.join(UNIT)} and expect")
        check(section, values, dict)
        for key, value in values.items():
            if key not in UNIT[section]:
                raise fail(f"{section}.{key}", f"not known; the keys are {', '.join(UNIT[section])}")
            check(f"{section}.{key}", value, UNIT[section][key][1])
            unit[section][key] = value
    package = unit["package"]
    for key, file_names in (
        ("stick.directories", unit["stick"]["directories"]),
        ("package.installed", [package["installed"]]),
        ("package.offered", [package["offered"]]),
    ):
        for name in file_names:
            if "/" in name or name in ("", ".", ".."):
                raise fail(key, f"must be fit for the name of a file, not {name!r}")
    for key in expect:
        if key not in EXPECT:
            raise fail(f"expect.{key}", f"not known; the keys are {', '.join(EXPECT)}")
    for key, allowed in EXPECT.items():
        if key not in expect:
            raise fail(f"expect.{key}", "is missing")
        check(f"expect.{key}", expect[key], allowed)
    for key, write_out in (("commands", expected_commands), ("log", expected_log)):
        try:
            write_out(expect[key])
        except ValueError as error:
            raise fail(f"expect.{key}", str(error)) from error
    return Scenario(path.stem, summary, only, unit, expect)


def _line_of(text: str, name: str) -> int:
    """The number of the line with the key or section `name`, such as "board.link"; otherwise of its section."""
    section, _, key = name.rpartition(".")
    found, inside = 1, ""
    for number, line in enumerate(text.splitlines(), 1):
        if header := re.match(r"\s*\[([^\]]*)\]", line):
            inside = header[1].strip()
            if inside == (section or key):
                found = number
        elif inside == section and re.match(rf"\s*{re.escape(key)}\s*=", line):
            return number
    return found
