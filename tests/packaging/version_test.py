"""Versions: banner, build, changelog, package and manual page agree."""

import re
import unittest
from pathlib import Path

ROOT = Path(__file__).parents[2]


def find(path: str, pattern: str) -> str:
    """The first match of the pattern's group in a file of the repository."""
    match = re.search(pattern, (ROOT / path).read_text(), re.MULTILINE)
    return match[1] if match else f"none in {path}"


class Version(unittest.TestCase):
    """The banner is the reference for the others."""

    def test_all_follow_the_banner(self) -> None:
        banner = find("remote/main.cpp", r"TavrenUpdater version: ([\d.]+)")
        self.assertRegex(banner, r"^\d+\.\d+\.\d+$")
        self.assertEqual(find("CMakeLists.txt", r"project\(harl-updater VERSION ([\d.]+)"), banner)
        self.assertEqual(find("CHANGELOG.md", r"^## (\S+)"), banner)
        self.assertEqual(find("debian/changelog", r"^harl-updater \((\S+)\)"), banner)
        self.assertEqual(find("docs/man/harl-updater.8", r'^\.TH HARL-UPDATER 8 \S+ "harl-updater (\S+)"'), banner)
        self.assertEqual(find("docs/man/harl-updater-tool.1", r'^\.TH HARL-UPDATER-TOOL 1 \S+ "harl-updater (\S+)"'),
                         banner)


if __name__ == "__main__":
    unittest.main()
