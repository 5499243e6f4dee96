"""target/run: tests the updater's package on an emulated armhf unit: kernel, systemd, real tools, I2C bus, sound."""

import argparse
import contextlib
import fcntl
import os
import shutil
import signal
import subprocess
import sys
import time
from collections.abc import Iterator
from pathlib import Path
from typing import IO

from bench.outcomes import SOUND_FILES
from bench.scenario import ScenarioError
from bench.show.text import panel_line
from target import power_cuts
from target.machine import MachineError
from target.plan import Plan, PlanError, load, names
from target.runner import WORK, Emulation, Results

HERE = Path(__file__).parent
ROOT = HERE.parent
PACKAGED = ["CMakeLists.txt", "cmake", "common", "debian", "companion", "docs/man", "packaging", "remote", "service"]
NEEDED = ["qemu-system-arm", "qemu-user-static", "mmdebstrap", "arch-test", "e2fsprogs", "dosfstools", "mtools", "kmod"]
NEEDED += ["cpio", "openssh-client", "dpkg-dev", "g++-11-arm-linux-gnueabihf"]  # of Debian
SPACE = 2000  # MiB, for disks and results; and in addition for each power cut:
DISK_SPACE = 500
SPEED = 300  # how many times shorter the updater's waits are
TOOL_LIMIT = 3000  # s, to build the package or the image


class TargetError(Exception):
    """The test cannot be made on this machine; the text is one line that says what to do."""


def run_tool(command: list[str | Path], output: int | IO[str], errors: IO[str] | None) -> str | None:
    """Runs a long command; it ends with this program, as does everything that it started.

    Returns its output if that is a pipe, otherwise "", and None if it failed. Raises TargetError.
    """
    with subprocess.Popen(command, stdout=output, stderr=errors, text=True, start_new_session=True) as tool:
        try:
            text, _ = tool.communicate(timeout=TOOL_LIMIT)
        except subprocess.TimeoutExpired as error:
            raise TargetError(f"{command[0]} took over {TOOL_LIMIT} s: try again on a less busy machine") from error
        finally:
            if tool.returncode is None:
                os.killpg(tool.pid, signal.SIGTERM)
    return (text or "") if tool.returncode == 0 else None


def updater_package(given: Path | None) -> Path:
    """The package to test: the given one, or one built from the checked-out commit. Raises TargetError."""
    if given:
        fields: list[str | Path] = ["dpkg-deb", "--field", given, "Package", "Architecture"]
        seen = subprocess.run(fields, stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, text=True, check=False).stdout
        if seen != "Package: harl-updater\nArchitecture: armhf\n":
            raise TargetError(f"{given}: is not harl-updater for armhf; packaging/build armhf makes such a package")
        return given
    folder = ROOT / "build/package"
    sources = subprocess.check_output(["git", "ls-tree", "HEAD", *PACKAGED], cwd=ROOT, text=True)
    built = WORK / "package-sources"
    packages = list(folder.glob("harl-updater_*_armhf.deb"))
    # A package newer than the note comes from another call of packaging/build, possibly from other sources.
    if (
        not (built.exists() and packages)
        or built.read_text() != sources
        or any(file.stat().st_mtime > built.stat().st_mtime for file in packages)
    ):
        print("target: building the package", flush=True)
        log = WORK / "package.log"
        with log.open("w") as output:
            if run_tool([ROOT / "packaging/build", "armhf"], output, output) is None:
                raise TargetError(f"packaging/build armhf failed: see {log}")
        built.write_text(sources)
    packages = sorted(folder.glob("harl-updater_*_armhf.deb"), key=lambda file: file.stat().st_mtime)
    if not packages:
        raise TargetError(f"{folder} holds no harl-updater_*_armhf.deb: packaging/build armhf makes it")
    return packages[-1]


def make_image() -> Path:
    """The folder of the unit's disk and boot files, made if there is none yet. Raises TargetError."""
    folder = run_tool([HERE / "image", WORK / "cache"], subprocess.PIPE, None)
    if folder is None:
        raise TargetError("no image of the unit, see above")
    return Path(folder.strip())


def print_table(results: Results) -> None:
    """The results as a table for a document."""
    print("\n| Scenario | Result | Unit | Package | Board | Panel | Sound | Time |\n|---|---|---|---|---|---|---|---|")
    for name, (evidence, found) in results.items():
        run, state, before = evidence.result.run, evidence.result.state, evidence.before
        cells = [
            name,
            "different" if found else "as expected",
            f"{evidence.after['Result']}, status {evidence.result.status}",
            f"{before['package']} → {state.package}",
            f"{before['board']} → {state.board}",
            panel_line(run.panel.shown(0)),
            ", ".join(name for name, file in SOUND_FILES.items() if file in state.sounds) or "none",
            f"{evidence.result.seconds:.0f} s",
        ]
        print(f"| {' | '.join(cells)} |")


