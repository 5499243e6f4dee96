"""Makes sticks with `harl-updater-tool stick make`, signs and spoils them, and checks them with `stick`."""

import json
import os
import pty
import re
import shutil
import signal
import subprocess
import time
from collections.abc import Iterator
from pathlib import Path

import pytest

from bench.makers.files import write_script
from bench.makers.keys import end_agent, make_key
from bench.makers.sticks import VERSIONS, zip_archive
from tests.commands import needs, output_of, run_command

ROOT = Path(__file__).parents[3]
SCRIPT = "#!/bin/sh\nunzip -o root/OSUpgrade.zip\n"
MANIFEST = "harl-updater.manifest"
pytestmark = needs("gpg", "gpgv", "zip")


class Stick:
    """A folder with what goes on a stick, and the stick."""

    def __init__(self, folder: Path, tool: Path) -> None:
        self.folder = folder
        self.tool = tool
        self.root = folder / "stick"
        self.root.mkdir()
        self.archive = folder / "upgrade.zip"
        self.archive.write_bytes(zip_archive("2.2.0"))
        self.script = folder / "script.sh"
        self.script.write_text(SCRIPT)
        self.keyring = folder / "keys.gpg"
        self.path = f"{folder}/bin:{os.environ['PATH']}"  # stand-ins for tools first

    def command(self, *more: str, version: str = "2.2.0") -> list[str | Path]:
        """The command that makes the stick."""
        made: list[str | Path] = [self.tool, "stick", "make", "--archive", self.archive, "--script", self.script]
        return [*made, "--version", version, *more, self.root]

    def run(self, *words: str | Path, status: int) -> str:
        """What the tool prints for the words after its name; it must end with the status."""
        return output_of(self.tool, *words, status=status, GNUPGHOME=self.folder / "maker", PATH=self.path)

    def make(self, *more: str, status: int = 0, version: str = "2.2.0") -> str:
        """Makes the stick; returns what is printed."""
        return self.run(*self.command(*more, version=version)[1:], status=status)

    def check(self, *more: str | Path, status: int = 0) -> str:
        """What `stick` says, in one line."""
        return " ".join(self.run("stick", *more, self.root, status=status).split())

    def facts(self, *more: str | Path) -> dict[str, str | None]:
        """The facts that `stick` finds."""
        facts: dict[str, str | None] = json.loads(self.run("stick", "--json", *more, self.root, status=0))["facts"]
        return facts

    def files(self) -> dict[str, bytes]:
        """All files of the stick."""
        found = sorted(path for path in self.root.rglob("*") if path.is_file())
        return {str(path.relative_to(self.root)): path.read_bytes() for path in found}

    def refused(self, says: str, status: int = 1, version: str = "2.2.0") -> None:
        """Nothing is written, and the reason is said."""
        before = self.files()
        assert says in self.make(version=version, status=status)
        assert self.files() == before
        assert list(self.root.iterdir()) == []

    def big_archive(self) -> Path:
        """An archive of 100 MB."""
        path = self.folder / "big.zip"
        (self.folder / "zeros").write_bytes(bytes(100_000_000))
        subprocess.run(["zip", "-0", "-q", "-j", path, self.folder / "zeros"], check=True)
        return path

    def wrong(self, says: str) -> None:
        """The stick is not fit, with this complaint."""
        said = self.check("--keyring", self.keyring, status=1)
        separator = ";" if "debs/" in says else ":"
        assert f"The stick is not as the maker signed it{separator} {says}" in said
        assert "[stick-signature]" in said
        assert "Signature:" not in said

    def verify(self, **tools: str) -> tuple[str, str, int]:
        """What the service's verification alone prints, its errors and its status, with tools of these lines."""
        for name, lines in tools.items():
            write_script(self.folder / "bin" / name, lines)
        done = run_command(ROOT / "service/verify-stick", self.root, self.keyring, environment={"PATH": self.path})
        return done.stdout, done.stderr, done.returncode


@pytest.fixture
def stick(tmp_path: Path, tool: Path) -> Stick:
    return Stick(tmp_path, tool)


