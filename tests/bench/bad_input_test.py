"""Bad input of bench/run and of other commands: one clear line, status 2 or 1, and nothing run."""

import os
import re
import sys
from pathlib import Path

import pytest

from bench.expected import BLOCKS, COMMANDS
from tests.commands import run_command

ROOT = Path(__file__).parents[2]
GOOD = (ROOT / "bench/scenarios/up-to-date.toml").read_text()
EARLY_END = GOOD[: GOOD.rindex("'''")]
SECTIONS = "package, mirrors, board, stick, head, tools, updater"
KEYS = "installed, version_file, link, login, disk, uploads_lost, script"
TOOLS = "'systemctl', 'umount', 'rm', 'ls', 'apt', 'apt-cache', 'ssh', 'scp', 'i2cset', 'aplay'"


def line_of(text: str, key: str) -> int:
    """The line of `key` under [expect]."""
    return next(number for number, line in enumerate(text.splitlines(), 1) if line.startswith(f"{key} ="))


# The file's text, the line and the whole reason.
WRONG_FILES = {
    "no-toml": (GOOD.replace("[board]", "[board"), 6, "Expected ']' at the end of a table declaration"),
    "early-end": (EARLY_END, len(EARLY_END.splitlines()), "Expected \"'''\""),
    "section": (GOOD.replace("[board]", "[bord]"), 6, f"bord: not known; the sections are {SECTIONS} and expect"),
    "missing-expectation": (GOOD.replace("marker = true\n", ""), 9, "expect.marker: is missing"),
}
# A seventh line, below that of its section, and the reason, which names both.
WRONG_LINES = {
    'colour = "red"': f"board.colour: not known; the keys are {KEYS}",
    'disk = "none"': "board.disk: must be one of 'free', 'full', not 'none'",
    'uploads_lost = "3"': "board.uploads_lost: must be of type int, not '3'",
    'version_file = "a\\u0000b"': "board.version_file: must be without null characters",
    "directories = [3]": "stick.directories: must be of type str, not 3",
    'directories = ["../quorb"]': "stick.directories: must be fit for the name of a file, not '../quorb'",
    'missing = ["nope"]': f"tools.missing: must be one of {TOOLS}, not 'nope'",
    'killed = ["nope"]': f"tools.killed: must be one of {TOOLS}, not 'nope'",
}
# Under [expect]: what is replaced, by what, and the reason, which begins with the key.
WRONG_EXPECTATIONS = {
    "status": (r"status = .*", 'status = ["0"]', "status: must be of type int, not '0'"),
    "number": ('"stop-harl"', '"stop-harl xtwo"', "commands: 'stop-harl xtwo': no number after the x"),
    "command": ('"stop-harl"', '"stop"', f"commands: no command 'stop'; there are {', '.join(COMMANDS)}"),
    "type": (r"commands = \[[^]]*\]", "commands = [3]", "commands: must be of type str, not 3"),
    "block": (r"\(opening 0\)", "(nothing 0)", f"log: no block 'nothing'; there are {', '.join(BLOCKS)}"),
    "values": (r"\(opening 0\)", "(opening)", "log: block 'opening': values after the name: must be 1, not 0"),
    "log": (r"\(opening 0\)", "runProcess: {stop}", f"log: no command 'stop'; there are {', '.join(COMMANDS)}"),
}


def bench(*arguments: str | Path, **variables: str) -> tuple[int, str, str]:
    """Status, output and errors of bench/run."""
    done = run_command(sys.executable, "-B", "-m", "bench", *arguments, environment=os.environ | variables)
    return done.returncode, done.stdout, done.stderr


def check_file(file: Path, text: str, line: int, reason: str) -> None:
    file.write_text(text)
    assert bench(file) == (2, "", f"bench: {file}:{line}: {reason}\n")


def check_words(reason: str, *arguments: str | Path) -> None:
    """The usage comes before the reason."""
    status, shown, message = bench(*arguments)
    assert (status, shown) == (2, "")
    assert message[message.rindex("bench/run: ") :] == f"bench/run: error: {reason}\n"


@pytest.fixture
def build(tmp_path: Path) -> Path:
    """A build folder whose updater cannot run."""
    build = tmp_path / "build"
    build.mkdir()
    (build / "harl-updater").touch()
    return build


@pytest.mark.parametrize("text, line, reason", WRONG_FILES.values(), ids=WRONG_FILES)
def test_file(tmp_path: Path, text: str, line: int, reason: str) -> None:
    check_file(tmp_path / "scenario.toml", text, line, reason)


@pytest.mark.parametrize("line, reason", WRONG_LINES.items(), ids=WRONG_LINES)
def test_line(tmp_path: Path, line: str, reason: str) -> None:
    section = reason.split(".")[0]
    lines = f"[board]\n{line}\n" if section == "board" else f"[{section}]\n{line}\n\n[board]\n"
    check_file(tmp_path / "scenario.toml", GOOD.replace("[board]\n", lines), 7, reason)


@pytest.mark.parametrize("old, new, reason", WRONG_EXPECTATIONS.values(), ids=WRONG_EXPECTATIONS)
def test_expectation(tmp_path: Path, old: str, new: str, reason: str) -> None:
    text = re.sub(old, new, GOOD)
    check_file(tmp_path / "scenario.toml", text, line_of(text, reason.split(":")[0]), f"expect.{reason}")


