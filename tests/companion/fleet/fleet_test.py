"""Runs `harl-updater-tool fleet` on generated exports, as they are, repeated, interleaved, cut and damaged, and on real
journals made of them, and compares what it prints with golden/fleet.*. With --write those files get what it prints;
read them before you commit them.
"""

import re
import csv
import json
import shutil
import subprocess
import tarfile
from html.parser import HTMLParser
from pathlib import Path
from typing import Any

import pytest

from bench import scenario
from bench.makers.exports import LOGS, runs, write_exports
from tests.commands import Result, run_command

ROOT = Path(__file__).resolve().parents[3]
GOLDEN = ROOT / "tests/companion/golden"
REMOTE = Path("/lib/systemd/systemd-journal-remote")
UNITS = 24
# The panel of each outcome, as the bench's scenarios expect it.
PANELS = {
    "updated": {"PASS": "pass"},
    "no-update": {"REMOTE": "pass", "MAIN": "pass"},
    "check-failed": {"REMOTE": "fail", "MAIN": "fail"},
    "mirrors-failed": {"REMOTE": "fail", "MAIN": "fail"},
    "package-failed": {"FAIL": "fail"},
    "board-failed": {"FAIL": "fail"},
}


class Fleet:
    """`harl-updater-tool fleet`, and a folder with the exports of some units."""

    def __init__(self, tool: Path, folder: Path, units: int = UNITS) -> None:
        self.tool = tool
        self.folder = folder
        self.exports = folder / "exports"
        write_exports(self.exports, units)

    def run(self, *arguments: str | Path, folder: Path | None = None, text: str = "") -> Result:
        """What the command does."""
        return run_command(self.tool, "fleet", *arguments, folder=folder, text=text)

    def facts(self, *arguments: str | Path, text: str = "") -> tuple[dict[str, Any], list[dict[str, Any]]]:
        """The object of the fleet, and those of its units."""
        first, *units = map(json.loads, self.run("--json", *arguments, text=text).stdout.splitlines())
        return first, units

    def expect_same(self, *inputs: str | Path, text: str = "", repeats: bool = False) -> None:
        """The inputs say of every unit what its export says."""
        wanted, units = self.facts(self.exports)
        found, found_units = self.facts(*inputs, text=text)
        assert found_units == units
        assert (found.pop("repeated_lines") > 0) == repeats
        assert found == {name: value for name, value in wanted.items() if name != "repeated_lines"}


class Journals(Fleet):
    """The same as real journals, of fewer units."""

    def __init__(self, tool: Path, folder: Path) -> None:
        super().__init__(tool, folder, 6)
        self.journals = folder / "journals"
        self.journals.mkdir()
        for path in self.exports.iterdir():
            self.add(f"remote-{path.stem}.journal", path.read_text())

    def add(self, name: str, text: str) -> None:
        """Adds entries to a journal."""
        command: list[str | Path] = [REMOTE, "--output", self.journals / name, "-"]
        subprocess.run(command, input=text, text=True, stderr=subprocess.DEVNULL, check=True)


@pytest.fixture
def fleet(tool: Path, tmp_path: Path) -> Fleet:
    return Fleet(tool, tmp_path)


@pytest.fixture
def journals(tool: Path, tmp_path: Path) -> Journals:
    return Journals(tool, tmp_path)


@pytest.mark.parametrize("form", ["txt", "csv", "json"])
def test_golden_file(fleet: Fleet, pytestconfig: pytest.Config, form: str) -> None:
    option = [] if form == "txt" else [f"--{form}"]
    done = fleet.run(*option, "--since", "2026-11-03", "exports", folder=fleet.folder)
    assert (done.returncode, done.stderr) == (1, "")
    kept = GOLDEN / f"fleet.{form}"
    if pytestconfig.getoption("write"):
        kept.write_text(done.stdout, newline="")
    assert done.stdout == kept.read_bytes().decode()


def test_each_scenario_has_the_outcome_of_its_panel(fleet: Fleet) -> None:
    names = [name for name in scenario.names() if scenario.load(name).setup.updater.program == "remote"]
    logs = {str(LOGS / f"{name}.log"): name for name in names}
    _, units = fleet.facts(*logs)
    assert len(units) == len(names)
    decided = 0
    for unit in units:
        panel = scenario.load(logs[unit["unit"]]).expect.panel
        if unit["outcome"] in PANELS and panel:
            decided += 1
            assert panel in (PANELS[unit["outcome"]], {})
    assert decided > 40


def test_every_run_counts_once(fleet: Fleet) -> None:
    found, units = fleet.facts(fleet.exports)
    assert (found["units"], found["runs"]) == (UNITS, 3 * UNITS)
    for table in ("states", "outcomes", "packages", "boards"):
        assert sum(row["units"] for row in found[table]) == UNITS
        assert sum(row["runs"] for row in found[table]) == 3 * UNITS
    for table in ("outcomes", "packages"):
        assert sum(sum(day[table].values()) for day in found["days"].values()) == 3 * UNITS
    assert {unit["unit"] for unit in units} == {f"unit-{number:05}" for number in range(1, UNITS + 1)}


