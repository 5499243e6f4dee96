"""Bad input of bench/run: one clear line, a status other than 0, and nothing run."""

import os
import subprocess
import sys
import tempfile
import unittest
from pathlib import Path

ROOT = Path(__file__).parents[2]
GOOD = (ROOT / "bench/scenarios/up-to-date.toml").read_text()


class BadInput(unittest.TestCase):
    """Each test names what is wrong and compares the whole message."""

    def setUp(self) -> None:
        holder = tempfile.TemporaryDirectory()
        self.addCleanup(holder.cleanup)
        self.folder = Path(holder.name)

    def bench(self, *arguments: str | Path, **variables: str) -> tuple[int, str, str]:
        command = [sys.executable, "-B", ROOT / "bench/main.py", *arguments]
        done = subprocess.run(command, env=os.environ | variables, capture_output=True, text=True, check=False)
        return done.returncode, done.stdout, done.stderr

    def check_file(self, text: str, line: int, reason: str) -> None:
        file = self.folder / "scenario.toml"
        file.write_text(text)
        self.assertEqual(self.bench(file), (1, "", f"bench: {file}:{line}: {reason}\n"))

    def test_unknown_scenario(self) -> None:
        message = "bench: no scenario 'nothing': bench/run --list shows all\n"
        self.assertEqual(self.bench("nothing"), (1, "", message))

    def test_no_such_file(self) -> None:
        file = self.folder / "none.toml"
        self.assertEqual(self.bench(file), (1, "", f"bench: {file}: No such file or directory\n"))

    def test_page_that_cannot_be_written(self) -> None:
        for file in (self.folder / "none/page.html", self.folder):
            message = f"bench: --record: {file} cannot be written\n"
            self.assertEqual(self.bench("--build", "none", "--record", file, "up-to-date"), (1, "", message))

    def test_page_of_many_scenarios(self) -> None:
        status, shown, message = self.bench("--all", "--record", self.folder / "page.html")
        self.assertEqual((status, shown), (2, ""))
        self.assertIn("--record: takes one scenario, not --all\n", message)

    def test_no_toml(self) -> None:
        self.check_file(GOOD.replace("[board]", "[board"), 6, "Expected ']' at the end of a table declaration")

    def test_file_ends_early(self) -> None:
        text = GOOD[: GOOD.rindex("'''")]
        self.check_file(text, len(text.splitlines()), "Expected \"'''\"")

    def test_unknown_section(self) -> None:
        sections = "package, mirrors, board, stick, head, tools, updater"
        reason = f"bord: not known; the sections are {sections} and expect"
        self.check_file(GOOD.replace("[board]", "[bord]"), 6, reason)

    def test_unknown_key(self) -> None:
        text = GOOD.replace('[board]\n', '[board]\ncolour = "red"\n')
        keys = "installed, version_file, link, login, disk, uploads_lost, script"
        self.check_file(text, 7, f"board.colour: not known; the keys are {keys}")

    def test_unknown_value(self) -> None:
        text = GOOD.replace('[board]\n', '[board]\ndisk = "none"\n')
        self.check_file(text, 7, "board.disk: must be one of 'free', 'full', not 'none'")

    def test_value_of_another_type(self) -> None:
        text = GOOD.replace('[board]\n', '[board]\nuploads_lost = "3"\n')
        self.check_file(text, 7, "board.uploads_lost: must be of type int, not '3'")

    def test_missing_expectation(self) -> None:
        self.check_file(GOOD.replace("marker = true\n", ""), 9, "expect.marker: is missing")

    def test_temporary_folder_that_cannot_be_written(self) -> None:
        if os.geteuid() == 0:
            self.skipTest("root may write everywhere")
        self.folder.chmod(0o500)
        status, _, message = self.bench("up-to-date", TMPDIR=str(self.folder))
        self.assertEqual((status, message.count("\n")), (1, 1))

    def test_too_little_space(self) -> None:
        bench = f"{sys.executable} -B {ROOT}/bench/main.py --build none --unit stand-in up-to-date"
        script = f"mount -t tmpfs -o size=3m small {self.folder} || exit 77; TMPDIR={self.folder} exec {bench}"
        unshare = ["unshare", "--map-root-user", "--mount", "sh", "-c", script]
        done = subprocess.run(unshare, capture_output=True, text=True, check=False)
        if done.returncode == 77 or "unshare" in done.stderr:
            self.skipTest("this machine forbids namespaces")
        message = f"bench: 3 MB are free in {self.folder}, a unit needs 20: make room there or name another TMPDIR\n"
        self.assertEqual((done.returncode, done.stdout, done.stderr), (1, "", message))

    def test_missing_package(self) -> None:
        tools = self.folder / "bin"
        tools.mkdir()
        for tool in ("env", "sh", "dirname", "id"):
            (tools / tool).symlink_to(f"/usr/bin/{tool}")
        query = tools / "dpkg-query"
        query.write_text('#!/bin/sh\nfor package; do :; done\n[ "$package" = alsa-utils ] || echo "ii "\n')
        query.chmod(0o755)
        # No apt-get on this search path: nothing is installed.
        status, shown, message = self.bench("up-to-date", PATH=str(tools))
        self.assertNotEqual(status, 0)
        self.assertIn("alsa-utils", message)
        self.assertNotIn("Unit:", shown)


if __name__ == "__main__":
    unittest.main()