def test_unknown_scenario() -> None:
    assert bench("nothing") == (2, "", "bench: no scenario 'nothing': bench/run --list shows all\n")


def test_no_such_file(tmp_path: Path) -> None:
    file = tmp_path / "none.toml"
    assert bench(file) == (2, "", f"bench: {file}: No such file or directory\n")


@pytest.mark.parametrize("name", ["none/page.html", "", "build/harl-updater/page.html"])
def test_page_that_cannot_be_written(tmp_path: Path, build: Path, name: str) -> None:
    check_words(f"--record: {tmp_path / name} cannot be written", "--record", tmp_path / name, "up-to-date")


def test_page_of_many_scenarios(tmp_path: Path) -> None:
    file = tmp_path / "file"
    file.touch()
    check_words(f"--record: {file} cannot be a folder: File exists", "--all", "--record", file)


@pytest.mark.parametrize("option", ["--all", "--list"])
def test_scenario_beside(option: str) -> None:
    check_words(f"argument scenario: not allowed with argument {option}", option, "up-to-date")


@pytest.mark.parametrize("speed", ["nan", "inf", "-inf", "0", "0.99"])
def test_speed(speed: str) -> None:
    check_words("--speed: must be a number, 1 or more", f"--speed={speed}")


def test_build_that_is_none(tmp_path: Path) -> None:
    reason = f"--build: {tmp_path} holds no harl-updater: build it there or leave --build out"
    check_words(reason, "--build", tmp_path)


def test_paths_count_from_where_the_user_is(tmp_path: Path) -> None:
    done = run_command(ROOT / "bench/run", "scenario.toml", folder=tmp_path)
    message = "bench: scenario.toml: No such file or directory\n"
    assert (done.returncode, done.stdout, done.stderr) == (2, "", message)
    (tmp_path / "scenario.toml").touch()
    done = run_command(ROOT / "bench/run", "scenario.toml", folder=tmp_path)
    assert (done.returncode, done.stderr) == (2, "bench: scenario.toml:1: summary: is missing\n")


@pytest.mark.skipif(os.geteuid() == 0, reason="root may write everywhere")
def test_temporary_folder_that_cannot_be_written(tmp_path: Path) -> None:
    tmp_path.chmod(0o500)
    status, _, message = bench("up-to-date", TMPDIR=str(tmp_path))
    assert (status, message.count("\n")) == (1, 1)


def test_too_little_space(tmp_path: Path, build: Path) -> None:
    command = f"{sys.executable} -B -m bench --build {build} --unit stand-in up-to-date"
    small = tmp_path / "small"
    small.mkdir()
    script = f"mount -t tmpfs -o size=3m small {small} || exit 77; TMPDIR={small} exec {command}"
    done = run_command("unshare", "--map-root-user", "--mount", "sh", "-c", script)
    if done.returncode == 77 or "unshare" in done.stderr:
        pytest.skip("this machine forbids namespaces")
    message = f"bench: 3 MB are free in {small}, a unit needs 20: make room there or name another TMPDIR\n"
    assert (done.returncode, done.stdout, done.stderr) == (1, "", message)


def test_missing_package(tmp_path: Path) -> None:
    for tool in ("env", "sh", "dirname", "id"):
        (tmp_path / tool).symlink_to(f"/usr/bin/{tool}")
    query = tmp_path / "dpkg-query"
    query.write_text('#!/bin/sh\nfor package; do :; done\n[ "$package" = alsa-utils ] || echo "ii "\n')
    query.chmod(0o755)
    # No apt-get on this search path, so that nothing is installed.
    status, shown, message = bench("up-to-date", PATH=str(tmp_path))
    assert status != 0
    assert "alsa-utils" in message
    assert "Unit:" not in shown


def test_packages_that_the_mirror_lacks(tmp_path: Path) -> None:
    done = run_command(ROOT / "scripts/unpack-packages", "none", tmp_path / "libraries", "libwrap0")
    assert done.returncode == 1
    reason = "is the Debian mirror in reach, and 100 MiB of room in"
    assert done.stderr.endswith(f"unpack-packages: could not fetch libwrap0 for none: {reason} {tmp_path}?\n")
    assert not any(tmp_path.iterdir())


NUMBERS = ["x", "0", "-1", "", "1 2", "9999999999"]
# Commands that would find nothing to run, or never end, and what is no argument of theirs.
WRONG_WORDS = {
    "tests/reliability/threads": NUMBERS,
    "fuzz/run": NUMBERS,
    "tests/companion/log/throughput": NUMBERS,
    "performance/processes": NUMBERS[:-1],
    "tests/reliability/interruption_real": ["nonsense"],
    "tests/companion/log/make-golden": ["nonsense"],
    "tests/companion/make-golden-checks": ["nonsense"],
    "tests/run-armhf": ["nonsense"],
}


@pytest.mark.parametrize("command, words", [(name, words) for name in WRONG_WORDS for words in WRONG_WORDS[name]])
def test_other_command(command: str, words: str) -> None:
    done = run_command(ROOT / command, *words.split(" "))
    assert (done.returncode, done.stdout) == (2, ""), done.stderr
    assert done.stderr.count("\n") == 1, done.stderr
