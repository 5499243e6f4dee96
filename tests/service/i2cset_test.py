"""The service's i2cset before either kind of the real one."""

import subprocess
import tempfile
import unittest
from pathlib import Path

from bench.makers.files import write_script
from bench.makers.i2cset import NEWER, OLDER

I2CSET = Path(__file__).parents[2] / "service/i2cset"
SEND = 'echo "$*" >>"$SENT"\nexit "$STATUS"'
OLD = OLDER + SEND
NEW = NEWER + SEND


class I2cset(unittest.TestCase):
    """One folder with the real tool, one for what the service notes."""

    def setUp(self) -> None:
        folder = tempfile.TemporaryDirectory(prefix="i2cset-")
        self.addCleanup(folder.cleanup)
        self.folder = Path(folder.name)
        (self.folder / "tools").mkdir()
        (self.folder / "notes").mkdir()

    def send(self, real: str, *arguments: str, status: int = 0, notes: bool = True) -> subprocess.CompletedProcess[str]:
        """Runs the service's i2cset as the updater does, found in the search path."""
        write_script(self.folder / "tools/i2cset", real)
        environment = {
            "PATH": f"{I2CSET.parent}:{self.folder}/tools:/usr/bin:/bin",
            "SENT": str(self.folder / "sent"),
            "STATUS": str(status),
        }
        if notes:
            environment["RUNTIME_DIRECTORY"] = str(self.folder / "notes")
        return subprocess.run(["i2cset", *arguments], env=environment, capture_output=True, text=True, check=False)

    def sent(self) -> list[str]:
        """What reached the bus."""
        path = self.folder / "sent"
        return path.read_text().splitlines() if path.exists() else []

    def outcome_noted(self) -> bool:
        """Whether give-back will find an outcome."""
        return (self.folder / "notes/outcome").exists()

    def test_both_kinds_get_the_same_bytes(self) -> None:
        for real in (OLD, NEW):
            for byte in ("0x12", "0x1"):
                self.assertEqual(self.send(real, "-y", "0", "0x07", byte, "c").returncode, 0)
        self.assertEqual(self.sent(), ["-y 0 0x07 0x12 c", "-y 0 0x07 0x1 c"] * 2)

    def test_status_and_errors_are_the_real_ones(self) -> None:
        for real in (OLD, NEW):
            self.assertEqual(self.send(real, "-y", "0", "0x07", "0x12", "c", status=3).returncode, 3)

    def test_it_never_takes_itself_for_the_real_one(self) -> None:
        own = str(I2CSET.parent)
        for path in (own, f"{own}:{own}/", f"{own}/.:{own}"):
            command = ["i2cset", "-y", "0", "0x07", "0x12", "c"]
            done = subprocess.run(
                command, env={"PATH": path}, capture_output=True, text=True, check=False, timeout=10
            )
            self.assertEqual(done.returncode, 127)
            self.assertIn("install i2c-tools", done.stderr)

    def test_outcome_is_noted(self) -> None:
        for byte in ("0x2", "0x8"):
            for real in (OLD, NEW):
                self.send(real, "-y", "0", "0x07", byte, "c")
                self.assertTrue(self.outcome_noted())
                (self.folder / "notes/outcome").unlink()

    def test_nothing_else_is_noted(self) -> None:
        for byte in ("0x12", "0x14", "0x0", "0x1", "0x40", "0x80", "0xC0", "0xc2"):
            self.send(NEW, "-y", "0", "0x07", byte, "c")
        self.send(NEW, "-y", "0", "0x07", "0x2", "c", status=1)
        self.assertFalse(self.outcome_noted())

    def test_works_outside_the_service(self) -> None:
        self.assertEqual(self.send(NEW, "-y", "0", "0x07", "0x2", "c", notes=False).returncode, 0)
        self.assertEqual(self.sent(), ["-y 0 0x07 0x2 c"])

    def test_installed_tool_accepts_the_address(self) -> None:
        real = Path("/usr/sbin/i2cset")
        if not real.exists():
            self.skipTest("no i2c-tools here")
        # A bus that does not exist: the arguments are judged before it is opened.
        done = self.send(f'exec {real} "$@"', "-y", "9999", "0x07", "0x12", "c")
        self.assertIn("No such file or directory", done.stderr)


if __name__ == "__main__":
    unittest.main()
