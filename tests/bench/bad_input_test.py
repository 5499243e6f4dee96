"""Bad input of bench/run and of other commands: one clear line, status 2 or 1, and nothing run."""

import os
import re
import subprocess
import sys
import tempfile
import unittest
from pathlib import Path

from bench.expected import BLOCKS, COMMANDS

ROOT = Path(__file__).parents[2]


GOOD = (ROOT / "bench/scenarios/up-to-date.toml").read_text()


class BadInput(unittest.TestCase):
    """Each test names what is wrong and compares the whole message."""

    def setUp(self) -> None:
        holder = tempfile.TemporaryDirectory()
        self.addCleanup(holder.cleanup)
        self.folder = Path(holder.name)
        self.build = self.folder / "build"
        self.build.mkdir()
        (self.build / "harl-updater").touch()

    def bench(self, *arguments: str | Path, **variables: str) -> tuple[int, str, str]:
        command: list[str | Path] = [sys.executable, "-B", "-m", "bench", *arguments]
        done = subprocess.run(command, env=os.environ | variables, capture_output=True, text=True, check=False)
        return done.returncode, done.stdout, done.stderr

    def check_file(self, text: str, line: int, reason: str) -> None:
        file = self.folder / "scenario.toml"
        file.write_text(text)
        self.assertEqual(self.bench(file), (2, "", f"bench: {file}:{line}: {reason}\n"))

    def check_words(self, reason: str, *arguments: str | Path) -> None:
        """The usage comes before the reason."""
        status, shown, message = self.bench(*arguments)
        self.assertEqual((status, shown), (2, ""))
        self.assertEqual(message[message.rindex("bench/run: "):], f"bench/run: error: {reason}\n")

    def line(self, text: str, key: str) -> int:
        """The line of `key` under [expect]."""
        return next(number for number, line in enumerate(text.splitlines(), 1) if line.startswith(f"{key} ="))

    def test_unknown_scenario(self) -> None:
        message = "bench: no scenario 'nothing': bench/run --list shows all\n"
        self.assertEqual(self.bench("nothing"), (2, "", message))

    def test_no_such_file(self) -> None:
        file = self.folder / "none.toml"
        self.assertEqual(self.bench(file), (2, "", f"bench: {file}: No such file or directory\n"))

    def test_page_that_cannot_be_written(self) -> None:
        for file in (self.folder / "none/page.html", self.folder, self.build / "harl-updater/page.html"):
            self.check_words(f"--record: {file} cannot be written", "--record", file, "up-to-date")

    def test_page_of_many_scenarios(self) -> None:
        (self.folder / "file").touch()
        file = self.folder / "file"
        self.check_words(f"--record: {file} cannot be a folder: File exists", "--all", "--record", file)

    def test_scenario_beside_all_or_list(self) -> None:
        self.check_words("argument scenario: not allowed with argument --all", "--all", "up-to-date")
        self.check_words("argument scenario: not allowed with argument --list", "--list", "up-to-date")

    def test_speed(self) -> None:
        for speed in ("nan", "inf", "-inf", "0", "0.99"):
            self.check_words("--speed: must be a number, 1 or more", f"--speed={speed}")

    def test_build_that_is_none(self) -> None:
        reason = f"--build: {self.folder} holds no harl-updater: build it there or leave --build out"
        self.check_words(reason, "--build", self.folder)

    def test_paths_count_from_where_the_user_is(self) -> None:
        command: list[str | Path] = [ROOT / "bench/run", "scenario.toml"]
        done = subprocess.run(command, cwd=self.folder, capture_output=True, text=True, check=False)
        message = "bench: scenario.toml: No such file or directory\n"
        self.assertEqual((done.returncode, done.stdout, done.stderr), (2, "", message))
        (self.folder / "scenario.toml").touch()
        done = subprocess.run(command, cwd=self.folder, capture_output=True, text=True, check=False)
        self.assertEqual((done.returncode, done.stderr), (2, "bench: scenario.toml:1: summary: is missing\n"))

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

    def test_entries_of_another_type(self) -> None:
        text = GOOD.replace("[board]\n", "[stick]\ndirectories = [3]\n\n[board]\n")
        self.check_file(text, 7, "stick.directories: must be of type str, not 3")
        text = re.sub(r"status = .*", 'status = ["0"]', GOOD)
        self.check_file(text, self.line(text, "status"), "expect.status: must be of type int, not '0'")

    def test_folder_outside_the_unit(self) -> None:
        text = GOOD.replace("[board]\n", '[stick]\ndirectories = ["../../quorb2.2.0"]\n\n[board]\n')
        self.check_file(text, 7, "stick.directories: must be fit for the name of a file, not '../../quorb2.2.0'")

    def test_unknown_tools(self) -> None:
        tools = "'systemctl', 'umount', 'rm', 'ls', 'apt', 'apt-cache', 'ssh', 'scp', 'i2cset', 'aplay'"
        for key in ("missing", "killed"):
            text = GOOD.replace("[board]\n", f'[tools]\n{key} = ["nope"]\n\n[board]\n')
            self.check_file(text, 7, f"tools.{key}: must be one of {tools}, not 'nope'")

    def test_null_character(self) -> None:
        text = GOOD.replace("[board]\n", '[board]\nversion_file = "a\\u0000b"\n')
        self.check_file(text, 7, "board.version_file: must be without null characters")

    def test_commands(self) -> None:
        for entry, reason in (
            ("stop-harl xtwo", "'stop-harl xtwo': no number after the x"),
            ("stop", f"no command 'stop'; there are {', '.join(COMMANDS)}"),
        ):
            text = GOOD.replace('"stop-harl"', f'"{entry}"')
            self.check_file(text, self.line(text, "commands"), f"expect.commands: {reason}")
        text = re.sub(r"commands = \[[^]]*\]", "commands = [3]", GOOD)
        self.check_file(text, self.line(text, "commands"), "expect.commands: must be of type str, not 3")

    def test_log(self) -> None:
        for line, reason in (
            ("(nothing 0)", f"no block 'nothing'; there are {', '.join(BLOCKS)}"),
            ("(opening)", "block 'opening': values after the name: must be 1, not 0"),
            ("runProcess: {stop}", f"no command 'stop'; there are {', '.join(COMMANDS)}"),
        ):
            text = GOOD.replace("(opening 0)", line)
            self.check_file(text, self.line(text, "log"), f"expect.log: {reason}")

    def test_missing_expectation(self) -> None:
        self.check_file(GOOD.replace("marker = true\n", ""), 9, "expect.marker: is missing")

    def test_temporary_folder_that_cannot_be_written(self) -> None:
        if os.geteuid() == 0:
            self.skipTest("root may write everywhere")
        self.folder.chmod(0o500)
        status, _, message = self.bench("up-to-date", TMPDIR=str(self.folder))
        self.assertEqual((status, message.count("\n")), (1, 1))

    def test_too_little_space(self) -> None:
        bench = f"{sys.executable} -B -m bench --build {self.build} --unit stand-in up-to-date"
        small = self.folder / "small"
        small.mkdir()
        script = f"mount -t tmpfs -o size=3m small {small} || exit 77; TMPDIR={small} exec {bench}"
        unshare = ["unshare", "--map-root-user", "--mount", "sh", "-c", script]
        done = subprocess.run(unshare, capture_output=True, text=True, check=False)
        if done.returncode == 77 or "unshare" in done.stderr:
            self.skipTest("this machine forbids namespaces")
        message = f"bench: 3 MB are free in {small}, a unit needs 20: make room there or name another TMPDIR\n"
        self.assertEqual((done.returncode, done.stdout, done.stderr), (1, "", message))

    def test_missing_package(self) -> None:
        tools = self.folder / "bin"
        tools.mkdir()
        for tool in ("env", "sh", "dirname", "id"):
            (tools / tool).symlink_to(f"/usr/bin/{tool}")
        query = tools / "dpkg-query"
        query.write_text('#!/bin/sh\nfor package; do :; done\n[ "$package" = alsa-utils ] || echo "ii "\n')
        query.chmod(0o755)
        # No apt-get on this search path, so that nothing is installed.
        status, shown, message = self.bench("up-to-date", PATH=str(tools))
        self.assertNotEqual(status, 0)
        self.assertIn("alsa-utils", message)
        self.assertNotIn("Unit:", shown)


class OtherCommands(unittest.TestCase):
    """Commands that would find nothing to run, or never end."""

    def test_wrong_words(self) -> None:
        numbers = [["x"], ["0"], ["-1"], [""], ["1", "2"], ["9999999999"]]
        names = [["nonsense"]]
        for command, wrong in (
            ("tests/reliability/threads", numbers),
            ("fuzz/run", numbers),
            ("tests/companion/log/throughput", numbers),
            ("performance/processes", numbers[:-1]),
            ("tests/reliability/interruption_real", names),
            ("tests/companion/log/make-golden", names),
            ("tests/companion/make-golden-checks", names),
            ("tests/run-armhf", names),
        ):
            for words in wrong:
                with self.subTest(command, words=words):
                    done = subprocess.run(
                        [ROOT / command, *words], capture_output=True, text=True, timeout=30, check=False
                    )
                    self.assertEqual((done.returncode, done.stdout), (2, ""), done.stderr)
                    self.assertEqual(done.stderr.count("\n"), 1, done.stderr)


if __name__ == "__main__":
    unittest.main()
