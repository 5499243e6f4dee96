"""Usage: make_test.py PROGRAM

Makes sticks with `harl-updater-tool stick make`, signs and spoils them, and checks them with `stick`.
"""

import os
import pty
import shutil
import signal
import subprocess
import tempfile
import time
import unittest
from pathlib import Path

from bench.makers.files import write_script
from bench.makers.keys import make_key
from bench.makers.sticks import VERSIONS, zip_archive
from tests.command_line import skip, take_path

ROOT = Path(__file__).parents[3]
SCRIPT = "#!/bin/sh\nunzip -o root/OSUpgrade.zip\n"
MANIFEST = "harl-updater.manifest"


class Stick(unittest.TestCase):
    """A folder with what goes on a stick, and the stick."""

    program: Path

    def setUp(self) -> None:
        holder = tempfile.TemporaryDirectory(prefix="stick-", ignore_cleanup_errors=True)
        self.addCleanup(holder.cleanup)
        self.folder = Path(holder.name)
        self.stick = self.folder / "stick"
        self.stick.mkdir()
        self.archive = self.folder / "upgrade.zip"
        self.archive.write_bytes(zip_archive("2.2.0"))
        self.script = self.folder / "script.sh"
        self.script.write_text(SCRIPT)

    def command(self, *more: str, version: str = "2.2.0") -> list[str | Path]:
        """The command that makes the stick."""
        made: list[str | Path] = [self.program, "stick", "make", "--archive", self.archive, "--script", self.script]
        return [*made, "--version", version, *more, self.stick]

    def run_tool(self, command: list[str | Path], status: int) -> str:
        """What the command prints; it must end with the status."""
        environment = os.environ | {"GNUPGHOME": str(self.folder / "maker")}
        done = subprocess.run(
            command,
            env=environment,
            stdin=subprocess.DEVNULL,
            stdout=subprocess.PIPE,
            stderr=subprocess.STDOUT,
            text=True,
            check=False,
        )
        self.assertEqual(done.returncode, status, done.stdout)
        return done.stdout

    def make(self, *more: str, status: int = 0, version: str = "2.2.0") -> str:
        """Makes the stick; returns what is printed."""
        return self.run_tool(self.command(*more, version=version), status)

    def check(self, *more: str | Path, status: int = 0) -> str:
        """What `stick` says, in one line."""
        return " ".join(self.run_tool([self.program, "stick", *more, self.stick], status).split())

    def files(self) -> dict[str, bytes]:
        """All files of the stick."""
        found = sorted(path for path in self.stick.rglob("*") if path.is_file())
        return {str(path.relative_to(self.stick)): path.read_bytes() for path in found}