def mount(folder: Path, limit: str, request: pytest.FixtureRequest) -> None:
    """Mounts a file system of this limit for the test."""
    subprocess.run(["mount", "-t", "tmpfs", "-o", limit, "stick", folder], check=True)
    request.addfinalizer(lambda: subprocess.run(["umount", folder], check=True))


def test_writes_exactly_what_the_updater_expects(stick: Stick) -> None:
    said = stick.make()
    assert "is fit for an update" in " ".join(said.split())  # a long path wraps the line
    assert f"plug it in again and run\n\n    harl-updater-tool stick {stick.root}\n" in said
    expected = {"OSUpgrade.zip": stick.archive.read_bytes(), "unzipUpgrade.sh": SCRIPT.encode()}
    assert stick.files() == {f"{VERSIONS}/quorb2.2.0/{name}": text for name, text in expected.items()}
    assert os.access(stick.root / VERSIONS / "quorb2.2.0/unzipUpgrade.sh", os.X_OK)
    stick.check()


def test_wrong_command_line(stick: Stick) -> None:
    assert "TARGET is missing." in stick.run("stick", "make", status=2)
    assert "--oldest" in stick.make("--oldest", "2.0.0", status=2)


def test_teamviewer_is_a_plain_file(stick: Stick) -> None:
    assert "requested" in stick.make("--teamviewer")
    assert (stick.root / "debs/installTV").is_file()


def test_keeps_what_else_is_on_the_stick(stick: Stick) -> None:
    (stick.root / "debs").mkdir()
    (stick.root / "debs/other").write_text("kept")
    (stick.root / "photo").write_text("kept")
    stick.make()
    assert {"photo", "debs/other"} & set(stick.files()) == {"photo", "debs/other"}


def test_other_version_is_replaced_only_when_told(stick: Stick) -> None:
    stick.make(version="2.1.0")
    before = stick.files()
    assert 'quorb2.1.0" is on the stick. Add --replace' in stick.make(status=2)
    assert stick.files() == before
    stick.make("--replace")
    assert {Path(path).parent.name for path in stick.files()} == {"quorb2.2.0"}
    assert sorted(path.name for path in (stick.root / VERSIONS).iterdir()) == ["quorb2.2.0"]


def test_refuses_what_stick_would_find_wrong(stick: Stick) -> None:
    stick.refused("[version-start]", version="-2.2.0")
    stick.refused("[version-unusual]", version="2.2.0 b")
    stick.refused("cannot be in the name of a folder", version="2:2", status=2)
    stick.refused("cannot be in the name of a folder", version="2.2.", status=2)
    stick.script.write_text("#!/bin/sh\necho\r\n")
    stick.refused("[script-line-ends]")
    stick.script.write_text("echo\n")
    stick.refused("[script-first-line]")
    stick.script.write_text(SCRIPT)
    stick.archive.write_bytes(stick.archive.read_bytes()[:-30])
    stick.refused("[archive-")
    stick.archive.write_bytes(b"")
    stick.refused("is empty", status=2)
    with stick.archive.open("wb") as file:
        file.truncate(1 << 32)
    stick.refused("larger than a file on a stick can be", status=2)
    stick.archive.unlink()
    stick.refused("is missing", status=2)


def test_refuses_what_is_in_the_way(stick: Stick) -> None:
    (stick.root / VERSIONS).mkdir(parents=True)
    (stick.root / VERSIONS / "readme.txt").touch()
    assert "would be taken for the version" in stick.make(status=2)
    shutil.rmtree(stick.root / "debs")
    (stick.root / "debs").symlink_to(stick.folder)
    assert "is no folder" in stick.make(status=2)
    assert not (stick.folder / "QUORB").exists()


def test_stick_that_was_pulled_out_is_recognised_and_made_again(stick: Stick) -> None:
    for name in (".unfinished-quorb2.2.0", ".replaced-quorb2.1.0"):
        (stick.root / VERSIONS / name).mkdir(parents=True)
    assert "[no-version-folder]" in (said := stick.check(status=1))
    assert "not written completely" in said
    stick.make()
    assert os.listdir(stick.root / VERSIONS) == ["quorb2.2.0"]


