"""What bench/run shows of a run: on a terminal, on one without colours, and in a pipe."""

import os
import re
import sys
from pathlib import Path

import pytest

from tests.bench.terminal import Terminal
from tests.commands import run_command

COLOR = re.compile(r"\x1b\[[0-9;]*3[0-7][0-9;]*m")


def check_summary(text: str) -> None:
    summary = text[text.index("\nCommands\n") :]
    for line in (
        "Waits: 780 s in 2.6 s, 30 s in 0.2 s, 10 s in 0.2 s",
        "Outcome: updated",
        "Panel: PASS pass",
        "Sound: SND_RESULT_PASS.wav",
        "Package: 1.2.0 -> 1.3.0",
        "Board: 2.1.0 -> 2.2.0",
        "First-boot marker: gone",
        "Stick: released",
        "harl: active",
    ):
        assert f"\n{line}\n" in summary
    assert re.search(r"\n +\d+\.\d\d s +\d+\.\d\d s  apt --assume-yes install solvik4-rh\n", summary)
    assert re.search(r"\n +\d+\.\d\d s +ended  systemctl stop harl-updater\n", summary)
    assert re.search(r"\nUpdater: .+\nWall time: \d+\.\d s, set-up included\n$", summary)


@pytest.fixture
def command(build: Path) -> list[str]:
    """Runs a scenario that has both waits, both services' changes and each colour except red."""
    words = ["--build", str(build), "--unit", "stand-in", "package-and-board"]
    return [sys.executable, "-B", "-m", "bench", *words]


def on_terminal(command: list[str], *texts: str, **variables: str) -> str:
    """What a run writes that shows all these texts at once."""
    with Terminal(command, variables) as terminal:
        terminal.wait_for(*texts)
        terminal.wait_for_end()
    return terminal.written.decode().replace("\r\n", "\n")


def test_terminal(command: list[str]) -> None:
    services = "harl inactive  updater active  stick mounted  package 1.3.0  board 2.2.0"
    text = on_terminal(command, "[B]", services, "wait for the board", "s left")
    check_summary(re.sub(r"\x1b\[[0-9;]*m", "", text))
    assert COLOR.search(text)
    assert "\n\t\t\tBEFORE UPDATE\n" in text  # the log stays on the terminal


def test_terminal_without_colors(command: list[str]) -> None:
    text = on_terminal(command, "[P]", NO_COLOR="1")
    check_summary(text)
    assert not COLOR.search(text)


@pytest.mark.parametrize("name", ["dumb", "unknown-to-all"])
def test_terminal_that_cannot_move_its_cursor(command: list[str], name: str) -> None:
    text = on_terminal(command, "Wall time", TERM=name)
    check_summary(text)
    assert "\x1b" not in text


def test_pipe(command: list[str]) -> None:
    done = run_command(*command, environment=os.environ | {"TERM": "xterm"})
    assert (done.returncode, done.stderr) == (0, "")
    check_summary(done.stdout)
    assert "\x1b" not in done.stdout
    assert "    panel: REMOTE blue\n" in done.stdout
    assert "    panel: PASS pass\n" in done.stdout
    assert "Running command: ssh  -o ServerAliveInterval=4" in done.stdout
