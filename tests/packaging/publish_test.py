"""The maker's repository: what `packaging/publish` takes, promotes, refuses and keeps."""

import os
import re
import shutil
import tempfile
from pathlib import Path

import pytest

from bench.makers.keys import make_key
from bench.makers.packages import Package, build
from tests.commands import needs, output_of

ROOT = Path(__file__).parents[2]
pytestmark = needs("gpg", "reprepro", "changestool")


class Repository:
    """A repository with 1.2.0 as stable, in a folder with its keys."""

    def __init__(self, folder: Path) -> None:
        self.folder = folder
        self.keys = folder / "keys"
        make_key(self.keys, "maker", folder / "maker.gpg")
        self.place = folder / "repository"
        self.publish("init", "maker")
        self.add_and_promote("1.2.0")

    def run(self, *command: str | Path, status: int = 0) -> str:
        """What the command prints; it must end with the status."""
        return output_of(*command, status=status, GNUPGHOME=self.keys)

    def publish(self, *words: str | Path, status: int = 0) -> str:
        """What packaging/publish prints."""
        return self.run(ROOT / "packaging/publish", self.place, *words, status=status)

    def changes(self, version: str, content: str = "", key: str = "maker") -> Path:
        """A built package, with a .changes that the key has signed; "" for none."""
        place = Path(tempfile.mkdtemp(dir=self.folder))
        fields = {"Section": "misc", "Priority": "optional"}
        package = build(Package("solvik4-rh", version, fields, files={"opt/solvik4/text": content or version}), place)
        changes = place / "upload.changes"
        self.run("changestool", "--create", changes, "add", package)
        self.run("changestool", changes, "setdistribution", "stable")
        if key:
            signed = place / "signed.changes"
            self.run("gpg", "--batch", "--quiet", "--local-user", key, "--output", signed, "--clear-sign", changes)
            return signed
        return changes

    def add(self, version: str) -> None:
        """Publishes a version as candidate."""
        self.publish("add", self.changes(version))

    def add_and_promote(self, version: str) -> None:
        """Publishes a version as candidate, then as stable."""
        self.add(version)
        self.publish("promote", "solvik4-rh")

    def suites(self) -> dict[str, str]:
        """The version in each suite, as an apt client reads it from the folder that is served."""
        found = {}
        for suite in ("candidate", "stable"):
            release = self.place / "public/dists" / suite
            self.run("gpgv", "--keyring", self.place / "public/key.gpg", release / "InRelease")
            match = re.search("^Version: (.*)$", (release / "main/binary-armhf/Packages").read_text(), re.MULTILINE)
            found[suite] = match[1] if match else ""
        return found

    def refused(self, changes: Path, says: str) -> None:
        """The upload changes nothing, and one line explains why."""
        before = self.suites()
        said = self.publish("add", changes, status=1)
        assert said.count("\n") == 1, said
        assert says in said
        assert self.suites() == before


@pytest.fixture
def repository(tmp_path: Path) -> Repository:
    return Repository(tmp_path)


def test_candidate_then_stable(repository: Repository) -> None:
    repository.add("1.3.0")
    assert repository.suites() == {"candidate": "1.3.0", "stable": "1.2.0"}
    repository.publish("promote", "solvik4-rh")
    assert repository.suites() == {"candidate": "1.3.0", "stable": "1.3.0"}
    assert "candidate|main|armhf: solvik4-rh 1.3.0" in repository.publish("list")


def test_old_files_are_archived(repository: Repository) -> None:
    assert not (repository.place / "archive").exists()
    repository.add_and_promote("1.3.0")
    assert os.listdir(repository.place / "archive") == ["solvik4-rh_1.2.0_all.deb"]


def test_refuses_what_is_not_signed(repository: Repository) -> None:
    repository.refused(repository.changes("1.3.0", key=""), "is not signed by the repository's key")
    make_key(repository.keys, "other", repository.folder / "other.gpg")
    repository.refused(repository.changes("1.3.0", key="other"), "is not signed by the repository's key")
    tampered = repository.changes("1.3.0")
    tampered.write_text(tampered.read_text().replace("1.3.0", "1.3.1"))
    repository.refused(tampered, "is not signed by the repository's key")


def test_refuses_what_is_not_the_file_that_was_signed(repository: Repository) -> None:
    changes = repository.changes("1.3.0")
    shutil.copy(repository.changes("1.3.0", "other").parent / "solvik4-rh_1.3.0_all.deb", changes.parent)
    before = repository.suites()
    repository.publish("add", changes, status=1)
    assert repository.suites() == before


def test_refuses_a_lower_version(repository: Repository) -> None:
    repository.refused(repository.changes("1.1.0"), "solvik4-rh 1.1.0 is lower than 1.2.0 in candidate")


def test_refuses_a_version_with_another_content(repository: Repository) -> None:
    repository.refused(repository.changes("1.2.0", "other"), "solvik4-rh 1.2.0 was published with another content")


def test_same_version_and_content_changes_nothing(repository: Repository) -> None:
    changes = repository.changes("1.3.0")
    repository.publish("add", changes)
    repository.publish("add", changes)
    assert repository.suites() == {"candidate": "1.3.0", "stable": "1.2.0"}


def test_going_back_is_the_old_content_as_a_higher_version(repository: Repository) -> None:
    repository.add_and_promote("1.3.0")
    repository.publish("go-back", "solvik4-rh", "1.2.0", "1.3.0+back1.2.0")
    assert repository.suites() == {"candidate": "1.3.0+back1.2.0", "stable": "1.3.0"}
    [package] = (repository.place / "public/pool").rglob("*back*.deb")
    repository.run("dpkg-deb", "--extract", package, repository.folder / "out")
    assert (repository.folder / "out/opt/solvik4/text").read_text() == "1.2.0"
    assert "is not higher" in repository.publish("go-back", "solvik4-rh", "1.2.0", "1.2.0", status=1)
    assert "there is no" in repository.publish("go-back", "solvik4-rh", "1.0.0", "1.4.0", status=1)


def test_bad_input(repository: Repository) -> None:
    assert "is there already" in repository.publish("init", "maker", status=1)
    assert "candidate has nothing of nothing" in repository.publish("promote", "nothing", status=1)
    assert "is missing" in repository.publish("add", "nothing.changes", status=1)
    assert "Usage:" in repository.publish("nonsense", status=2)
    repository.place = repository.folder / "other"
    assert "is no repository" in repository.publish("list", status=1)
    assert "gpg has no key nobody" in repository.publish("init", "nobody", status=1)
