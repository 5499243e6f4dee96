"""Usage: tests/companion/log/make-golden [--explanations] [NAME...]

Makes the golden files of `harl-updater-tool log` again, of the named scenarios or of all: runs each scenario on the
bench's stand-in unit, or on the real one if it needs that, keeps the updater's log as golden/log/NAME.log and what the
tool says of it as golden/log/NAME.txt. With --explanations only the .txt files, from the logs that are there: also
from those that are no scenario's, logs out of journals and consoles, torn or of several runs. Read the differences
before you commit them.

tools-NAME is the scenario NAME on a real unit, with the tools' standard error between the records as a service's
journal has it.
"""

import argparse
import subprocess
import sys
from pathlib import Path

from bench import scenario
from bench.build import BUILD, build
from bench.real.unit import RealUnit
from bench.runner import UnitMaker, run_on, temporary_folder

ROOT = Path(__file__).resolve().parents[3]
GOLDEN = ROOT / "tests/companion/golden/log"
SPEED = 2000  # times shorter waits
TOOLS = "tools-"
WITH_TOOLS = [
    "board-refuses-key",
    "board-unreachable",
    "board-upload-fails",
    "mirrors-fail",
    "package-install-fails",
    "stick-pulled-out",
]

TOOL = BUILD / "companion/harl-updater-tool"


def make_log(name: str) -> None:
    """Runs the scenario and keeps its log."""
    with temporary_folder() as folder:
        what = scenario.load(name.removeprefix(TOOLS))
        kind = "real-without-systemd" if name.startswith(TOOLS) else what.only or "stand-in"
        unit = UnitMaker(kind, SPEED, BUILD).make(what, folder)
        if isinstance(unit, RealUnit) and name.startswith(TOOLS):
            unit.errors = unit.files.log.name
        run_on(unit, lambda run, log: None, SPEED)
        (GOLDEN / f"{name}.log").write_bytes(unit.files.log.read_bytes())


def explain(name: str) -> None:
    """Keeps what the tool says about the log. The tool names the file as it is given: run it where the file lies."""
    done = subprocess.run([TOOL, "log", f"{name}.log"], cwd=GOLDEN, stdout=subprocess.PIPE, check=False)
    if done.returncode not in (0, 1):
        sys.exit(f"make-golden: {name}: the tool ended with status {done.returncode}")
    (GOLDEN / f"{name}.txt").write_bytes(done.stdout)


def main() -> None:
    """The command."""
    parser = argparse.ArgumentParser(
        description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter, usage=argparse.SUPPRESS
    )
    parser.add_argument("--explanations", action="store_true", help="keep the logs")
    parser.add_argument("names", nargs="*", metavar="NAME")
    arguments = parser.parse_args()
    kept = sorted(path.stem for path in GOLDEN.glob("*.log"))
    known = kept if arguments.explanations else scenario.names() + [TOOLS + name for name in WITH_TOOLS]
    if unknown := set(arguments.names) - set(known):
        parser.error(f"{min(unknown)}: not known; there are {', '.join(known)}")
    build("harl-updater-tool")
    GOLDEN.mkdir(parents=True, exist_ok=True)
    for name in arguments.names or known:
        if not arguments.explanations:
            make_log(name)
        explain(name)


main()
