"""Usage: performance/mirror [UNITS]

Publishes a package of 5 MB with packaging/publish, serves the repository with nginx, and lets UNITS (200) units refresh
their mirrors at once, as `apt update` does, with nothing new and with a new package, which they download. Prints what
one unit and all of them cost the server, by its own log, with apt-cacher-ng between and without: requests, connections,
bytes and processor time. A unit is an apt with folders of its own.
"""

import contextlib
import os
import random
import subprocess
import sys
import tempfile
import time
from collections.abc import Iterator
from dataclasses import dataclass
from pathlib import Path

from bench.makers.files import write
from bench.makers.packages import build_tree

ROOT = Path(__file__).resolve().parents[1]
PORT, CACHE_PORT = 18080, 18081
SIZE = 5_000_000  # bytes of the package, which do not compress
NGINX = """
daemon off; pid {folder}/pid; error_log {folder}/errors; worker_processes 1; events {{ worker_connections 4096; }}
http {{
  log_format cost '$connection $status $bytes_sent $request_uri';
  access_log {folder}/log cost;
  server {{ listen 127.0.0.1:{port}; root {root}; }}
}}
"""
CACHE = """
CacheDir: {folder}/cache
LogDir: {folder}/logs
SocketPath: {folder}/socket
PidFile: {folder}/cache.pid
BindAddress: 127.0.0.1
Port: {port}
ForeGround: 1
AllowUserPorts: 0
"""
APT = """
Dir "{folder}"; Dir::State::status "{folder}/status"; Dir::Etc "{folder}"; Dir::Etc::trustedparts "{folder}/keys";
APT::Sandbox::User "root"; Acquire::Languages "none"; Acquire::Queue-Mode "host"; Debug::NoLocking "true";
{proxy}
"""


@dataclass
class Cost:
    """What the web server did."""

    requests: int
    unchanged: int  # of the requests, those answered with 304
    connections: int
    sent: int  # bytes
    seconds: float  # of its processor time
    wall: float  # s
    failed: int  # units whose apt complained


def publish(work: Path, version: str) -> None:
    """Publishes the package."""
    tree = work / "tree"
    write(tree / "DEBIAN/control", f"Package: solvik4-rh\nVersion: {version}\nArchitecture: all\nSection: misc\n"
          "Priority: optional\nMaintainer: Bench <bench@localhost>\nDescription: software of the instrument\n")
    (tree / "opt").mkdir(exist_ok=True)
    (tree / "opt/solvik4").write_bytes(random.Random(version).randbytes(SIZE))
    package = build_tree(tree, work / version)
    changes = package.with_suffix(".changes")
    signed = changes.with_suffix(".signed")
    maker = [ROOT / "packaging/publish", work / "repository"]
    commands: list[list[str | Path]] = [
        ["changestool", "--create", changes, "add", package],
        ["changestool", changes, "setdistribution", "stable"],
        ["gpg", "--batch", "--quiet", "--local-user", "maker", "--output", signed, "--clear-sign", changes],
        ["mv", signed, changes],
        [*maker, "add", changes],
        [*maker, "promote", "solvik4-rh"],
    ]
    for command in commands:
        subprocess.run(command, check=True, stdout=subprocess.DEVNULL)


