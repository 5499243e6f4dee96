"""Runs the maker's day as docs/maker.md has it: each command of the page, those behind "$" on this machine, those
behind "#" on a unit with the built package, and compares what it prints with the page. "..." stands for any text. With
--write the page gets what was printed; read it before you commit it.
"""

import os
import re
import shutil
import subprocess
from collections.abc import Iterator
from pathlib import Path

import pytest

from bench.machine.machine import Machine
from bench.makers.packages import Package, build
from bench.makers.sticks import zip_archive
from tests.commands import needs, output_of
from tests.service.service import STICK, Service, prepared

ROOT = Path(__file__).parents[2]
PAGE = ROOT / "docs/maker.md"
pytestmark = needs("gpg", "reprepro", "changestool")
CHANGING = [  # what differs from run to run
    (r"\d{4}-\d\d-\d\dT\d\d:\d\d:\d\dZ", "..."),
    (r"\b[\d,]+(\.\d+ [kM]B \([\d,]+)? bytes\)?", "... bytes"),
]
BOARD = """
case $* in
*version.txt*) printf 'Brimvale\\t%s\\r\\n' "$(cat /srv/board)" ;;
*unzipUpgrade*) echo 2.2.0 >/srv/board ;;
esac
"""


class Maker(Service):
    """The maker, with his folder `work`, and a unit."""

    def __init__(self, unit: Machine, package: str, tool: Path, work: Path) -> None:
        super().__init__(unit, package)
        self.tool = tool
        self.work = work
        self.keyring = unit.root() / "usr/share/keyrings/harl-updater-stick.gpg"
        self.refused = 0

    def prepare(self) -> None:
        super().prepare()
        self.set_speed(300)
        fields = {"Section": "misc", "Priority": "optional"}
        package = build(Package("solvik4-rh", "1.3.0", fields), self.work)
        changes = package.with_suffix(".changes")
        subprocess.run(["changestool", "--create", changes, "add", package], check=True)
        subprocess.run(["changestool", changes, "setdistribution", "stable"], check=True)
        (self.work / "OSUpgrade.zip").write_bytes(zip_archive("2.2.0"))
        (self.work / "unzipUpgrade.sh").write_text("#!/bin/sh\nunzip -o /root/OSUpgrade.zip\n")
        (self.work / "usb").mkdir()
        (self.work / "packaging").symlink_to(ROOT / "packaging")
        self.later.callback(self.keyring.unlink, missing_ok=True)
        self.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        self.put_tool("ssh", BOARD)
        self.put_tool("scp", "exit 0")
        self.put("etc/apt/sources.list", "deb [signed-by=/srv/public/key.gpg] file:/srv/public candidate main\n")

    def here(self, command: str) -> str:
        """What a command on the maker's machine prints, whatever its status."""
        (self.work / "keys").mkdir(mode=0o700, exist_ok=True)
        path = f"{self.tool.parent}:{os.environ['PATH']}"
        line = f"({command}\n) || :"
        return output_of("sh", "-c", line, folder=self.work, GNUPGHOME=self.work / "keys", PATH=path)

    def on_unit(self, command: str) -> str:
        """What a command on the unit prints, with the stick plugged in, the maker's keyring and his repository."""
        if self.unit.status("mountpoint", "-q", STICK) != 0:
            self.inside("sh", "-c", f"mount -t tmpfs stick {STICK}")
        mounted = self.unit.root() / STICK.lstrip("/")
        self.inside("sh", "-c", f"rm -rf {STICK}/* /srv/public")
        shutil.copytree(self.work / "usb", mounted, dirs_exist_ok=True)
        shutil.copytree(self.work / "repository/public", self.unit.root() / "srv/public")
        shutil.copy(self.work / "harl-updater-stick.gpg", self.keyring)
        if command == "systemctl start harl-updater":
            self.note_journal()
            self.inside("sh", "-c", ": >/var/log/panel")
            self.unit.status("systemctl", "start", "harl-updater")
            self.wait_for_end()
            self.assert_given_back()
            refused = "prepare: the updater is not run" in self.journal()
            assert self.panel() == ({"FAIL": "fail"} if refused else {"PASS": "pass"})
            self.refused += refused
            self.inside("sh", "-c", "until journalctl -t harl-updater -o cat | grep -q ^verify: ; do sleep 0.2; done")
            return ""
        return self.inside("sh", "-c", f"{command} || true")


@pytest.fixture
def maker(unit: Machine, package: str, tool: Path, tmp_path: Path) -> Iterator[Maker]:
    if not tool.exists():
        pytest.skip("harl-updater-tool is not built")
    yield from prepared(Maker(unit, package, tool, tmp_path))


def test_page(maker: Maker, pytestconfig: pytest.Config) -> None:
    """From its first command to the last."""
    page = written = PAGE.read_text()
    for block in re.findall(r"^    .*\n(?:    .*\n|\n(?=    ))*", page, re.MULTILINE):
        said = ""
        for prompt, command in re.findall(r"^    ([$#]) (.*(?:(?<=\\)\n.*)*)\n", block, re.MULTILINE):
            printed = (maker.here if prompt == "$" else maker.on_unit)(command)
            for pattern, text in CHANGING:
                printed = re.sub(pattern, text, printed)
            said += f"    {prompt} {command}\n" + re.sub("^(?=.)", "    ", printed, flags=re.MULTILINE)
        written = written.replace(block, said.rstrip("\n") + "\n") if said else written
    if pytestconfig.getoption("write"):
        PAGE.write_text(written)
    else:
        assert written == page
    assert maker.refused == 4  # of the five runs
