"""Usage: library_test.py BUILD_FOLDER

Builds the example of a main head's program against the package harl-updater-dev of packaging/build, unpacked into a
folder, with another compiler than the library's. Runs it on the stand-in unit: the log has the library's signatures.
"""

import os
import shutil
import subprocess
import tempfile
import unittest
from pathlib import Path

from bench import scenario
from bench.compare import differences
from bench.observation import RECORD
from bench.runner import run_on, temporary_folder
from bench.standin.unit import StandInUnit
from bench.unit import PROGRAMS
from tests.command_line import skip, take_path
from tests.service.service_test import built_package

ROOT = Path(__file__).parents[2]
COMPILER = "g++-12"
SPEED = 2000  # times shorter waits
# As only g++ 11 spells them, not later versions.
ONLY_ELEVEN = {
    "static int32_t UpdateManager::runProcess(const string&, std::string&)",
    "void UpdateManager::update(std::vector<UpdateManager::UpdateComponent>, bool)",
}


class Library(unittest.TestCase):
    """The installed package, and the program built against it."""

    package: Path
    build: Path

    def setUp(self) -> None:
        holder = tempfile.TemporaryDirectory(prefix="library-", dir=self.build)
        self.addCleanup(holder.cleanup)
        self.folder = Path(holder.name)
        self.root = self.folder / "root"
        subprocess.run(["dpkg-deb", "-x", self.package, self.root], check=True)
        self.example = self.root / "usr/share/doc/harl-updater-dev/examples/main-head"
        (self.folder / "bench").mkdir()
        self.program = self.folder / PROGRAMS["main"]
        shutil.copy(self.build / "bench/call_recorder.so", self.folder / "bench")

    def run_command(self, *command: str | Path, **environment: str) -> str:
        """What the command prints."""
        done = subprocess.run(
            command,
            env=os.environ | environment,
            stdout=subprocess.PIPE,
            stderr=subprocess.STDOUT,
            text=True,
            check=False,
        )
        self.assertEqual(done.returncode, 0, done.stdout)
        return done.stdout

    def check_program(self) -> None:
        """The example updates a main head, and its log is that of a library built with g++ 11."""
        self.assertRegex(self.run_command("readelf", "--string-dump=.comment", self.program), r"(?s)GCC: .* 12\.")
        what = scenario.load("main-head-all")
        with temporary_folder() as temporary:
            result = run_on(StandInUnit(what, temporary, SPEED, self.folder), lambda run, log: None, SPEED)
        self.assertEqual(differences(what, result), [])
        golden = (ROOT / "tests/companion/golden/log/main-head-all.log").read_text()
        signatures = [
            {match["function"] for match in RECORD.finditer(log) if match["file"] == "UpdateManager.cpp"}
            for log in (result.run.log, golden)
        ]
        self.assertEqual(*signatures)
        self.assertLess(ONLY_ELEVEN, signatures[0])

    def test_found_by_cmake(self) -> None:
        out = self.folder / "example"
        prefix = f"-DCMAKE_PREFIX_PATH={self.root}/usr"
        self.run_command("cmake", "-S", self.example, "-B", out, prefix, f"-DCMAKE_CXX_COMPILER={COMPILER}")
        self.run_command("cmake", "--build", out)
        shutil.copy(out / "main-head", self.program)
        self.check_program()

    def test_found_by_pkg_config(self) -> None:
        [description] = self.root.glob("usr/lib/*/pkgconfig/harl-updater.pc")
        place = {"PKG_CONFIG_LIBDIR": str(description.parent), "PKG_CONFIG_SYSROOT_DIR": str(self.root)}
        flags = self.run_command("pkg-config", "--cflags", "--libs", "harl-updater", **place).split()
        self.run_command(COMPILER, "-std=c++17", self.example / "main_head.cpp", *flags, "-o", self.program)
        self.check_program()

    def test_other_major_version_is_refused(self) -> None:
        shutil.copytree(self.example, self.folder / "older")
        wanted = self.folder / "older/CMakeLists.txt"
        wanted.write_text(wanted.read_text().replace("harl-updater 1.0", "harl-updater 0.9"))
        command = ["cmake", "-S", "older", "-B", "out", f"-DCMAKE_PREFIX_PATH={self.root}/usr"]
        done = subprocess.run(command, cwd=self.folder, capture_output=True, text=True, check=False)
        self.assertNotEqual(done.returncode, 0)
        self.assertIn("compatible with requested version", done.stderr)


if __name__ == "__main__":
    Library.build = take_path()
    found = built_package("harl-updater-dev")
    if not found:
        skip("there is no package: run packaging/build first")
    if not shutil.which(COMPILER):
        skip(f"{COMPILER} is not installed: scripts/install-build-packages does it")
    Library.package = found
    unittest.main()