@contextlib.contextmanager
def emulation(package: Path | None, speed: float, space: int) -> Iterator[Emulation]:
    """The unit's image and the package to test, while no other run uses the folder. Raises TargetError.

    @param space  on the disk (MiB)
    """
    WORK.mkdir(parents=True, exist_ok=True)
    if shutil.disk_usage(WORK).free < space << 20:
        raise TargetError(f"{WORK} has less than {space} MiB free: free some space")
    with (WORK / "lock").open("w") as lock:
        try:
            fcntl.flock(lock, fcntl.LOCK_EX | fcntl.LOCK_NB)
        except BlockingIOError as error:
            raise TargetError(f"another target/run works in {WORK}: wait for it, or take another checkout") from error
        if subprocess.run([ROOT / "scripts/install-packages", *NEEDED], check=False).returncode != 0:
            raise TargetError("packages are missing, see above")
        updater, image = updater_package(package), make_image()
        print(f"Package: {updater.name}", flush=True)
        yield Emulation(image, updater, speed)


def run(plans: list[Plan], unit: Emulation) -> int:
    """Runs `plans` and shows their results. Returns the status of the command. Raises MachineError."""
    begin = time.monotonic()
    shared = [plan for plan in plans if not plan.settings.is_cut()]
    results = unit.run_shared(shared) if shared else {}
    for plan in plans:
        if plan not in shared:
            results |= unit.run_cut(plan)
    print_table(results)
    for evidence, _ in results.values():
        for line in evidence.remarks():
            print(f"\n{line}")
    for name, (_, found) in results.items():
        for line in found:
            print(f"DIFFERENCE: {name}: {line}")
    failed = sum(1 for _, found in results.values() if found)
    print(f"\n{len(results) - failed} of {len(results)} scenarios as expected, {time.monotonic() - begin:.0f} s")
    return 1 if failed else 0


def main() -> int:
    """The command."""
    parser = argparse.ArgumentParser(prog="target/run", description=__doc__)
    parser.add_argument("scenario", nargs="*", help="default: all")
    parser.add_argument("--list", action="store_true", help="show all scenarios")
    parser.add_argument(
        "--full-length", action="store_true", help="keep every wait; an hour for package-and-board, the default then"
    )
    parser.add_argument(
        "--power-cuts", type=int, default=0, help="instead: cut the power N times in an update, each time run the next"
    )
    parser.add_argument("--package", type=Path, help="default: built by packaging/build armhf", metavar="FILE")
    arguments = parser.parse_args()
    if arguments.power_cuts < 0 or (arguments.power_cuts and (arguments.scenario or arguments.full_length)):
        parser.error("--power-cuts takes a number, and neither a scenario nor --full-length")
    for number in (signal.SIGTERM, signal.SIGHUP):
        signal.signal(number, lambda received, _: sys.exit(128 + received))
    try:
        if arguments.list:
            for name in names():
                print(f"{name:32}  {load(name).summary}")
            return 0
        chosen = arguments.scenario or (["package-and-board"] if arguments.full_length else names())
        plans = [load(name) for name in chosen]
        space, speed = SPACE + DISK_SPACE * arguments.power_cuts, 1 if arguments.full_length else SPEED
        with emulation(arguments.package, speed, space) as unit:
            return power_cuts.run(unit, arguments.power_cuts) if arguments.power_cuts else run(plans, unit)
    except BrokenPipeError:
        os.dup2(os.open(os.devnull, os.O_WRONLY), sys.stdout.fileno())
    except (TargetError, PlanError, ScenarioError, MachineError) as error:
        print(f"target: {error}", file=sys.stderr)
    except PermissionError as error:
        hint = f"""if it stems from 'sudo target/run': sudo chown -R "$USER" {ROOT / 'build'}"""
        print(f"target: {error.filename}: {error.strerror}; {hint}", file=sys.stderr)
    except OSError as error:
        print(f"target: {error.filename or WORK}: {error.strerror}", file=sys.stderr)
    except subprocess.CalledProcessError as error:
        print(f"target: {error.cmd[0]} failed: {(error.stderr or '').strip()}", file=sys.stderr)
    except KeyboardInterrupt:
        return 130
    return 1


sys.exit(main())
