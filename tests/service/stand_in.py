"""A shell program of the service on stand-in tools."""

import shutil
from pathlib import Path

from bench.makers.files import write_script

ROOT = Path(__file__).parents[2]


class StandIn:
    """A folder UNIT with a copy of the program, its tools in `bin` and the notes of the run in `run`.

    `changes` are the parts of the program that depend on the unit.
    """

    def __init__(self, folder: Path, program: str, tools: dict[str, str], changes: dict[str, str]) -> None:
        self.folder = folder
        self.program = program
        (folder / "bin").mkdir()
        (folder / "run").mkdir()
        self.environment = {
            "PATH": f"{folder}/bin:/usr/bin:/bin",
            "UNIT": str(folder),
            "RUNTIME_DIRECTORY": str(folder / "run"),
        }
        for name, text in tools.items():
            write_script(self.folder / "bin" / name, text)
        shutil.copy(ROOT / "service" / program, self.folder)
        self.change(changes)

    def change(self, changes: dict[str, str]) -> None:
        """Changes lines of the program."""
        program = self.folder / self.program
        for old, new in changes.items():
            text = program.read_text()
            assert old in text
            program.write_text(text.replace(old, new))

    def calls(self, *tools: str) -> list[str]:
        """The calls of the named tools, or of all."""
        path = self.folder / "calls"
        lines = path.read_text().splitlines() if path.exists() else []
        return [line for line in lines if not tools or line.split()[0] in tools]
