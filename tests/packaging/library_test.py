"""Builds the example of a main head's program against the package harl-updater-dev of packaging/build, unpacked into a
folder, with another compiler than the library's. Runs it on the stand-in unit: the log has the library's signatures.
"""

import re
import shutil
import subprocess
from pathlib import Path

import pytest

from bench import scenario
from bench.compare import differences
from bench.observation import RECORD
from bench.runner import run_on, temporary_folder
from bench.standin.unit import StandInUnit
from bench.unit import PROGRAMS
from tests.commands import needs, output_of
from tests.service.service import built_package

ROOT = Path(__file__).parents[2]
COMPILER = "g++-12"
pytestmark = needs(COMPILER)
SPEED = 2000  # times shorter waits
# As only g++ 11 spells them, not later versions.
ONLY_ELEVEN = {
    "static int32_t UpdateManager::runProcess(const string&, std::string&)",
    "void UpdateManager::update(std::vector<UpdateManager::UpdateComponent>, bool)",
}


class Example:
    """The installed package, and the program built against it."""

    def __init__(self, package: Path, build: Path, folder: Path) -> None:
        self.folder = folder
        self.root = folder / "root"
        subprocess.run(["dpkg-deb", "-x", package, self.root], check=True)
        self.source = self.root / "usr/share/doc/harl-updater-dev/examples/main-head"
        self.program = folder / PROGRAMS["main"]
        (folder / "bench").mkdir()
        shutil.copy(build / "bench/call_recorder.so", folder / "bench")

    def check_program(self) -> None:
        """The example updates a main head, and its log is that of a library built with g++ 11."""
        assert re.search(r"(?s)GCC: .* 12\.", output_of("readelf", "--string-dump=.comment", self.program))
        what = scenario.load("main-head-all")
        with temporary_folder() as temporary:
            result = run_on(StandInUnit(what, temporary, SPEED, self.folder), lambda run, log: None, SPEED)
        assert differences(what, result) == []
        golden = (ROOT / "tests/companion/golden/log/main-head-all.log").read_text()
        signatures = [
            {match["function"] for match in RECORD.finditer(log) if match["file"] == "UpdateManager.cpp"}
            for log in (result.run.log, golden)
        ]
        assert signatures[0] == signatures[1]
        assert ONLY_ELEVEN < signatures[0]


@pytest.fixture
def example(build: Path, tmp_path: Path) -> Example:
    package = built_package("harl-updater-dev")
    if not package:
        pytest.skip("there is no package: run packaging/build first")
    return Example(package, build, tmp_path)


def test_found_by_cmake(example: Example) -> None:
    out = example.folder / "example"
    prefix = f"-DCMAKE_PREFIX_PATH={example.root}/usr"
    output_of("cmake", "-S", example.source, "-B", out, prefix, f"-DCMAKE_CXX_COMPILER={COMPILER}")
    output_of("cmake", "--build", out)
    shutil.copy(out / "main-head", example.program)
    example.check_program()


def test_found_by_pkg_config(example: Example) -> None:
    [description] = example.root.glob("usr/lib/*/pkgconfig/harl-updater.pc")
    query = ["pkg-config", "--cflags", "--libs", "harl-updater"]
    flags = output_of(*query, PKG_CONFIG_LIBDIR=description.parent, PKG_CONFIG_SYSROOT_DIR=example.root)
    output_of(COMPILER, "-std=c++17", example.source / "main_head.cpp", *flags.split(), "-o", example.program)
    example.check_program()


def test_other_major_version_is_refused(example: Example) -> None:
    shutil.copytree(example.source, example.folder / "older")
    wanted = example.folder / "older/CMakeLists.txt"
    wanted.write_text(wanted.read_text().replace("harl-updater 1.0", "harl-updater 0.9"))
    command = ["cmake", "-S", "older", "-B", "out", f"-DCMAKE_PREFIX_PATH={example.root}/usr"]
    assert "compatible with requested version" in output_of(*command, folder=example.folder, status=1)
