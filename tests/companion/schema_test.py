"""Usage: schema_test.py TOOL

Holds what each command prints with --json against docs/harl-updater-tool.schema.json.
"""

import json
import subprocess
import sys
import tempfile
import unittest
from pathlib import Path

import jsonschema  # of Debian's python3-jsonschema

ROOT = Path(__file__).resolve().parents[2]
GOLDEN = ROOT / "tests/companion/golden/log"
SCHEMA = json.loads((ROOT / "docs/harl-updater-tool.schema.json").read_text())
TOOL = ""


def printed(*arguments: str) -> str:
    """What the tool prints."""
    done = subprocess.run([TOOL, *arguments], stdin=subprocess.DEVNULL, capture_output=True, timeout=60, check=False)
    return done.stdout.decode()


class Schema(unittest.TestCase):
    """The objects are as described."""

    def setUp(self) -> None:
        jsonschema.Draft202012Validator.check_schema(SCHEMA)
        self.validator = jsonschema.Draft202012Validator(SCHEMA)

    def expect_valid(self, *arguments: str) -> None:
        lines = "--follow" in arguments or arguments[0] == "fleet"
        for text in printed(*arguments).splitlines() if lines else [printed(*arguments)]:
            with self.subTest(arguments):
                self.validator.validate(json.loads(text))

    def test_logs(self) -> None:
        for log in sorted(GOLDEN.glob("*.log")):
            self.expect_valid("log", "--json", str(log))
        self.expect_valid("log", "--json", "/dev/null")
        self.expect_valid("log", "--json", "/nonexistent")
        self.expect_valid("log", "--json", "--follow", "/dev/null")

    def test_fleets(self) -> None:
        self.expect_valid("fleet", "--json", str(GOLDEN))
        self.expect_valid("fleet", "--json", "--since", "2026-11-21", "/dev/null", "/nonexistent")

    def test_sticks_and_catalogue(self) -> None:
        with tempfile.TemporaryDirectory() as folder:
            self.expect_valid("stick", "--json", folder)
            self.expect_valid("report", "--json", f"{folder}/none/report.tar.gz")
        self.expect_valid("stick", "--json", "/nonexistent")
        self.expect_valid("check", "--json", "/nonexistent")
        self.expect_valid("explain", "--json")
        self.expect_valid("explain", "--json", "mirrors-expired")
        self.expect_valid("explain", "--json", "nonsense")

    def test_wrong_usage(self) -> None:
        self.expect_valid("log", "--json", "--nonsense")
        self.expect_valid("--json")

    def test_another_object_is_not_valid(self) -> None:
        run = json.loads(printed("log", "--json", str(GOLDEN / "up-to-date.log")))
        del run["runs"][0]["outcome"]
        self.assertFalse(self.validator.is_valid(run))


if __name__ == "__main__":
    TOOL = sys.argv.pop()
    unittest.main()