def test_interruption_leaves_the_version_that_was_there(stick: Stick) -> None:
    stick.make(version="2.1.0")
    before = stick.files()
    stick.archive = stick.big_archive()
    tool = subprocess.Popen(stick.command("--replace"))
    while not (stick.root / VERSIONS / ".unfinished-quorb2.2.0").exists():
        assert tool.poll() is None
        time.sleep(0.001)
    tool.send_signal(signal.SIGINT)
    assert tool.wait() == -signal.SIGINT
    assert stick.files() == before


@pytest.mark.usefixtures("own_mounts")
def test_full_stick_keeps_the_version_that_was_there(stick: Stick, request: pytest.FixtureRequest) -> None:
    mount(stick.root, "size=2m", request)
    stick.make(version="2.1.0")
    before = stick.files()
    stick.archive = stick.big_archive()
    assert "has no room for 100.0 MB" in stick.make("--replace", status=2)
    assert stick.files() == before


def test_terminal_shows_rate_and_time_left(stick: Stick) -> None:
    parent, child = pty.openpty()
    stick.archive = stick.big_archive()
    subprocess.run(stick.command(), stdout=subprocess.DEVNULL, stderr=child, check=True)
    os.close(child)
    shown = os.read(parent, 100_000).decode()
    os.close(parent)
    assert re.search(r"\rComparing: 100 %, \d+ kB/s, 0 s left +\r\n$", shown)


@pytest.fixture
def signed(stick: Stick) -> Iterator[Stick]:
    make_key(stick.folder / "maker", "maker", stick.keyring)
    stick.make("--sign", "maker", "--oldest", "2.0.0")
    yield stick
    end_agent(stick.folder / "maker")