class Make(Stick):
    """What is written, what is refused, and what stays."""

    def test_writes_exactly_what_the_updater_expects(self) -> None:
        said = self.make()
        self.assertIn("is fit for an update", said)
        self.assertIn(f"plug it in again and run\n\n    harl-updater-tool stick {self.stick}\n", said)
        expected = {"OSUpgrade.zip": self.archive.read_bytes(), "unzipUpgrade.sh": SCRIPT.encode()}
        self.assertEqual(self.files(), {f"{VERSIONS}/quorb2.2.0/{name}": text for name, text in expected.items()})
        self.assertTrue(os.access(self.stick / VERSIONS / "quorb2.2.0/unzipUpgrade.sh", os.X_OK))
        self.check()

    def test_wrong_command_line(self) -> None:
        self.assertIn("TARGET is missing.", self.run_tool([self.program, "stick", "make"], 2))
        self.assertIn("--oldest", self.make("--oldest", "2.0.0", status=2))

    def test_teamviewer_is_a_plain_file(self) -> None:
        self.assertIn("requested", self.make("--teamviewer"))
        self.assertTrue((self.stick / "debs/installTV").is_file())

    def test_keeps_what_else_is_on_the_stick(self) -> None:
        (self.stick / "debs").mkdir()
        (self.stick / "debs/other").write_text("kept")
        (self.stick / "photo").write_text("kept")
        self.make()
        self.assertEqual({"photo", "debs/other"} & set(self.files()), {"photo", "debs/other"})

    def test_other_version_is_replaced_only_when_told(self) -> None:
        self.make(version="2.1.0")
        before = self.files()
        self.assertIn("quorb2.1.0\" is on the stick. Add --replace", self.make(status=2))
        self.assertEqual(self.files(), before)
        self.make("--replace")
        self.assertEqual({Path(path).parent.name for path in self.files()}, {"quorb2.2.0"})
        self.assertEqual(sorted(path.name for path in (self.stick / VERSIONS).iterdir()), ["quorb2.2.0"])

    def refused(self, says: str, status: int = 1, version: str = "2.2.0") -> None:
        """Nothing is written, and the reason is said."""
        before = self.files()
        self.assertIn(says, self.make(version=version, status=status))
        self.assertEqual(self.files(), before)
        self.assertEqual(list(self.stick.iterdir()), [])

    def test_refuses_what_stick_would_find_wrong(self) -> None:
        self.refused("[version-start]", version="-2.2.0")
        self.refused("[version-unusual]", version="2.2.0 b")
        self.refused("cannot be in the name of a folder", version="2:2", status=2)
        self.refused("cannot be in the name of a folder", version="2.2.", status=2)
        self.script.write_text("#!/bin/sh\necho\r\n")
        self.refused("[script-line-ends]")
        self.script.write_text("echo\n")
        self.refused("[script-first-line]")
        self.script.write_text(SCRIPT)
        self.archive.write_bytes(self.archive.read_bytes()[:-30])
        self.refused("[archive-")
        self.archive.write_bytes(b"")
        self.refused("is empty", status=2)
        with self.archive.open("wb") as file:
            file.truncate(1 << 32)
        self.refused("larger than a file on a stick can be", status=2)
        self.archive.unlink()
        self.refused("is missing", status=2)

    def test_refuses_what_is_in_the_way(self) -> None:
        (self.stick / VERSIONS).mkdir(parents=True)
        (self.stick / VERSIONS / "readme.txt").touch()
        self.assertIn("would be taken for the version", self.make(status=2))
        shutil.rmtree(self.stick / "debs")
        (self.stick / "debs").symlink_to(self.folder)
        self.assertIn("is no folder", self.make(status=2))
        self.assertFalse((self.folder / "QUORB").exists())

    def test_stick_that_was_pulled_out_is_recognised_and_made_again(self) -> None:
        for name in (".unfinished-quorb2.2.0", ".replaced-quorb2.1.0"):
            (self.stick / VERSIONS / name).mkdir(parents=True)
        self.assertIn("[no-version-folder]", said := self.check(status=1))
        self.assertIn("not written completely", said)
        self.make()
        self.assertEqual(os.listdir(self.stick / VERSIONS), ["quorb2.2.0"])

    def test_interruption_leaves_the_version_that_was_there(self) -> None:
        self.make(version="2.1.0")
        before = self.files()
        self.archive = self.big_archive()
        tool = subprocess.Popen(self.command("--replace"))
        while not (self.stick / VERSIONS / ".unfinished-quorb2.2.0").exists():
            self.assertIsNone(tool.poll())
            time.sleep(0.001)
        tool.send_signal(signal.SIGINT)
        self.assertEqual(tool.wait(), -signal.SIGINT)
        self.assertEqual(self.files(), before)

    def big_archive(self) -> Path:
        """An archive of 100 MB."""
        path = self.folder / "big.zip"
        (self.folder / "zeros").write_bytes(bytes(100_000_000))
        subprocess.run(["zip", "-0", "-q", "-j", path, self.folder / "zeros"], check=True)
        return path

    def test_full_stick_keeps_the_version_that_was_there(self) -> None:
        if os.geteuid() != 0:
            self.skipTest("only root can mount a small disk")
        if subprocess.run(["mount", "-t", "tmpfs", "-o", "size=2m", "stick", self.stick], check=False).returncode:
            self.skipTest("this machine forbids mounts")
        self.addCleanup(lambda: subprocess.run(["umount", self.stick], check=True))
        self.make(version="2.1.0")
        before = self.files()
        self.archive = self.big_archive()
        self.assertIn("has no room for 100.0 MB", self.make("--replace", status=2))
        self.assertEqual(self.files(), before)

    def test_terminal_shows_rate_and_time_left(self) -> None:
        parent, child = pty.openpty()
        self.archive = self.big_archive()
        subprocess.run(self.command(), stdout=subprocess.DEVNULL, stderr=child, check=True)
        os.close(child)
        shown = os.read(parent, 100_000).decode()
        os.close(parent)
        self.assertRegex(shown, r"\rComparing: 100 %, \d+ kB/s, 0 s left +\r\n$")


