"""Versions: banner, build, changelog, package and manual page agree."""

import re
from pathlib import Path

ROOT = Path(__file__).parents[2]


def find(path: str, pattern: str) -> str:
    """The first match of the pattern's group in a file of the repository."""
    match = re.search(pattern, (ROOT / path).read_text(), re.MULTILINE)
    return match[1] if match else f"none in {path}"


def read_changelog(path: str, head: str, bullet: str) -> dict[str, list[str]]:
    """The items of each version; `head` and `bullet` are the patterns of their first lines."""
    versions: dict[str, list[str]] = {}
    for line in (ROOT / path).read_text().splitlines():
        if match := re.match(head, line):
            items = versions.setdefault(match[1], [])
        elif match := re.match(bullet, line):
            items.append(match[1])
        elif line.startswith("  "):
            items[-1] += " " + line.strip()
    return versions


def test_changelogs_agree() -> None:
    whole = read_changelog("CHANGELOG.md", r"## (\S+)", r"- (.*)")
    packages = read_changelog("debian/changelog", r"harl-updater \(([\d.]+)", r"  \* (.*)")
    assert list(packages) == list(whole)
    for version, items in packages.items():
        assert items
        assert [item for item in items if item not in whole[version]] == []


def test_all_follow_the_banner(build: Path) -> None:
    text = re.search(rb"TavrenUpdater version: (\d+\.\d+\.\d+)", (build / "harl-updater").read_bytes())
    assert text
    banner = text[1].decode()
    assert find("CMakeLists.txt", r"project\(harl-updater VERSION ([\d.]+)") == banner
    assert find("CHANGELOG.md", r"^## (\S+)") == banner
    assert find("debian/changelog", r"^harl-updater \((\S+)\)") == banner
    assert find("docs/man/harl-updater.8", r'^\.TH HARL-UPDATER 8 \S+ "harl-updater (\S+)"') == banner
    assert find("docs/man/harl-updater-tool.1", r'^\.TH HARL-UPDATER-TOOL 1 \S+ "harl-updater (\S+)"') == banner
