"""The release folder: what packaging/release puts into it, and what packaging/verify-release finds.

The tag is one of a repository of the test's own, with this repository's commands and a build of some seconds.
"""

import json
import shutil
import subprocess
from pathlib import Path

import pytest

from bench.makers.files import write_script
from bench.makers.keys import make_key
from tests.commands import needs, output_of

ROOT = Path(__file__).parents[2]
pytestmark = needs("gpg", "git", "dpkg-deb")
# In place of packaging/build: a package and a source with what the release reads of them.
BUILD = """
mkdir -p "$2" tree/DEBIAN tree/usr
cp text tree/usr/text
cat >tree/DEBIAN/control <<END
Package: sample
Version: 1.2.3
Architecture: $(dpkg --print-architecture)
Maintainer: Test <test@localhost>
Depends: libc6
Static-Built-Using: zlib (= 1:1.2)
Description: sample
END
find tree -exec touch --date=@1000000000 {} +
SOURCE_DATE_EPOCH=1000000000 dpkg-deb --root-owner-group --build tree "$2" >/dev/null
echo 'Version: 1.2.3' >"$2/sample.dsc"
cp text "$2/sample_1.2.3.tar.xz"
date --iso-8601=ns >"$2/sample.buildinfo"
touch "$2/sample_1.2.3_$(dpkg --print-architecture).changes"
"""
CHANGELOG = """sample (1.2.3) stable; urgency=medium

  * One.

 -- T <t@localhost>  Sat, 21 Nov 2026 06:00:00 +0000
"""


class Tagged:
    """A repository with the tag v1.2.3."""

    def __init__(self, folder: Path) -> None:
        self.folder = folder
        make_key(self.folder / "keys", "maker", self.folder / "maker.gpg")
        self.source = self.folder / "source"
        shutil.copytree(ROOT / "packaging", self.source / "packaging")
        write_script(self.source / "packaging/build", "set -eu\n" + BUILD)
        shutil.copytree(ROOT / "scripts", self.source / "scripts")
        (self.source / "debian").mkdir()
        (self.source / "debian/changelog").write_text(CHANGELOG)
        (self.source / "text").write_text("first\n")
        self.git("init", "--quiet")
        self.tag("v1.2.3")
        self.release = self.folder / "release"

    def git(self, *words: str) -> None:
        """Runs git in the repository."""
        identity = ["-c", "user.name=T", "-c", "user.email=t@localhost"]
        subprocess.run(["git", "-C", self.source, *identity, *words], stdout=subprocess.DEVNULL, check=True)

    def tag(self, name: str) -> None:
        """Commits everything under the tag."""
        self.git("add", "--all")
        self.git("commit", "--quiet", "--allow-empty", "--message", name)
        self.git("tag", "--force", name)

    def run(self, command: str, *words: str | Path, status: int = 0) -> str:
        """What a command of packaging/ prints; it must end with the status."""
        return output_of(self.source / "packaging" / command, *words, status=status, GNUPGHOME=self.folder / "keys")

    def make(self) -> None:
        """Makes the release folder."""
        self.run("release", "v1.2.3", "maker", self.release, "native")

    def refused(self, says: str, *words: str | Path) -> None:
        """The folder is not verified, for this reason."""
        assert says in self.run("verify-release", self.release, *words, status=1)


@pytest.fixture
def tagged(tmp_path: Path) -> Tagged:
    return Tagged(tmp_path)


def test_folder_is_whole_and_verified(tagged: Tagged) -> None:
    tagged.make()
    architecture = subprocess.check_output(["dpkg", "--print-architecture"], text=True).strip()
    built = [f"sample_1.2.3_{architecture}{ending}" for ending in (".deb", ".cdx.json", ".changes")]
    others = ["sample.dsc", "sample_1.2.3.tar.xz", "sample.buildinfo", "key.gpg", "SHA256SUMS", "SHA256SUMS.sig"]
    assert sorted(path.name for path in tagged.release.iterdir()) == sorted(built + others)
    said = tagged.run("verify-release", tagged.release, tagged.folder / "maker.gpg")
    assert "is v1.2.3: signed, whole, and the same when it is built again" in said


def test_bill_of_materials_has_what_is_inside(tagged: Tagged) -> None:
    tagged.make()
    [file] = tagged.release.glob("*.cdx.json")
    components = json.loads(file.read_text())["components"]
    assert [part["name"] for part in components] == ["zlib", "/usr/text"]
    assert components[0]["version"] == "1:1.2"
    expected = subprocess.check_output(["sha256sum", tagged.source / "text"], text=True).split()[0]
    assert components[1]["hashes"][0]["content"] == expected


def test_tampered_release(tagged: Tagged) -> None:
    tagged.make()
    [package] = tagged.release.glob("*.deb")
    with package.open("ab") as file:
        file.write(b"more")
    tagged.refused("is not what was signed")


def test_added_file(tagged: Tagged) -> None:
    tagged.make()
    (tagged.release / "more.deb").touch()
    tagged.refused("more.deb is not in SHA256SUMS")


def test_tampered_sums(tagged: Tagged) -> None:
    tagged.make()
    with (tagged.release / "SHA256SUMS").open("a") as file:
        file.write("\n")
    tagged.refused("is not signed")


def test_other_key(tagged: Tagged) -> None:
    tagged.make()
    make_key(tagged.folder / "keys", "other", tagged.folder / "other.gpg")
    tagged.refused("is not signed", tagged.folder / "other.gpg")


def test_tag_that_builds_something_else(tagged: Tagged) -> None:
    tagged.make()
    (tagged.source / "text").write_text("second\n")
    tagged.tag("v1.2.3")
    tagged.refused("is not what v1.2.3 builds")


def test_bad_input(tagged: Tagged) -> None:
    release = ("maker", tagged.release, "native")
    assert "there is no tag v9" in tagged.run("release", "v9", *release, status=1)
    tagged.tag("v2.0.0")
    assert "v2.0.0 is not v1.2.3" in tagged.run("release", "v2.0.0", *release, status=1)
    assert "no secret key x" in tagged.run("release", "v1.2.3", "x", tagged.release, status=1)
    assert "Usage:" in tagged.run("release", status=2)
    assert not tagged.release.exists()
    tagged.release.mkdir()
    assert "is there already" in tagged.run("release", "v1.2.3", *release, status=1)
    tagged.refused("is no release folder", tagged.folder / "maker.gpg")