class TestSigned:
    """A signed stick, and what can be wrong with it."""

    def test_good_signature(self, signed: Stick) -> None:
        text = (signed.root / MANIFEST).read_text()
        assert re.search(r"^Format: 1\nVersion: 2.2.0\nOldest: 2.0.0\nDate: \d{4}-\d\d-\d\dT.*Z\nSHA256:\n", text)
        size = signed.archive.stat().st_size
        assert re.search(rf"\n [0-9a-f]{{64}} {size} {VERSIONS}/quorb2.2.0/OSUpgrade.zip\n", text)
        date = re.findall(r"Date: (.*)", text)[0]
        assert f"Signature: good, of {date} " in signed.check("--keyring", signed.keyring)
        assert "Signature: not checked: no keyring is installed or named " in signed.check()
        assert signed.facts("--keyring", signed.keyring)["signature"] == date
        assert signed.facts()["signature"] is None

    def test_changed_file(self, signed: Stick) -> None:
        (signed.root / VERSIONS / "quorb2.2.0/unzipUpgrade.sh").write_text("#!/bin/sh\nreboot\n")
        signed.wrong(f"changed: {VERSIONS}/quorb2.2.0/unzipUpgrade.sh")

    def test_added_file(self, signed: Stick) -> None:
        (signed.root / VERSIONS / "quorb2.2.0/more").touch()
        (signed.root / "debs/installTV").touch()
        signed.wrong(f"added: {VERSIONS}/quorb2.2.0/more")
        signed.wrong("added: debs/installTV")

    def test_missing_file(self, signed: Stick) -> None:
        script = signed.root / VERSIONS / "quorb2.2.0/unzipUpgrade.sh"
        script.rename(signed.root / "moved")
        script.symlink_to("../../../../../moved")
        signed.wrong(f"missing: {VERSIONS}/quorb2.2.0/unzipUpgrade.sh")
        script.unlink()
        script.symlink_to("../../../../moved")  # even one that leads to the signed file
        signed.wrong(f"missing: {VERSIONS}/quorb2.2.0/unzipUpgrade.sh")

    def test_verification_names_every_fault(self, signed: Stick) -> None:
        assert signed.verify() == ("", "", 0)
        folder = f"{VERSIONS}/quorb2.2.0"
        (signed.root / folder / "unzipUpgrade.sh").write_text("")
        (signed.root / folder / "more").touch()
        wrong = f"changed: {folder}/unzipUpgrade.sh\nadded: {folder}/more\n"
        assert signed.verify() == (wrong, "", 1)
        wrong = f"unreadable: {folder}/OSUpgrade.zip\nunreadable: {folder}/unzipUpgrade.sh\nadded: {folder}/more\n"
        assert signed.verify(sha256sum="exit 1") == (wrong, "", 1)

    def test_verification_that_gpgv_does_not_end(self, signed: Stick) -> None:
        for printed, status in (("[GNUPG:] VALIDSIG", 2), ("", 127)):
            wrong = f"the signature cannot be checked: gpgv ended with status {status}\n"
            assert signed.verify(gpgv=f"echo '{printed}'; exit {status}") == (wrong, "", 1)
        shutil.rmtree(signed.root)
        said, errors, status = signed.verify()
        assert (said, status) == ("", 1)
        assert "cd: can't cd to" in errors

    def test_changed_manifest(self, signed: Stick) -> None:
        manifest = signed.root / MANIFEST
        manifest.write_text(manifest.read_text().replace("2.0.0", "1.0.0"))
        signed.wrong("changed: the manifest")

    def test_unknown_key(self, signed: Stick) -> None:
        make_key(signed.folder / "other", "other", signed.keyring)
        signed.wrong("not signed by a known key")

    def test_no_signature(self, signed: Stick) -> None:
        (signed.root / f"{MANIFEST}.sig").unlink()
        signed.wrong("not signed")

    def test_made_again_without_a_key_it_is_not_signed(self, signed: Stick) -> None:
        signed.make("--replace")
        assert MANIFEST not in signed.files()
        signed.wrong("not signed")

    def test_manifest_lists_every_file_in_order(self, signed: Stick) -> None:
        for number in range(20):
            (signed.root / f"debs/{number * 7 % 20:02}").touch()
        signed.make("--replace", "--sign", "maker")
        listed = re.findall(r" (debs/.*)\n", (signed.root / MANIFEST).read_text())
        assert listed == sorted(path for path in signed.files() if path.startswith("debs/"))

    def test_key_that_gpg_does_not_have(self, signed: Stick) -> None:
        assert 'gpg did not sign with the key "nobody".' in signed.make("--replace", "--sign", "nobody", status=2)

    def test_file_that_cannot_be_listed(self, signed: Stick) -> None:
        (signed.root / "debs/a\nb").touch()
        said = signed.make("--replace", "--sign", "maker", status=2)
        assert f'"{signed.root}/debs/a\\nb" cannot be listed in a manifest.' in said

    @pytest.mark.parametrize("lines", ["echo no medium >&2; exit 1", "printf %064d 0; exit 1", "echo 0"])
    def test_file_whose_sum_is_not_known(self, signed: Stick, lines: str) -> None:
        write_script(signed.folder / "bin/sha256sum", lines)
        said = signed.make("--replace", "--sign", "maker", status=2)
        assert '/OSUpgrade.zip" cannot be listed in a manifest.' in said
        assert ("no medium" in said) == ("no medium" in lines)

    def test_link_cannot_be_signed(self, signed: Stick) -> None:
        (signed.root / "debs/link").symlink_to(signed.archive)
        said = signed.make("--replace", "--sign", "maker", status=2)
        assert f'"{signed.root}/debs/link" is no plain file: it cannot be signed.' in said

    @pytest.mark.usefixtures("own_mounts")
    def test_manifest_that_cannot_be_written(self, signed: Stick, request: pytest.FixtureRequest) -> None:
        # room for the stick, debs, QUORB, armhf, the version and its two files
        mount(signed.root, "nr_inodes=7", request)
        said = signed.make("--sign", "maker", status=2)
        assert f'"{signed.root}/{MANIFEST}" cannot be written. Make room on the stick.' in said

    def test_tool_without_the_package_cannot_verify(self, signed: Stick) -> None:
        signed.tool = Path(shutil.copy(signed.tool, signed.folder))
        said = signed.check("--keyring", signed.keyring, status=2)
        assert "The signature cannot be checked: " in said
        assert '/lib/harl-updater/verify-stick" is not there. [stick-signature]' in said

    def test_nothing_for_the_board_is_nothing_to_verify(self, signed: Stick) -> None:
        shutil.rmtree(signed.root / "debs/QUORB")
        assert "stick-signature" not in signed.check("--keyring", signed.keyring, status=1)
        assert signed.verify() == ("", "", 0)