def test_one_failure(fleet: Fleet) -> None:
    found, units = fleet.facts("--failed", "board-upload-failed", fleet.exports)
    assert units
    assert {unit["failure"] for unit in units} == {"board-upload-failed"}
    assert found["units"] == len(units)


def test_units_that_are_not_seen_keep_their_versions(fleet: Fleet) -> None:
    found, units = fleet.facts("--since", "2027-01-01", fleet.exports)
    assert (found["runs"], found["needing"]) == (0, UNITS)
    assert found["states"] == [{"name": "not-seen", "units": UNITS, "runs": 0}]
    assert {unit["state"] for unit in units} == {"not-seen"}
    versions = {unit["unit"]: (unit["package"], unit["board"]) for unit in fleet.facts(fleet.exports)[1]}
    assert {unit["unit"]: (unit["package"], unit["board"]) for unit in units} == versions


def test_table_for_spreadsheets(fleet: Fleet) -> None:
    rows = list(csv.DictReader(fleet.run("--csv", fleet.exports).stdout.splitlines()))
    units = fleet.facts(fleet.exports)[1]
    assert [row["unit"] for row in rows] == [unit["unit"] for unit in units]
    assert [row["state"] for row in rows] == [unit["state"] for unit in units]


def test_page(fleet: Fleet) -> None:
    page = fleet.folder / "page.html"
    assert fleet.run("--html", page, fleet.exports).returncode == 1
    rows: list[str] = []

    class Rows(HTMLParser):
        """The texts of the table's rows."""

        def handle_starttag(self, tag: str, attrs: list[tuple[str, str | None]]) -> None:
            assert not {"src", "href"} & {name for name, _ in attrs}  # it needs no other files
            if tag == "tr":
                rows.append("")

        def handle_data(self, data: str) -> None:
            if rows:
                rows[-1] += f" {data}"

    Rows().feed(page.read_text())
    for unit in fleet.facts(fleet.exports)[1]:
        [row] = [row for row in rows if f" {unit['unit']} " in row]
        assert unit["meaning"] in row


def test_one_stream_of_all_units(fleet: Fleet) -> None:
    text = "".join(path.read_text() for path in sorted(fleet.exports.iterdir()))
    fleet.expect_same("-", text=text)


def test_units_interleaved(fleet: Fleet) -> None:
    entries = []
    for path in fleet.exports.iterdir():
        entries += [entry + "\n\n" for entry in path.read_text().split("\n\n")[:-1]]
    entries.sort(key=lambda entry: (entry.split("\n")[1], entry.split("\n")[4]))
    fleet.expect_same("-", text="".join(entries))


