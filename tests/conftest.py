"""What the Python tests share: options, folders, and when a run of them counts as skipped."""

import shlex
import shutil
import signal
from collections.abc import Callable, Iterator
from pathlib import Path
from typing import Any

import pytest

from tests.mounts import separate_mounts

SKIPPED = 77  # cmake/python_test.cmake
ROOT = Path(__file__).parents[1]

pytest_plugins = ["tests.service.service"]
pytest.register_assert_rewrite("tests.commands", "tests.service.stand_in")


# A shell starts what it runs in the background with this signal ignored, and so would be all that a test interrupts.
signal.signal(signal.SIGINT, signal.default_int_handler)


def pytest_addoption(parser: pytest.Parser) -> None:
    options = parser.getgroup("updater")
    options.addoption("--build", type=Path, default=ROOT / "build/default", help="the build folder under test")
    options.addoption("--emulator", type=shlex.split, default=[], help="what runs the tool of another machine")
    options.addoption("--package", default="harl-updater", help="the package under test, in build/package")
    options.addoption("--system", type=Path, default="/", help="the root file system on which it is tested")
    options.addoption("--units", type=int, default=8, help="how many units the fleet has")
    options.addoption("--write", action="store_true", help="keeps what is printed where it is compared with a file")
    options.addoption("--unit", default="stand-in", help="the kind of unit in the terminals of the bench")


def pytest_sessionfinish(session: pytest.Session) -> None:
    """Gives a run in which every test was skipped a status of its own."""
    reporter = session.config.pluginmanager.get_plugin("terminalreporter")
    if session.exitstatus == pytest.ExitCode.OK and reporter.stats.get("skipped") and not reporter.stats.get("passed"):
        session.exitstatus = SKIPPED


@pytest.fixture(scope="session")
def build(pytestconfig: pytest.Config) -> Path:
    """The build folder."""
    folder: Path = pytestconfig.getoption("build")
    return folder.resolve()


@pytest.fixture(scope="session")
def tool(build: Path) -> Path:
    """The companion program."""
    return build / "companion/harl-updater-tool"


LINES: list[str] = []


@pytest.fixture(scope="session")
def tell() -> Callable[[str], None]:
    """Shows a line at the end of the run, also of one without a failure."""
    return LINES.append


def pytest_terminal_summary(terminalreporter: Any) -> None:
    for line in LINES:
        terminalreporter.write_line(line)


@pytest.fixture
def own_mounts() -> None:
    """What the test mounts is not seen by the rest of the machine. Skips the test where that is not allowed."""
    try:
        separate_mounts()
    except OSError as error:
        pytest.skip(str(error))


@pytest.fixture
def tmp_path(tmp_path: Path) -> Iterator[Path]:
    """pytest's folder, removed after the test: some fill theirs with 100 MB."""
    yield tmp_path
    shutil.rmtree(tmp_path, ignore_errors=True)
