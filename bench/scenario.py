"""Scenario files: a unit before an update, and the expected result. docs/bench.md explains how to add one.

The dataclasses are the sections of a file: their fields are its keys, with defaults and allowed values.
"""

import re
from dataclasses import dataclass, field, fields
from pathlib import Path
from typing import Any, Literal, get_args, get_type_hints

import tomllib

from bench.expected import expected_commands, expected_log
from bench.fields import FieldError, check, fill
from bench.makers.board import TEXT as VERSION_FILE

FOLDER = Path(__file__).parent / "scenarios"

Tool = Literal["systemctl", "umount", "rm", "ls", "apt", "apt-cache", "ssh", "scp", "i2cset", "aplay"]
TOOLS: tuple[Tool, ...] = get_args(Tool)


@dataclass
class Package:
    """The head's own package."""

    installed: str = "1.2.0"  # "(none)": known but not installed
    offered: str = "1.3.0"  # by the repository; equal to installed, newer or older
    known: bool = True  # False: no repository and no installation knows the package
    # fails: its maintainer script exits 1. asks: it has a question and nobody answers.
    # locked: another package tool holds the database for some seconds.
    install: Literal["works", "fails", "asks", "locked"] = "works"
    downgrades: bool = False  # apt is told to replace a newer version by an older one


@dataclass
class Mirrors:
    """The package mirrors."""

    # Their fault: apt exits 100. All but "unreachable" need a server, for signed release files.
    refresh: Literal["works", "unreachable", "wrong-key", "expired", "not-yet-valid", "half-synchronised"] = "works"
    # file: a folder, not signed. Signed, over HTTP: stalls: in the middle of the package. slow: 8 kbit/s.
    server: Literal["file", "http", "stalls", "slow"] = "file"


@dataclass
class Board:
    """The coprocessor board and the link to it."""

    installed: str = "2.1.0"
    # text of /root/App/AppExe/version.txt; "{version}" is replaced by `installed`. "" means that there is no file.
    version_file: str = VERSION_FILE
    # lost: gone after the version was read, before the first upload. dies: gone in the middle of the upload.
    link: Literal["up", "down", "hangs", "slow", "lost", "dies"] = "up"
    login: Literal["accepted", "key-refused", "host-key-changed"] = "accepted"
    disk: Literal["free", "full"] = "free"  # full: the archive does not fit
    uploads_lost: int = 0  # that many upload attempts fail before one succeeds
    # hangs-up: it ends the connection. never-returns: ended by the scenario some real seconds later.
    script: Literal["works", "fails", "hangs-up", "never-returns"] = "works"


@dataclass
class Stick:
    """The USB stick."""

    inserted: bool = True
    directories: list[str] = field(default_factory=lambda: ["quorb2.2.0"])  # version directories under debs/QUORB/armhf
    # debs/installTV. unreadable: ls exits with a code that no file system causes.
    teamviewer: Literal["absent", "file", "directory", "unreadable"] = "absent"
    pulled_out: Literal["never", "before-upload"] = "never"


@dataclass
class Head:
    """The head."""

    marker: bool = True  # /root/RESOURCES/tavren1stboot
    harl: Literal["known", "unknown"] = "known"  # to the service manager
    panel: Literal["present", "absent"] = "present"  # the LED controller on its bus
    sound: Literal["present", "absent"] = "present"  # the sound device
    teamviewer_script: Literal["works", "fails", "absent"] = "works"


@dataclass
class Tools:
    """The tools that the updater runs."""

    missing: list[Tool] = field(default_factory=list)  # not on the search path
    killed: list[Tool] = field(default_factory=list)  # a signal ends them, with the shell that ran them


@dataclass
class Updater:
    """The updater and what happens to it."""

    program: Literal["remote", "main"] = "remote"  # main: examples/main-head
    answer: str = "all"  # of the main head's operator to the offered list; "" no answer
    arguments: list[str] = field(default_factory=list)
    children: Literal["waited-for", "ignored"] = "waited-for"  # ignored: started with SIGCHLD ignored
    # by the service manager. at-its-end: by its own last command. in-install: while the package is being installed.
    stopped: Literal["never", "at-its-end", "in-install"] = "at-its-end"

    @property
    def input(self) -> str:
        """What the program reads on standard input; the remote head's program has no operator."""
        return f"{self.answer}\n" if self.program == "main" and self.answer else ""


