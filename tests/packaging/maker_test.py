"""Usage: maker_test.py BUILD_FOLDER PACKAGE SYSTEM [--write | TEST...]

Runs the maker's day as docs/maker.md has it: each command of the page, those behind "$" on this machine, those behind
"#" on a unit with the built PACKAGE (see tests/service/service_test.py), and compares what it prints with the page.
"..." stands for any text. With --write the page gets what was printed; read it before you commit it.
"""

import os
import re
import shutil
import subprocess
import sys
import tempfile
from pathlib import Path

from bench.makers.files import write, write_script
from bench.makers.packages import SOURCES, Package, build
from bench.makers.sticks import zip_archive
from tests.command_line import skip
from tests.service.service_test import STICK, TOOLS, ServiceTest, main

ROOT = Path(__file__).parents[2]
PAGE = ROOT / "docs/maker.md"
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
WRITE = False


class Maker(ServiceTest):
    """The page, from its first command to the last."""

    def setUp(self) -> None:
        if not self.tool.exists():
            self.skipTest("harl-updater-tool is not built")
        super().setUp()
        holder = tempfile.TemporaryDirectory(prefix="maker-", ignore_cleanup_errors=True)
        self.work = Path(self.enterContext(holder))
        self.set_speed(300)
        self.refused = 0
        fields = {"Section": "misc", "Priority": "optional"}
        package = build(Package("solvik4-rh", "1.3.0", fields), self.work)
        changes = package.with_suffix(".changes")
        subprocess.run(["changestool", "--create", changes, "add", package], check=True)
        subprocess.run(["changestool", changes, "setdistribution", "stable"], check=True)
        (self.work / "OSUpgrade.zip").write_bytes(zip_archive("2.2.0"))
        (self.work / "unzipUpgrade.sh").write_text("#!/bin/sh\nunzip -o /root/OSUpgrade.zip\n")
        (self.work / "usb").mkdir()
        (self.work / "packaging").symlink_to(ROOT / "packaging")
        self.keyring = self.unit.root() / "usr/share/keyrings/harl-updater-stick.gpg"
        self.addCleanup(self.keyring.unlink, missing_ok=True)
        self.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        tools = self.unit.root() / "usr/local/sbin"
        for tool, text in (("ssh", BOARD), ("scp", "exit 0")):
            write_script(tools / tool, text)
            self.addCleanup(write_script, tools / tool, TOOLS[tool])
        sources = self.unit.root() / "etc/apt/sources.list"
        write(sources, "deb [signed-by=/srv/public/key.gpg] file:/srv/public candidate main\n")
        self.addCleanup(write, sources, SOURCES.format(folder="repository"))

    def here(self, command: str) -> str:
        """What a command on the maker's machine prints."""
        environment = os.environ | {
            "GNUPGHOME": str(self.work / "keys"),
            "PATH": f"{self.tool.parent}:{os.environ['PATH']}",
        }
        (self.work / "keys").mkdir(mode=0o700, exist_ok=True)
        done = subprocess.run(
            ["sh", "-c", command],
            cwd=self.work,
            env=environment,
            stdin=subprocess.DEVNULL,
            stdout=subprocess.PIPE,
            stderr=subprocess.STDOUT,
            text=True,
            check=False,
        )
        return done.stdout

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
            self.assertEqual(self.panel(), {"FAIL": "fail"} if refused else {"PASS": "pass"})
            self.refused += refused
            self.inside("sh", "-c", "until journalctl -t harl-updater -o cat | grep -q ^verify: ; do sleep 0.2; done")
            return ""
        return self.inside("sh", "-c", f"{command} || true")

    def test_page(self) -> None:
        page = PAGE.read_text()
        written = page
        for block in re.findall(r"^    .*\n(?:    .*\n|\n(?=    ))*", page, re.MULTILINE):
            said = ""
            for prompt, command in re.findall(r"^    ([$#]) (.*(?:(?<=\\)\n.*)*)\n", block, re.MULTILINE):
                printed = (self.here if prompt == "$" else self.on_unit)(command)
                for pattern, text in CHANGING:
                    printed = re.sub(pattern, text, printed)
                said += f"    {prompt} {command}\n" + re.sub("^(?=.)", "    ", printed, flags=re.MULTILINE)
            if not WRITE and said:
                with self.subTest(block):
                    self.assertEqual(said.strip(), block.strip())
            written = written.replace(block, said.rstrip("\n") + "\n") if said else written
        if WRITE:
            PAGE.write_text(written)
        self.assertEqual(self.refused, 4)  # of the five runs


if __name__ == "__main__":
    if "--write" in sys.argv:
        sys.argv.remove("--write")
        WRITE = True
    if missing := [tool for tool in ("gpg", "reprepro", "changestool") if not shutil.which(tool)]:
        skip(f"not installed: {' '.join(missing)}; tests/run installs them")
    main()
