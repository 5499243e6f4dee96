"""The maker's repository: what `packaging/publish` takes, promotes, refuses and keeps."""

import os
import re
import shutil
import subprocess
import tempfile
import unittest
from pathlib import Path

from bench.makers.keys import make_key
from bench.makers.packages import Package, build
from tests.command_line import skip

ROOT = Path(__file__).parents[2]


class Publish(unittest.TestCase):
    """A repository with 1.2.0 as stable."""

    def setUp(self) -> None:
        holder = tempfile.TemporaryDirectory(prefix="publish-", ignore_cleanup_errors=True)
        self.addCleanup(holder.cleanup)
        self.folder = Path(holder.name)
        self.keys = self.folder / "keys"
        make_key(self.keys, "maker", self.folder / "maker.gpg")
        self.repository = self.folder / "repository"
        self.publish("init", "maker")
        self.add("1.2.0")
        self.publish("promote", "solvik4-rh")

    def run_command(self, command: list[str | Path], status: int) -> str:
        """What the command prints; it must end with the status."""
        done = subprocess.run(
            command,
            env=os.environ | {"GNUPGHOME": str(self.keys)},
            stdout=subprocess.PIPE,
            stderr=subprocess.STDOUT,
            text=True,
            check=False,
        )
        self.assertEqual(done.returncode, status, done.stdout)
        return done.stdout

    def publish(self, *words: str | Path, status: int = 0) -> str:
        """What packaging/publish prints."""
        return self.run_command([ROOT / "packaging/publish", self.repository, *words], status)

    def changes(self, version: str, content: str = "", key: str = "maker") -> Path:
        """A built package, with a .changes that the key has signed; "" for none."""
        place = Path(tempfile.mkdtemp(dir=self.folder))
        fields = {"Section": "misc", "Priority": "optional"}
        package = build(Package("solvik4-rh", version, fields, files={"opt/solvik4/text": content or version}), place)
        changes = place / "upload.changes"
        self.run_command(["changestool", "--create", changes, "add", package], 0)
        self.run_command(["changestool", changes, "setdistribution", "stable"], 0)
        if key:
            signed = place / "signed.changes"
            sign = ["gpg", "--batch", "--quiet", "--local-user", key, "--output", str(signed), "--clear-sign"]
            self.run_command([*sign, changes], 0)
            return signed
        return changes

    def add(self, version: str) -> None:
        """Publishes a version as candidate."""
        self.publish("add", self.changes(version))

    def suites(self) -> dict[str, str]:
        """The version in each suite, as an apt client reads it from the folder that is served."""
        found = {}
        for suite in ("candidate", "stable"):
            release = self.repository / "public/dists" / suite
            self.run_command(["gpgv", "--keyring", self.repository / "public/key.gpg", release / "InRelease"], 0)
            match = re.search("^Version: (.*)$", (release / "main/binary-armhf/Packages").read_text(), re.MULTILINE)
            found[suite] = match[1] if match else ""
        return found

    def refused(self, changes: Path, says: str) -> None:
        """The upload changes nothing, and one line explains why."""
        before = self.suites()
        said = self.publish("add", changes, status=1)
        self.assertEqual(said.count("\n"), 1, said)
        self.assertIn(says, said)
        self.assertEqual(self.suites(), before)

    def test_candidate_then_stable(self) -> None:
        self.add("1.3.0")
        self.assertEqual(self.suites(), {"candidate": "1.3.0", "stable": "1.2.0"})
        self.publish("promote", "solvik4-rh")
        self.assertEqual(self.suites(), {"candidate": "1.3.0", "stable": "1.3.0"})
        self.assertIn("candidate|main|armhf: solvik4-rh 1.3.0", self.publish("list"))

    def test_old_files_are_archived(self) -> None:
        self.assertFalse((self.repository / "archive").exists())
        self.test_candidate_then_stable()
        self.assertEqual(os.listdir(self.repository / "archive"), ["solvik4-rh_1.2.0_all.deb"])

    def test_refuses_what_is_not_signed(self) -> None:
        self.refused(self.changes("1.3.0", key=""), "is not signed by the repository's key")
        make_key(self.keys, "other", self.folder / "other.gpg")
        self.refused(self.changes("1.3.0", key="other"), "is not signed by the repository's key")
        tampered = self.changes("1.3.0")
        tampered.write_text(tampered.read_text().replace("1.3.0", "1.3.1"))
        self.refused(tampered, "is not signed by the repository's key")

    def test_refuses_what_is_not_the_file_that_was_signed(self) -> None:
        changes = self.changes("1.3.0")
        shutil.copy(self.changes("1.3.0", "other").parent / "solvik4-rh_1.3.0_all.deb", changes.parent)
        before = self.suites()
        self.publish("add", changes, status=1)
        self.assertEqual(self.suites(), before)

    def test_refuses_a_lower_version(self) -> None:
        self.refused(self.changes("1.1.0"), "solvik4-rh 1.1.0 is lower than 1.2.0 in candidate")

    def test_refuses_a_version_with_another_content(self) -> None:
        self.refused(self.changes("1.2.0", "other"), "solvik4-rh 1.2.0 was published with another content")

    def test_same_version_and_content_changes_nothing(self) -> None:
        changes = self.changes("1.3.0")
        self.publish("add", changes)
        self.publish("add", changes)
        self.assertEqual(self.suites(), {"candidate": "1.3.0", "stable": "1.2.0"})

    def test_going_back_is_the_old_content_as_a_higher_version(self) -> None:
        self.test_candidate_then_stable()
        self.publish("go-back", "solvik4-rh", "1.2.0", "1.3.0+back1.2.0")
        self.assertEqual(self.suites(), {"candidate": "1.3.0+back1.2.0", "stable": "1.3.0"})
        [package] = (self.repository / "public/pool").rglob("*back*.deb")
        self.run_command(["dpkg-deb", "--extract", package, self.folder / "out"], 0)
        self.assertEqual((self.folder / "out/opt/solvik4/text").read_text(), "1.2.0")
        self.assertIn("is not higher", self.publish("go-back", "solvik4-rh", "1.2.0", "1.2.0", status=1))
        self.assertIn("there is no", self.publish("go-back", "solvik4-rh", "1.0.0", "1.4.0", status=1))

    def test_bad_input(self) -> None:
        self.assertIn("is there already", self.publish("init", "maker", status=1))
        self.assertIn("candidate has nothing of nothing", self.publish("promote", "nothing", status=1))
        self.assertIn("is missing", self.publish("add", "nothing.changes", status=1))
        self.assertIn("Usage:", self.publish("nonsense", status=2))
        self.repository = self.folder / "other"
        self.assertIn("is no repository", self.publish("list", status=1))
        self.assertIn("gpg has no key nobody", self.publish("init", "nobody", status=1))


if __name__ == "__main__":
    if missing := [tool for tool in ("gpg", "reprepro", "changestool") if not shutil.which(tool)]:
        skip(f"not installed: {' '.join(missing)}; packaging/publish installs them")
    unittest.main()
