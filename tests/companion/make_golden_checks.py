"""Usage: tests/companion/make-golden-checks [SCENARIO...]

Keeps what `harl-updater-tool stick`, `unit` and `check` say before the update of each named scenario of the bench, or
of all, and what `verify` says after it, in golden/stick.txt and so on: a line "# SCENARIO" for each that it is said of,
then the text. The sticks are those of the bench's real unit, the units are stand-ins; after the update they are as the
scenario expects, with the run of golden/log in their journal. golden_checks_test.py compares what is kept with what the
programs of a build folder say. Without a SCENARIO it also keeps the reports that stick-tests and unit-check-tests
make, in golden/reports. Read the differences before you commit them.
"""

import argparse
import contextlib
import os
import re
import subprocess
import sys
import tempfile
from collections.abc import Iterator
from pathlib import Path

from bench import scenario
from bench.build import BUILD, build
from bench.real.files import write_stick
from bench.scenario import Scenario, Setup

ROOT = Path(__file__).resolve().parents[2]
GOLDEN = ROOT / "tests/companion/golden"
ON_STAND_IN = "tests/companion/unit-on-standin"


def run(command: list[str | Path], folder: str) -> str:
    """What the command prints, and its status."""
    done = subprocess.run(command, cwd=folder, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, check=False)
    return f"{done.stdout}Exit status: {done.returncode}\n"


@contextlib.contextmanager
def stick_of(setup: Setup) -> Iterator[str]:
    """A folder with the stick as "stick"; an empty mount point when none is inserted."""
    with tempfile.TemporaryDirectory(prefix="golden-") as folder:
        mount_point = Path(folder) / "stick"
        if setup.stick.inserted:
            write_stick(mount_point, setup)
        else:
            mount_point.mkdir()
        yield folder


def check_stick(emulator: list[str], programs: Path, what: Scenario) -> str:
    """What the tool, run by the emulator, says about the stick."""
    with stick_of(what.setup) as folder:
        return run([*emulator, programs / "companion/harl-updater-tool", "stick", "stick"], folder)


def on_stand_in(words: list[str | Path], settings: dict[str, str], folder: str = "/") -> str:
    """What a command of unit-on-standin prints, without what differs from run to run."""
    said = run(words + [f"{name}={value}" for name, value in settings.items()], folder)
    said = re.sub(r"^(Free space: +).*", r"\1(of this machine)", said, flags=re.MULTILINE)
    return re.sub(r"\b(Process|ps) \d+", r"\1 PID", said)


def check_unit(emulator: list[str], programs: Path, what: Scenario) -> str:
    """What the tool says about the unit."""
    return on_stand_in([*emulator, programs / ON_STAND_IN, "unit"], scenario.variables(what.setup))


def check_update(emulator: list[str], programs: Path, what: Scenario) -> str:
    """What the tool says about the unit with the stick."""
    with stick_of(what.setup) as folder:
        settings = scenario.variables(what.setup)
        return on_stand_in([*emulator, programs / ON_STAND_IN, "check", "stick"], settings, folder)


def verify_unit(emulator: list[str], programs: Path, what: Scenario) -> str:
    """What the tool says about the unit after the update."""
    after = {
        "UNIT_JOURNAL": str(GOLDEN / f"log/{what.name}.log"),
        "UNIT_HARL": what.expect.harl,
        "UNIT_PACKAGE": "iF" if what.setup.package.install in ("fails", "asks") else "ii",
        "PACKAGE_INSTALLED": what.expect.package,
        "BOARD_INSTALLED": what.expect.board,
    }
    return on_stand_in([*emulator, programs / ON_STAND_IN, "verify"], scenario.variables(what.setup) | after)


KINDS = {"stick": check_stick, "unit": check_unit, "check": check_update, "verify": verify_unit}


def golden(kind: str) -> dict[str, str]:
    """What is kept of each scenario."""
    kept: dict[str, str] = {}
    text = (GOLDEN / f"{kind}.txt").read_text(encoding="utf-8")
    for names, said in re.findall(r"((?:^# .*\n)+)((?:^(?!# ).*\n)+)", text, re.MULTILINE):
        kept |= dict.fromkeys(re.findall("# (.*)", names), said)
    return kept


def keep(kind: str, kept: dict[str, str]) -> None:
    """Keeps what is said of each scenario, with those together of which the same is said."""
    names_of: dict[str, list[str]] = {}
    for name in sorted(kept.keys() & scenario.names()):
        names_of.setdefault(kept[name], []).append(name)
    text = "".join("".join(f"# {name}\n" for name in names) + said for said, names in names_of.items())
    (GOLDEN / f"{kind}.txt").write_text(text, encoding="utf-8")


def main() -> int:
    """The command."""
    parser = argparse.ArgumentParser(
        description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter, usage=argparse.SUPPRESS
    )
    parser.add_argument("scenarios", nargs="*", metavar="SCENARIO")
    arguments = parser.parse_args()
    if unknown := set(arguments.scenarios) - set(scenario.names()):
        parser.error(f"no scenario {min(unknown)!r}: bench/run --list shows all")
    build("harl-updater-tool", "unit-on-standin")
    if not arguments.scenarios:
        build("stick-tests", "unit-check-tests")
        for program in ("stick-tests", "unit-check-tests"):
            subprocess.run([BUILD / "tests/companion" / program], env=os.environ | {"KEEP_REPORTS": "1"}, check=True)
    for name in arguments.scenarios or scenario.names():
        what = scenario.load(name)
        for kind, check in KINDS.items():
            keep(kind, golden(kind) | {name: check([], BUILD, what)})
    return 0


if __name__ == "__main__":
    sys.exit(main())
