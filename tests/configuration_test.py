"""Reconfigures the project in several ways and compares the lists of tests: flags must omit none, and CMake must name
every test that another option omits, with the reason."""

import json
import os
import re
import subprocess
from fnmatch import fnmatchcase
from pathlib import Path

import pytest


ROOT = Path(__file__).parents[1]
FLAGS = ("CPPFLAGS", "CXXFLAGS", "LDFLAGS")


class Project:
    """The project, configured in a folder of its own."""

    def __init__(self, folder: Path) -> None:
        self.folder = folder

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
        assert status == 0, output
        shown = subprocess.run(
            ["ctest", "--show-only=json-v1"], cwd=self.folder, stdout=subprocess.PIPE, text=True, check=True
        )
        return {test["name"].removesuffix("_NOT_BUILT") for test in json.loads(shown.stdout)["tests"]}, output


@pytest.fixture
def project(tmp_path: Path) -> Project:
    return Project(tmp_path)


@pytest.fixture(scope="module")
def everything(tmp_path_factory: pytest.TempPathFactory) -> set[str]:
    """The tests of the preset."""
    names, output = Project(tmp_path_factory.mktemp("preset")).list_tests()
    assert "Tests left out" not in output
    assert "Bench.package-and-board" in names
    return names


def test_flags_leave_no_test_out(project: Project, everything: set[str]) -> None:
    seen, output = project.list_tests("-DCMAKE_BUILD_TYPE=Debug", CPPFLAGS="-DSOME", CXXFLAGS="-g", LDFLAGS="-Wl,-O1")
    assert "CMAKE_CXX_FLAGS:STRING=-g" in (project.folder / "CMakeCache.txt").read_text()
    assert seen == everything
    assert "Tests left out" not in output


@pytest.mark.parametrize("option", ["-DSANITIZER=address", "-DCOMPANION=OFF"])
def test_what_is_left_out_is_named(project: Project, everything: set[str], option: str) -> None:
    seen, output = project.list_tests(option)
    named = re.findall("^-- Tests left out: (.*?): ", output, re.MULTILINE)
    patterns = [pattern for names in named for pattern in names.split(", ")]
    missing = everything - seen
    assert missing
    assert {name for name in missing if not any(fnmatchcase(name, p) for p in patterns)} == set()
    assert {p for p in patterns if not any(fnmatchcase(name, p) for name in missing)} == set()


def test_missing_library_of_the_companion_program(project: Project) -> None:
    without = "-DCMAKE_DISABLE_FIND_PACKAGE_CLI11=ON"
    status, output = project.configure(without)
    assert status != 0
    assert "harl-updater-tool needs libcli11-dev: install them, or configure with -DCOMPANION=OFF." in output
    _, output = project.list_tests(without, "-DCOMPANION=AUTO")
    assert "CMake Warning" in output
    assert "libcli11-dev" in output
