"""A shell program of the service on stand-in tools."""

import shutil
import tempfile
import unittest
from pathlib import Path

from bench.makers.files import write_script

ROOT = Path(__file__).parents[2]


class StandInTest(unittest.TestCase):
    """A folder UNIT with a copy of the program, its tools in `bin` and the notes of the run in `run`."""

    program: str
    tools: dict[str, str]
    changes: dict[str, str]  # the parts of the program that depend on the unit

    def setUp(self) -> None:
        folder = tempfile.TemporaryDirectory(prefix=f"{self.program}-")
        self.addCleanup(folder.cleanup)
        self.unit = Path(folder.name)
        (self.unit / "bin").mkdir()
        (self.unit / "run").mkdir()
        self.environment = {
            "PATH": f"{self.unit}/bin:/usr/bin:/bin",
            "UNIT": str(self.unit),
            "RUNTIME_DIRECTORY": str(self.unit / "run"),
        }
        for name, text in self.tools.items():
            write_script(self.unit / "bin" / name, text)
        shutil.copy(ROOT / "service" / self.program, self.unit)
        self.change(self.changes)

    def change(self, changes: dict[str, str]) -> None:
        """Changes lines of the program."""
        program = self.unit / self.program
        for old, new in changes.items():
            text = program.read_text()
            self.assertIn(old, text)
            program.write_text(text.replace(old, new))

    def calls(self, *tools: str) -> list[str]:
        """The calls of the named tools, or of all."""
        path = self.unit / "calls"
        lines = path.read_text().splitlines() if path.exists() else []
        return [line for line in lines if not tools or line.split()[0] in tools]