def test_repeats(fleet: Fleet) -> None:
    for path in fleet.exports.iterdir():
        whole = path.read_text()
        sent = whole.split("\n\n")
        begun = "\n\n".join(sent[: len(sent) // 3]) + "\n\n"
        (fleet.folder / "repeats").mkdir(exist_ok=True)
        (fleet.folder / "repeats" / path.name).write_text(begun + begun + whole + whole)
    fleet.expect_same(fleet.folder / "repeats", repeats=True)


def test_a_unit_in_two_files(fleet: Fleet) -> None:
    first, second = fleet.folder / "first.export", fleet.folder / "second.export"
    one = list(runs(1))
    first.write_text(one[0] + one[1])
    second.write_text(one[1] + one[2])
    found, units = fleet.facts(second, first)
    assert (found["runs"], found["repeated_lines"]) == (3, one[1].count("\nMESSAGE="))
    assert units == fleet.facts(fleet.exports)[1][:1]


@pytest.mark.parametrize("cut", [40, 41, 200, 1000])
def test_cut_file_loses_its_own_run(fleet: Fleet, cut: int) -> None:
    whole = fleet.facts(fleet.exports)[1]
    path = fleet.exports / "unit-00003.export"
    path.write_text("".join(runs(3))[:-cut])
    done = fleet.run(fleet.exports)
    assert done.returncode == 2
    assert re.search(r"unit-00003\.export: cut off: .*\n$", done.stderr)
    _, units = fleet.facts(fleet.exports)
    assert units[:2] + units[3:] == whole[:2] + whole[3:]
    assert units[2]["runs"] <= 3


def test_damaged_file_loses_its_own_run(fleet: Fleet) -> None:
    whole = fleet.facts(fleet.exports)[1]
    first, second, third = runs(3)
    middle = len(second) // 2
    (fleet.exports / "unit-00003.export").write_text(first + second[:middle] + "\0" * 9 + "\n" + third)
    found, units = fleet.facts(fleet.exports)
    assert [item["why"] for item in found["unread"]] == ["damaged: not everything in it is a journal's entry"]
    assert units[:2] + units[3:] == whole[:2] + whole[3:]
    assert units[2] == whole[2] | {"runs": 2}


def test_other_services_do_not_count(fleet: Fleet) -> None:
    text = (fleet.exports / "unit-00001.export").read_text()
    other = text.split("\n\n")[0].replace("=harl-updater", "=other")
    other = other[: other.index("MESSAGE=")] + "MESSAGE=E: Unable to locate package solvik4-rh\n\n"
    mixed = other.join(entry + "\n\n" for entry in text.split("\n\n")[:-1])
    assert fleet.facts("-", text=mixed)[1] == fleet.facts("-", text=text)[1]


def test_saved_logs_and_reports(fleet: Fleet) -> None:
    (fleet.folder / "logs").mkdir()
    shutil.copy(LOGS / "package-only.log", fleet.folder / "logs")
    report = fleet.folder / "report"
    (report / "kept-logs").mkdir(parents=True)
    shutil.copy(LOGS / "journal-short-iso-package-asks.log", report / "journal.txt")
    shutil.copy(LOGS / "journal-short-iso-package-asks.log", report / "kept-logs/1")
    (report / "log.txt").write_text("Updater | of no account\n")
    with tarfile.open(fleet.folder / "logs/report.tar.gz", "w:gz") as archive:
        archive.add(report, "harl-updater-report")
    found, units = fleet.facts(fleet.folder / "logs")
    assert found["unread"] == []
    assert [(unit["outcome"], unit["runs"]) for unit in units] == [("updated", 1), ("package-failed", 1)]


@pytest.mark.parametrize(
    "name, why",
    [("empty", "no record of the updater"), ("broken.tar.gz", "not a whole archive"), ("none", "No such file")],
    ids=["empty", "broken", "none"],
)
def test_what_holds_no_record_is_named(fleet: Fleet, name: str, why: str) -> None:
    (fleet.folder / "empty").touch()
    (fleet.folder / "broken.tar.gz").write_bytes(b"\x1f\x8bnothing")
    done = fleet.run(fleet.folder / name)
    assert done.returncode == 2
    assert why in done.stderr


@pytest.mark.parametrize(
    "arguments, says",
    [
        ("--since 21-11-2026 /dev/null", "21-11-2026 is not a date. Give it as 2026-11-21."),
        ("--since 2026-02-30 /dev/null", "2026-02-30 is not a date."),
        ("--failed nonsense /dev/null", "nonsense is not a name of the catalogue"),
        ("--json --csv /dev/null", "leave one of them out"),
        ("--html /dev/null /dev/null", "/dev/null: not a plain file"),
        ("", "FILE is missing"),
    ],
)
def test_wrong_usage(fleet: Fleet, arguments: str, says: str) -> None:
    done = fleet.run(*arguments.split())
    assert done.returncode == 2
    assert says in done.stderr


@pytest.mark.skipif(not REMOTE.exists(), reason="systemd-journal-remote is not installed; tests/run installs it")
class TestJournals:
    """The units' journals, as systemd-journal-remote receives them."""

    def test_same_as_the_exports(self, journals: Journals) -> None:
        journals.expect_same(journals.journals)

    def test_repeats(self, journals: Journals) -> None:
        for number in (1, 2):
            journals.add(f"remote-unit-{number:05}.journal", "".join(runs(number)))
        journals.expect_same(journals.journals, repeats=True)

    def test_journal_that_went_on_in_another_file(self, journals: Journals) -> None:
        begun, _, rest = "".join(runs(1)).partition("\n\n__CURSOR=s=00000000000000000000000000000001;i=60;")
        for path in journals.journals.glob("*00001*"):
            path.unlink()
        journals.add("remote-unit-00001@1.journal", begun + "\n\n")
        journals.add("remote-unit-00001.journal", "__CURSOR=" + rest)
        journals.expect_same(journals.journals)

    def test_damaged_journals_are_named(self, journals: Journals) -> None:
        whole = journals.facts(journals.journals)[1]
        cut, bad = journals.journals / "remote-unit-00002.journal", journals.journals / "remote-unit-00004.journal"
        cut.write_bytes(cut.read_bytes()[:4000000])
        content = bytearray(bad.read_bytes())
        place = content.rindex(b"MESSAGE=Updater", 0, content.rindex(b"MESSAGE=Updater"))
        content[place - 64 : place] = b"\xff" * 64
        bad.write_bytes(content)
        found, units = journals.facts(journals.journals)
        assert [Path(item["input"]).name for item in found["unread"]] == ["remote-unit-00002", "remote-unit-00004"]
        assert [unit for unit in units if unit["unit"] not in ("unit-00002", "unit-00004")] == whole[:1] + whole[
            2:3
        ] + whole[4:]