@dataclass
class Setup:
    """A unit before an update."""

    package: Package = field(default_factory=Package)
    mirrors: Mirrors = field(default_factory=Mirrors)
    board: Board = field(default_factory=Board)
    stick: Stick = field(default_factory=Stick)
    head: Head = field(default_factory=Head)
    tools: Tools = field(default_factory=Tools)
    updater: Updater = field(default_factory=Updater)


@dataclass
class Expect:
    """The expected result."""

    status: list[int]  # exit codes, or minus signal numbers, that the updater may end with
    # LED: colour at the end; LEDs that are not named are dark. any: whatever is lit has this colour.
    panel: dict[str, str]
    sound: Literal["", "pass", "fail"]  # the one sound that was played to its end
    commands: list[str]  # all but the panel's and the sound's, in order: names in expected.py, " x20" repeats one
    waits: list[int]  # s, in order, without those of the flashing thread
    # of the update's thread, a line each: the operation's name, a colon, the message. "(name ...)" is a block of
    # expected.py, "(N more)" repeats the line above, "{name}" is a command of expected.py, "..." matches any records,
    # or at a line's end any rest of it.
    log: str
    package: str
    board: str
    marker: bool
    stick: bool
    harl: Literal["active", "inactive", "unknown"]


class ScenarioError(Exception):
    """A scenario that does not exist or cannot be used; the text is one line with the file and the reason."""


@dataclass
class Scenario:
    """One scenario."""

    name: str
    summary: str
    only: Literal["", "real", "stand-in"]  # the one kind of unit that can serve it; "" both
    setup: Setup
    expect: Expect


def variables(setup: Setup) -> dict[str, str]:
    """The setup as variables for shell scripts, such as BOARD_LINK; lists as words."""
    found = {}
    for section in fields(setup):
        for key, value in vars(getattr(setup, section.name)).items():
            text = " ".join(value) if isinstance(value, list) else str(value)
            found[f"{section.name}_{key}".upper()] = text.lower() if isinstance(value, bool) else text
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

    try:
        return _scenario(path.stem, content)
    except FieldError as error:
        raise ScenarioError(f"{path}:{_line_of(text, error.key)}: {error}") from error


def _scenario(name: str, content: dict[str, Any]) -> Scenario:
    """The scenario of a file with this content. Raises FieldError."""
    for key in ("summary", "expect"):
        if key not in content:
            raise FieldError(key, "is missing")
    types = get_type_hints(Scenario)
    summary, only, expect = content.pop("summary"), content.pop("only", ""), content.pop("expect")
    for key, value, allowed in (("summary", summary, str), ("expect", expect, dict), ("only", only, types["only"])):
        check(key, value, allowed)
    sections = get_type_hints(Setup)
    setup = Setup()
    for section, values in content.items():
        if section not in sections:
            raise FieldError(section, f"not known; the sections are {', '.join(sections)} and expect")
        check(section, values, dict)
        setattr(setup, section, fill(sections[section], f"{section}.", values))
    for key, file_names in (
        ("stick.directories", setup.stick.directories),
        ("package.installed", [setup.package.installed]),
        ("package.offered", [setup.package.offered]),
    ):
        for file_name in file_names:
            if "/" in file_name or file_name in ("", ".", ".."):
                raise FieldError(key, f"must be fit for the name of a file, not {file_name!r}")
    return Scenario(name, summary, only, setup, expectations(expect))


def expectations(values: dict[str, Any]) -> Expect:
    """The expected result, from the section of a file. Raises FieldError."""
    expect = fill(Expect, "expect.", values)
    try:
        expected_commands(expect.commands)
    except ValueError as error:
        raise FieldError("expect.commands", str(error)) from error
    try:
        expected_log(expect.log)
    except ValueError as error:
        raise FieldError("expect.log", str(error)) from error
    return expect


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
