"""Usage: tests/companion/make-golden-checks [--compare FOLDER [--emulator PROGRAM]] [SCENARIO...]

Keeps what `harl-updater-tool stick` and `harl-updater-tool unit` say before the update of each named scenario of the
bench, or of all, in golden/stick.txt and golden/unit.txt: a line "# SCENARIO" for each that it is said of, then the
text. The sticks are those of the bench's real unit, the units are stand-ins. Read the differences before you commit
them.

With --compare nothing is built or written: the differences from what the programs in the build folder say are shown,
and the status is 1 when there are any. With --emulator it runs the tool, and the units are left out.
"""

import argparse
import difflib
import re
import subprocess
import sys
import tempfile
from pathlib import Path

from bench import scenario
from bench.build import BUILD, build
from bench.real.files import write_stick
from bench.scenario import Setup

ROOT = Path(__file__).resolve().parents[2]
GOLDEN = ROOT / "tests/companion/golden"


def run(command: list[str | Path], folder: str) -> str:
    """What the command prints, and its status."""
    done = subprocess.run(command, cwd=folder, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, check=False)
    return f"{done.stdout}Exit status: {done.returncode}\n"


def check_stick(tool: list[str | Path], setup: Setup) -> str:
    """What the tool says about the stick; about an empty mount point when none is inserted."""
    with tempfile.TemporaryDirectory(prefix="golden-") as folder:
        mount_point = Path(folder) / "stick"
        if setup.stick.inserted:
            write_stick(mount_point, setup)
        else:
            mount_point.mkdir()
        return run([*tool, "stick", "stick"], folder)


def check_unit(program: Path, setup: Setup) -> str:
    """What the tool says about the unit, without what differs from run to run."""
    variables = scenario.variables(setup)
    said = run([program, *(f"{name}={value}" for name, value in variables.items())], "/")
    said = re.sub(r"^(Free space: +).*", r"\1(of this machine)", said, flags=re.MULTILINE)
    return re.sub(r"\b(Process|ps) \d+", r"\1 PID", said)


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


def differences(kind: str, name: str, said: str) -> str:
    """How `said` differs from what is kept of the scenario."""
    kept = golden(kind).get(name, "")
    lines = difflib.unified_diff(kept.splitlines(True), said.splitlines(True), f"golden/{kind}.txt: {name}", "now")
    return "".join(lines)


def main() -> int:
    """The command."""
    parser = argparse.ArgumentParser(
        description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter, usage=argparse.SUPPRESS
    )
    parser.add_argument("--compare", type=Path, metavar="FOLDER", help="the build folder")
    parser.add_argument("--emulator", metavar="PROGRAM", help="what runs the tool of another machine")
    parser.add_argument("scenarios", nargs="*", metavar="SCENARIO")
    arguments = parser.parse_args()
    if unknown := set(arguments.scenarios) - set(scenario.names()):
        parser.error(f"no scenario {min(unknown)!r}: bench/run --list shows all")
    if not arguments.compare:
        build("harl-updater-tool", "unit-on-standin")
    programs = (arguments.compare or BUILD).resolve()
    tool = [*filter(None, [arguments.emulator]), programs / "companion/harl-updater-tool"]
    status = 0
    for name in arguments.scenarios or scenario.names():
        setup = scenario.load(name).setup
        checked = {"stick": check_stick(tool, setup)}
        if not arguments.emulator:
            checked["unit"] = check_unit(programs / "tests/companion/unit-on-standin", setup)
        for kind, said in checked.items():
            if arguments.compare is None:
                keep(kind, golden(kind) | {name: said})
            elif found := differences(kind, name, said):
                print(f"{found}If it is meant: tests/companion/make-golden-checks {name}")
                status = 1
    return status


sys.exit(main())
