"""The release folder: what packaging/release puts into it, and what packaging/verify-release finds.

The tag is one of a repository of the test's own, with this repository's commands and a build of some seconds.
"""

import json
import os
import shutil
import subprocess
import tempfile
import unittest
from pathlib import Path

from bench.makers.files import write_script
from bench.makers.keys import make_key
from tests.command_line import skip

ROOT = Path(__file__).parents[2]
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


class Release(unittest.TestCase):
    """A repository with the tag v1.2.3."""

    def setUp(self) -> None:
        holder = tempfile.TemporaryDirectory(prefix="release-", ignore_cleanup_errors=True)
        self.addCleanup(holder.cleanup)
        self.folder = Path(holder.name)
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

    def run_command(self, command: str, *words: str | Path, status: int = 0) -> str:
        """What a command of packaging/ prints; it must end with the status."""
        done = subprocess.run(
            [self.source / "packaging" / command, *words],
            env=os.environ | {"GNUPGHOME": str(self.folder / "keys")},
            stdout=subprocess.PIPE,
            stderr=subprocess.STDOUT,
            text=True,
            check=False,
        )
        self.assertEqual(done.returncode, status, done.stdout)
        return done.stdout

    def make(self) -> None:
        """Makes the release folder."""
        self.run_command("release", "v1.2.3", "maker", self.release, "native")

    def test_folder_is_whole_and_verified(self) -> None:
        self.make()
        architecture = subprocess.check_output(["dpkg", "--print-architecture"], text=True).strip()
        built = [f"sample_1.2.3_{architecture}{ending}" for ending in (".deb", ".cdx.json", ".changes")]
        others = ["sample.dsc", "sample_1.2.3.tar.xz", "sample.buildinfo", "key.gpg", "SHA256SUMS", "SHA256SUMS.sig"]
        self.assertEqual(sorted(path.name for path in self.release.iterdir()), sorted(built + others))
        said = self.run_command("verify-release", self.release, self.folder / "maker.gpg")
        self.assertIn("is v1.2.3: signed, whole, and the same when it is built again", said)

    def test_bill_of_materials_has_what_is_inside(self) -> None:
        self.make()
        [file] = self.release.glob("*.cdx.json")
        components = json.loads(file.read_text())["components"]
        self.assertEqual([part["name"] for part in components], ["zlib", "/usr/text"])
        self.assertEqual(components[0]["version"], "1:1.2")
        expected = subprocess.check_output(["sha256sum", self.source / "text"], text=True).split()[0]
        self.assertEqual(components[1]["hashes"][0]["content"], expected)

    def refused(self, says: str, *words: str | Path) -> None:
        """The folder is not verified, for this reason."""
        self.assertIn(says, self.run_command("verify-release", self.release, *words, status=1))

    def test_tampered_release(self) -> None:
        self.make()
        [package] = self.release.glob("*.deb")
        with package.open("ab") as file:
            file.write(b"more")
        self.refused("is not what was signed")

    def test_added_file(self) -> None:
        self.make()
        (self.release / "more.deb").touch()
        self.refused("more.deb is not in SHA256SUMS")

    def test_tampered_sums(self) -> None:
        self.make()
        with (self.release / "SHA256SUMS").open("a") as file:
            file.write("\n")
        self.refused("is not signed")

    def test_other_key(self) -> None:
        self.make()
        make_key(self.folder / "keys", "other", self.folder / "other.gpg")
        self.refused("is not signed", self.folder / "other.gpg")

    def test_tag_that_builds_something_else(self) -> None:
        self.make()
        (self.source / "text").write_text("second\n")
        self.tag("v1.2.3")
        self.refused("is not what v1.2.3 builds")

    def test_bad_input(self) -> None:
        release = ("maker", self.release, "native")
        self.assertIn("there is no tag v9", self.run_command("release", "v9", *release, status=1))
        self.tag("v2.0.0")
        self.assertIn("v2.0.0 is not v1.2.3", self.run_command("release", "v2.0.0", *release, status=1))
        self.assertIn("no secret key x", self.run_command("release", "v1.2.3", "x", self.release, status=1))
        self.assertIn("Usage:", self.run_command("release", status=2))
        self.assertFalse(self.release.exists())
        self.release.mkdir()
        self.assertIn("is there already", self.run_command("release", "v1.2.3", *release, status=1))
        self.refused("is no release folder", self.folder / "maker.gpg")


if __name__ == "__main__":
    if missing := [tool for tool in ("gpg", "git", "dpkg-deb") if not shutil.which(tool)]:
        skip(f"not installed: {' '.join(missing)}")
    unittest.main()
