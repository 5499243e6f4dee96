"""Holds what each command prints with --json against docs/harl-updater-tool.schema.json."""

import json
from collections.abc import Callable
from pathlib import Path

import jsonschema  # of Debian's python3-jsonschema
import pytest

from tests.commands import run_command

ROOT = Path(__file__).parents[2]
GOLDEN = ROOT / "tests/companion/golden/log"
SCHEMA = json.loads((ROOT / "docs/harl-updater-tool.schema.json").read_text())
VALIDATOR = jsonschema.Draft202012Validator(SCHEMA)
COMMANDS = [
    *(f"log --json {log.name}" for log in sorted(GOLDEN.glob("*.log"))),
    "log --json /dev/null",
    "log --json /nonexistent",
    "log --json --follow /dev/null",
    "fleet --json .",
    "fleet --json --since 2026-11-21 /dev/null /nonexistent",
    "stick --json EMPTY",
    "report --json EMPTY/none/report.tar.gz",
    "stick --json /nonexistent",
    "check --json /nonexistent",
    "explain --json",
    "explain --json mirrors-expired",
    "explain --json nonsense",
    # Wrong usage.
    "log --json --nonsense",
    "--json",
]
Printed = Callable[[str], str]


@pytest.fixture
def printed(tool: Path) -> Printed:
    """What the tool prints for the words after its name."""

    def print_for(words: str) -> str:
        return run_command(tool, *words.split(), folder=GOLDEN).stdout

    return print_for


def test_schema_is_one() -> None:
    jsonschema.Draft202012Validator.check_schema(SCHEMA)


@pytest.mark.parametrize("command", COMMANDS)
def test_objects_are_as_described(printed: Printed, tmp_path: Path, command: str) -> None:
    text = printed(command.replace("EMPTY", str(tmp_path)))
    has_lines = "--follow" in command or command.startswith("fleet")
    for part in text.splitlines() if has_lines else [text]:
        VALIDATOR.validate(json.loads(part))


def test_another_object_is_not_valid(printed: Printed) -> None:
    run = json.loads(printed("log --json up-to-date.log"))
    del run["runs"][0]["outcome"]
    assert not VALIDATOR.is_valid(run)