class Signed(Stick):
    """A signed stick, and what can be wrong with it."""

    def setUp(self) -> None:
        super().setUp()
        self.keyring = self.folder / "keys.gpg"
        make_key(self.folder / "maker", "maker", self.keyring)
        self.make("--sign", "maker", "--oldest", "2.0.0")

    def test_good_signature(self) -> None:
        text = (self.stick / MANIFEST).read_text()
        self.assertRegex(text, r"^Format: 1\nVersion: 2.2.0\nOldest: 2.0.0\nDate: \d{4}-\d\d-\d\dT.*Z\nSHA256:\n")
        size = self.archive.stat().st_size
        self.assertRegex(text, rf"\n [0-9a-f]{{64}} {size} {VERSIONS}/quorb2.2.0/OSUpgrade.zip\n")
        self.assertIn("Signature: good, of 20", self.check("--keyring", self.keyring))
        self.assertIn("Signature: not checked", self.check())

    def wrong(self, says: str) -> None:
        """The stick is not fit, with this complaint."""
        said = self.check("--keyring", self.keyring, status=1)
        self.assertIn("[stick-signature]", said)
        self.assertIn(says, said)

    def test_changed_file(self) -> None:
        (self.stick / VERSIONS / "quorb2.2.0/unzipUpgrade.sh").write_text("#!/bin/sh\nreboot\n")
        self.wrong(f"changed: {VERSIONS}/quorb2.2.0/unzipUpgrade.sh")

    def test_added_file(self) -> None:
        (self.stick / VERSIONS / "quorb2.2.0/more").touch()
        (self.stick / "debs/installTV").touch()
        self.wrong(f"added: {VERSIONS}/quorb2.2.0/more")
        self.wrong("added: debs/installTV")

    def test_missing_file(self) -> None:
        script = self.stick / VERSIONS / "quorb2.2.0/unzipUpgrade.sh"
        script.rename(self.stick / "moved")
        script.symlink_to("../../../../../moved")
        self.wrong(f"missing: {VERSIONS}/quorb2.2.0/unzipUpgrade.sh")
        script.unlink()
        script.symlink_to("../../../../moved")  # even one that leads to the signed file
        self.wrong(f"missing: {VERSIONS}/quorb2.2.0/unzipUpgrade.sh")

    def verify(self, **tools: str) -> tuple[str, str, int]:
        """What the service's verification alone prints, its errors and its status, with tools of these lines."""
        for name, lines in tools.items():
            write_script(self.folder / "bin" / name, lines)
        done = subprocess.run(
            [ROOT / "service/verify-stick", self.stick, self.keyring],
            env={"PATH": f"{self.folder}/bin:{os.environ['PATH']}"},
            capture_output=True,
            text=True,
            check=False,
        )
        return done.stdout, done.stderr, done.returncode

    def test_verification_names_every_fault(self) -> None:
        self.assertEqual(self.verify(), ("", "", 0))
        folder = f"{VERSIONS}/quorb2.2.0"
        (self.stick / folder / "unzipUpgrade.sh").write_text("")
        (self.stick / folder / "more").touch()
        wrong = f"changed: {folder}/unzipUpgrade.sh\nadded: {folder}/more\n"
        self.assertEqual(self.verify(), (wrong, "", 1))
        wrong = f"unreadable: {folder}/OSUpgrade.zip\nunreadable: {folder}/unzipUpgrade.sh\nadded: {folder}/more\n"
        self.assertEqual(self.verify(sha256sum="exit 1"), (wrong, "", 1))

    def test_verification_that_gpgv_does_not_end(self) -> None:
        for printed, status in (("[GNUPG:] VALIDSIG", 2), ("", 127)):
            wrong = f"the signature cannot be checked: gpgv ended with status {status}\n"
            self.assertEqual(self.verify(gpgv=f"echo '{printed}'; exit {status}"), (wrong, "", 1))
        shutil.rmtree(self.stick)
        said, errors, status = self.verify()
        self.assertEqual((said, status), ("", 1))
        self.assertIn("cd: can't cd to", errors)

    def test_changed_manifest(self) -> None:
        manifest = self.stick / MANIFEST
        manifest.write_text(manifest.read_text().replace("2.0.0", "1.0.0"))
        self.wrong("changed: the manifest")

    def test_unknown_key(self) -> None:
        make_key(self.folder / "other", "other", self.keyring)
        self.wrong("not signed by a known key")

    def test_no_signature(self) -> None:
        (self.stick / f"{MANIFEST}.sig").unlink()
        self.wrong("not signed")

    def test_made_again_without_a_key_it_is_not_signed(self) -> None:
        self.make("--replace")
        self.assertNotIn(MANIFEST, self.files())
        self.wrong("not signed")

    def test_key_that_gpg_does_not_have(self) -> None:
        self.assertIn("gpg did not sign", self.make("--replace", "--sign", "nobody", status=2))

    def test_nothing_for_the_board_is_nothing_to_verify(self) -> None:
        shutil.rmtree(self.stick / "debs/QUORB")
        self.assertNotIn("stick-signature", self.check("--keyring", self.keyring, status=1))
        self.assertEqual(self.verify(), ("", "", 0))


if __name__ == "__main__":
    Stick.program = take_path()
    for tool in ("gpg", "gpgv", "zip"):
        if not shutil.which(tool):
            skip(f"{tool} is not installed: tests/run does it")
    unittest.main()
