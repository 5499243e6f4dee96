"""Usage: configuration_test.py BUILD_FOLDER

Reconfigures the project in the build folder, in several ways, and compares the lists of tests: flags must omit none,
and CMake must name every test that another option omits, with the reason.
"""

import json
import os
import re
import subprocess
import tempfile
import unittest
from fnmatch import fnmatchcase
from pathlib import Path

from tests.command_line import take_path

ROOT = Path(__file__).parents[1]
BUILD = Path()
FLAGS = ("CPPFLAGS", "CXXFLAGS", "LDFLAGS")


class ConfigurationTest(unittest.TestCase):
    """Each test compares a configuration with the one of the preset."""

    def setUp(self) -> None:
        holder = tempfile.TemporaryDirectory(prefix="configuration-", dir=BUILD)
        self.addCleanup(holder.cleanup)
        self.folder = Path(holder.name)

    def configure(self, *options: str, **variables: str) -> tuple[int, str]:
        """The status and the output of CMake in this test's folder, with only the flags in `variables`."""
        environment = {name: value for name, value in os.environ.items() if name not in FLAGS} | variables
        command = ["cmake", "--preset", "default", "-B", str(self.folder), *options]
        done = subprocess.run(
            command, cwd=ROOT, env=environment, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, check=False
        )
        return done.returncode, re.sub(r"\s+", " ", done.stdout) if done.returncode else done.stdout

    def list_tests(self, *options: str, **variables: str) -> tuple[set[str], str]:
        """The names of the tests, or of the executable where CTest finds its tests later, and the output of CMake."""
        status, output = self.configure(*options, **variables)
        self.assertEqual(status, 0, output)
        shown = subprocess.run(
            ["ctest", "--show-only=json-v1"], cwd=self.folder, stdout=subprocess.PIPE, text=True, check=True
        )
        return {test["name"].removesuffix("_NOT_BUILT") for test in json.loads(shown.stdout)["tests"]}, output

    def test_flags_leave_no_test_out(self) -> None:
        expected, output = self.list_tests()
        self.assertNotIn("Tests left out", output)
        self.assertIn("Bench.package-and-board", expected)
        flags = {"CPPFLAGS": "-DSOME", "CXXFLAGS": "-g", "LDFLAGS": "-Wl,-O1"}
        (self.folder / "CMakeCache.txt").unlink()
        seen, output = self.list_tests("-DCMAKE_BUILD_TYPE=Debug", **flags)
        self.assertIn("CMAKE_CXX_FLAGS:STRING=-g", (self.folder / "CMakeCache.txt").read_text())
        self.assertEqual(seen, expected)
        self.assertNotIn("Tests left out", output)

    def test_what_is_left_out_is_named(self) -> None:
        everything, _ = self.list_tests()
        for option in ("-DSANITIZER=address", "-DCOMPANION=OFF"):
            with self.subTest(option):
                seen, output = self.list_tests("-DSANITIZER=", "-DCOMPANION=ON", option)
                named = re.findall("^-- Tests left out: (.*?): ", output, re.MULTILINE)
                patterns = [pattern for names in named for pattern in names.split(", ")]
                missing = everything - seen
                self.assertTrue(missing)
                self.assertEqual({name for name in missing if not any(fnmatchcase(name, p) for p in patterns)}, set())
                self.assertEqual({p for p in patterns if not any(fnmatchcase(name, p) for name in missing)}, set())

    def test_missing_library_of_the_companion_program(self) -> None:
        without = "-DCMAKE_DISABLE_FIND_PACKAGE_CLI11=ON"
        status, output = self.configure(without)
        self.assertNotEqual(status, 0)
        self.assertIn("harl-updater-tool needs libcli11-dev: install them, or configure with -DCOMPANION=OFF.", output)
        _, output = self.list_tests(without, "-DCOMPANION=AUTO")
        self.assertIn("CMake Warning", output)
        self.assertIn("libcli11-dev", output)


if __name__ == "__main__":
    BUILD = take_path()
    unittest.main()