@contextlib.contextmanager
def running(command: list[str | Path]) -> Iterator[int]:
    """A server, until the end of the block; its process."""
    process = subprocess.Popen(command, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
    time.sleep(1)
    assert process.poll() is None, command
    try:
        yield process.pid
    finally:
        process.terminate()
        process.wait()


def processor_time(parent: int) -> float:
    """Of a process and its children, s."""
    children = Path(f"/proc/{parent}/task/{parent}/children").read_text().split()
    fields = [Path(f"/proc/{pid}/stat").read_text().rpartition(")")[2].split() for pid in (str(parent), *children)]
    return sum(int(field[11]) + int(field[12]) for field in fields) / os.sysconf("SC_CLK_TCK")


def make_unit(folder: Path, key: Path, proxy: str) -> None:
    """The folders of a unit's apt."""
    for name in ("keys", "preferences.d", "apt.conf.d", "var/lib/apt/lists/partial", "var/cache/apt/archives/partial"):
        (folder / name).mkdir(parents=True)
    write(folder / "status", "Package: solvik4-rh\nStatus: install ok installed\nVersion: 1.0\nArchitecture: all\n"
          "Maintainer: Bench <bench@localhost>\nDescription: software\n")
    write(folder / "sources.list", f"deb [signed-by={key}] http://127.0.0.1:{PORT}/ stable main\n")
    write(folder / "apt.conf", APT.format(folder=folder, proxy=proxy))


def update(units: list[Path]) -> int:
    """Lets all units refresh their mirrors and download what is new, at once. How many of them complained."""
    line = 'apt-get -qq update 2>"$0/said" && apt-get -qq --download-only --yes install solvik4-rh 2>>"$0/said"'
    started = [subprocess.Popen(["sh", "-c", line, unit], env=os.environ | {"APT_CONFIG": str(unit / "apt.conf")},
                                stdout=subprocess.DEVNULL) for unit in units]
    ended = [process.wait() for process in started]
    return sum(status != 0 or (unit / "said").stat().st_size > 0 for status, unit in zip(ended, units))


def measure(work: Path, server: int, units: list[Path]) -> Cost:
    """What the update of all units costs the server."""
    log = work / "nginx/log"
    before, used = len(log.read_text().splitlines()), processor_time(server)
    begin = time.monotonic()
    failed = update(units)
    wall = time.monotonic() - begin
    time.sleep(0.5)
    lines = [line.split() for line in log.read_text().splitlines()[before:]]
    return Cost(len(lines), sum(line[1] == "304" for line in lines), len({line[0] for line in lines}),
                sum(int(line[2]) for line in lines), processor_time(server) - used, wall, failed)


def show(what: str, units: int, cost: Cost) -> None:
    """Prints a row."""
    print(f"{what:38} {units:5} {cost.requests:8} {cost.unchanged:6} {cost.connections:11} {cost.sent:13,} "
          f"{cost.seconds:7.2f} {cost.wall:7.1f} {cost.failed:7}", flush=True)


def main() -> None:
    """The command."""
    if len(sys.argv) > 2 or not all(word.isdigit() and int(word) > 0 for word in sys.argv[1:]):
        sys.exit("performance/mirror: not a number of units. Usage: performance/mirror [UNITS]")
    count = int(sys.argv[1]) if sys.argv[1:] else 200
    with contextlib.ExitStack() as stack:
        work = Path(stack.enter_context(tempfile.TemporaryDirectory(prefix="mirror-", ignore_cleanup_errors=True)))
        os.environ["GNUPGHOME"] = str(work / "keys")
        (work / "keys").mkdir(mode=0o700)
        subprocess.run(["gpg", "--batch", "--quiet", "--passphrase", "", "--quick-generate-key", "maker", "ed25519",
                        "sign", "never"], check=True)
        stack.callback(subprocess.call, ["gpgconf", "--kill", "all"])
        subprocess.run([ROOT / "packaging/publish", work / "repository", "init", "maker"], check=True)
        publish(work, "1.1")
        public = work / "repository/public"
        work.chmod(0o755)
        (work / "nginx").mkdir(mode=0o777)
        write(work / "nginx.conf", NGINX.format(folder=work / "nginx", port=PORT, root=public))
        server = stack.enter_context(running(["nginx", "-p", work, "-c", work / "nginx.conf"]))
        (work / "cacher").mkdir()
        write(work / "cacher.conf/acng.conf", CACHE.format(folder=work / "cacher", port=CACHE_PORT))
        stack.enter_context(running(["apt-cacher-ng", "-c", work / "cacher.conf"]))
        print(" " * 39 + "units requests    304 connections          bytes   CPU s  wall s  failed")
        cache = f'Acquire::http::Proxy "http://127.0.0.1:{CACHE_PORT}";'
        for way, proxy in (("directly", ""), ("with apt-cacher-ng", cache)):
            units = [work / way.replace(" ", "-") / str(number) for number in range(count)]
            for unit in units:
                make_unit(unit, public / "key.gpg", proxy)
            version = 2 if way == "directly" else 4
            assert update(units[:1]) == 0
            show(f"nothing new, {way}", 1, measure(work, server, units[:1]))
            publish(work, f"1.{version}")
            show(f"a new package, {way}", 1, measure(work, server, units[:1]))
            update(units)
            show(f"nothing new, {way}", count, measure(work, server, units))
            publish(work, f"1.{version + 1}")
            show(f"a new package, {way}", count, measure(work, server, units))


if __name__ == "__main__":
    main()
