"""Usage: fleet_test.py TOOL [--write | TEST...]

Runs `harl-updater-tool fleet` on generated exports, as they are, repeated, interleaved, cut and damaged, and on real
journals made of them, and compares what it prints with golden/fleet.*. With --write those files get what
it prints; read them before you commit them.
"""

import csv
import json
import shutil
import subprocess
import sys
import tarfile
import tempfile
import unittest
from html.parser import HTMLParser
from pathlib import Path
from typing import Any

from bench import scenario
from bench.makers.exports import LOGS, runs, write_exports
from tests.command_line import take_path

ROOT = Path(__file__).resolve().parents[3]
GOLDEN = ROOT / "tests/companion/golden"
REMOTE = Path("/lib/systemd/systemd-journal-remote")
UNITS = 24
TOOL = Path()
WRITE = False
# The panel of each outcome, as the bench's scenarios expect it.
PANELS = {
    "updated": {"PASS": "pass"},
    "no-update": {"REMOTE": "pass", "MAIN": "pass"},
    "check-failed": {"REMOTE": "fail", "MAIN": "fail"},
    "mirrors-failed": {"REMOTE": "fail", "MAIN": "fail"},
    "package-failed": {"FAIL": "fail"},
    "board-failed": {"FAIL": "fail"},
}


def fleet(*arguments: str | Path, folder: Path | None = None, text: str = "") -> subprocess.CompletedProcess[str]:
    """What the command prints."""
    command: list[str | Path] = [TOOL, "fleet", *arguments]
    return subprocess.run(command, cwd=folder, input=text, capture_output=True, text=True, check=False)


def facts(*arguments: str | Path, text: str = "") -> tuple[dict[str, Any], list[dict[str, Any]]]:
    """The object of the fleet, and those of its units."""
    first, *units = map(json.loads, fleet("--json", *arguments, text=text).stdout.splitlines())
    return first, units


class FleetTest(unittest.TestCase):
    """A folder with the exports of some units."""

    units = UNITS

    def setUp(self) -> None:
        self.maxDiff = None
        holder = tempfile.TemporaryDirectory(prefix="fleet-test-")
        self.addCleanup(holder.cleanup)
        self.folder = Path(holder.name)
        self.exports = self.folder / "exports"
        write_exports(self.exports, self.units)

    def expect_same(self, *inputs: str | Path, text: str = "", repeats: bool = False) -> None:
        """The inputs say of every unit what its export says."""
        wanted, units = facts(self.exports)
        found, found_units = facts(*inputs, text=text)
        self.assertEqual(found_units, units)
        self.assertEqual(found.pop("repeated_lines") > 0, repeats)
        self.assertEqual(found, {name: value for name, value in wanted.items() if name != "repeated_lines"})


class Answers(FleetTest):
    """What it says of the units."""

    def test_golden_files(self) -> None:
        for form in ("txt", "csv", "json"):
            option = [] if form == "txt" else [f"--{form}"]
            done = fleet(*option, "--since", "2026-11-03", "exports", folder=self.folder)
            self.assertEqual((done.returncode, done.stderr), (1, ""))
            kept = GOLDEN / f"fleet.{form}"
            if WRITE:
                kept.write_text(done.stdout, newline="")
            self.assertEqual(done.stdout, kept.read_bytes().decode())

    def test_each_scenario_has_the_outcome_of_its_panel(self) -> None:
        names = [name for name in scenario.names() if scenario.load(name).setup.updater.program == "remote"]
        logs = {str(LOGS / f"{name}.log"): name for name in names}
        _, units = facts(*logs)
        self.assertEqual(len(units), len(names))
        decided = 0
        for unit in units:
            panel = scenario.load(logs[unit["unit"]]).expect.panel
            with self.subTest(unit["unit"]):
                if unit["outcome"] in PANELS and panel:
                    decided += 1
                    self.assertIn(panel, (PANELS[unit["outcome"]], {}))
        self.assertGreater(decided, 40)

    def test_every_run_counts_once(self) -> None:
        found, units = facts(self.exports)
        self.assertEqual((found["units"], found["runs"]), (UNITS, 3 * UNITS))
        for table in ("states", "outcomes", "packages", "boards"):
            self.assertEqual(sum(row["units"] for row in found[table]), UNITS)
            self.assertEqual(sum(row["runs"] for row in found[table]), 3 * UNITS)
        for table in ("outcomes", "packages"):
            self.assertEqual(sum(sum(day[table].values()) for day in found["days"].values()), 3 * UNITS)
        self.assertEqual({unit["unit"] for unit in units}, {f"unit-{number:05}" for number in range(1, UNITS + 1)})

    def test_one_failure(self) -> None:
        found, units = facts("--failed", "board-upload-failed", self.exports)
        self.assertTrue(units)
        self.assertEqual({unit["failure"] for unit in units}, {"board-upload-failed"})
        self.assertEqual(found["units"], len(units))

    def test_units_that_are_not_seen_keep_their_versions(self) -> None:
        found, units = facts("--since", "2027-01-01", self.exports)
        self.assertEqual((found["runs"], found["needing"]), (0, UNITS))
        self.assertEqual(found["states"], [{"name": "not-seen", "units": UNITS, "runs": 0}])
        self.assertEqual({unit["state"] for unit in units}, {"not-seen"})
        versions = {unit["unit"]: (unit["package"], unit["board"]) for unit in facts(self.exports)[1]}
        self.assertEqual({unit["unit"]: (unit["package"], unit["board"]) for unit in units}, versions)

    def test_table_for_spreadsheets(self) -> None:
        rows = list(csv.DictReader(fleet("--csv", self.exports).stdout.splitlines()))
        units = facts(self.exports)[1]
        self.assertEqual([row["unit"] for row in rows], [unit["unit"] for unit in units])
        self.assertEqual([row["state"] for row in rows], [unit["state"] for unit in units])

    def test_page(self) -> None:
        page = self.folder / "page.html"
        self.assertEqual(fleet("--html", page, self.exports).returncode, 1)
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
        for unit in facts(self.exports)[1]:
            [row] = [row for row in rows if f" {unit['unit']} " in row]
            self.assertIn(unit["meaning"], row)


class Inputs(FleetTest):
    """The same runs, in other ways."""

    def test_one_stream_of_all_units(self) -> None:
        text = "".join(path.read_text() for path in sorted(self.exports.iterdir()))
        self.expect_same("-", text=text)

    def test_units_interleaved(self) -> None:
        entries = []
        for path in self.exports.iterdir():
            entries += [entry + "\n\n" for entry in path.read_text().split("\n\n")[:-1]]
        entries.sort(key=lambda entry: (entry.split("\n")[1], entry.split("\n")[4]))
        self.expect_same("-", text="".join(entries))

    def test_repeats(self) -> None:
        for path in self.exports.iterdir():
            whole = path.read_text()
            sent = whole.split("\n\n")
            begun = "\n\n".join(sent[: len(sent) // 3]) + "\n\n"
            (self.folder / "repeats").mkdir(exist_ok=True)
            (self.folder / "repeats" / path.name).write_text(begun + begun + whole + whole)
        self.expect_same(self.folder / "repeats", repeats=True)

    def test_a_unit_in_two_files(self) -> None:
        first, second = self.folder / "first.export", self.folder / "second.export"
        one = list(runs(1))
        first.write_text(one[0] + one[1])
        second.write_text(one[1] + one[2])
        found, units = facts(second, first)
        self.assertEqual((found["runs"], found["repeated_lines"]), (3, one[1].count("\nMESSAGE=")))
        self.assertEqual(units, facts(self.exports)[1][:1])

    def test_cut_file_loses_its_own_run(self) -> None:
        whole = facts(self.exports)[1]
        for cut in (40, 41, 200, 1000):
            with self.subTest(cut):
                path = self.exports / "unit-00003.export"
                path.write_text("".join(runs(3))[:-cut])
                done = fleet(self.exports)
                self.assertEqual(done.returncode, 2)
                self.assertRegex(done.stderr, r"unit-00003\.export: cut off: .*\n$")
                _, units = facts(self.exports)
                self.assertEqual(units[:2] + units[3:], whole[:2] + whole[3:])
                self.assertLessEqual(units[2]["runs"], 3)

    def test_damaged_file_loses_its_own_run(self) -> None:
        whole = facts(self.exports)[1]
        first, second, third = runs(3)
        middle = len(second) // 2
        (self.exports / "unit-00003.export").write_text(first + second[:middle] + "\0" * 9 + "\n" + third)
        found, units = facts(self.exports)
        self.assertEqual([item["why"] for item in found["unread"]],
                         ["damaged: not everything in it is a journal's entry"])
        self.assertEqual(units[:2] + units[3:], whole[:2] + whole[3:])
        self.assertEqual(units[2], whole[2] | {"runs": 2})

    def test_other_services_do_not_count(self) -> None:
        text = (self.exports / "unit-00001.export").read_text()
        other = text.split("\n\n")[0].replace("=harl-updater", "=other")
        other = other[: other.index("MESSAGE=")] + "MESSAGE=E: Unable to locate package solvik4-rh\n\n"
        mixed = other.join(entry + "\n\n" for entry in text.split("\n\n")[:-1])
        self.assertEqual(facts("-", text=mixed)[1], facts("-", text=text)[1])

    def test_saved_logs_and_reports(self) -> None:
        (self.folder / "logs").mkdir()
        shutil.copy(LOGS / "package-only.log", self.folder / "logs")
        report = self.folder / "report"
        (report / "kept-logs").mkdir(parents=True)
        shutil.copy(LOGS / "journal-short-iso-package-asks.log", report / "journal.txt")
        shutil.copy(LOGS / "journal-short-iso-package-asks.log", report / "kept-logs/1")
        (report / "log.txt").write_text("Updater | of no account\n")
        with tarfile.open(self.folder / "logs/report.tar.gz", "w:gz") as archive:
            archive.add(report, "harl-updater-report")
        found, units = facts(self.folder / "logs")
        self.assertEqual(found["unread"], [])
        self.assertEqual([(unit["outcome"], unit["runs"]) for unit in units], [("updated", 1), ("package-failed", 1)])

    def test_what_holds_no_record_is_named(self) -> None:
        (self.folder / "empty").touch()
        (self.folder / "broken.tar.gz").write_bytes(b"\x1f\x8bnothing")
        for name, why in (("empty", "no record of the updater"), ("broken.tar.gz", "not a whole archive"),
                          ("none", "No such file")):
            done = fleet(self.folder / name)
            self.assertEqual(done.returncode, 2)
            self.assertIn(why, done.stderr)

    def test_wrong_usage(self) -> None:
        for arguments, text in (
            (["--since", "21-11-2026"], "21-11-2026 is not a date. Give it as 2026-11-21."),
            (["--since", "2026-02-30"], "2026-02-30 is not a date."),
            (["--failed", "nonsense"], "nonsense is not a name of the catalogue"),
            (["--json", "--csv"], "leave one of them out"),
            (["--html", "/dev/null"], "/dev/null: not a plain file"),
        ):
            done = fleet(*arguments, "/dev/null")
            self.assertEqual(done.returncode, 2)
            self.assertIn(text, done.stderr)
        self.assertIn("FILE is missing", fleet().stderr)


@unittest.skipUnless(REMOTE.exists(), "systemd-journal-remote is not installed; tests/run installs it")
class Journals(FleetTest):
    """Real journals."""

    units = 6

    def setUp(self) -> None:
        super().setUp()
        self.journals = self.folder / "journals"
        self.journals.mkdir()
        for path in self.exports.iterdir():
            self.add(f"remote-{path.stem}.journal", path.read_text())

    def add(self, name: str, text: str) -> None:
        """Adds entries to a journal."""
        command: list[str | Path] = [REMOTE, "--output", self.journals / name, "-"]
        subprocess.run(command, input=text, text=True, stderr=subprocess.DEVNULL, check=True)

    def test_same_as_the_exports(self) -> None:
        self.expect_same(self.journals)

    def test_repeats(self) -> None:
        for number in (1, 2):
            self.add(f"remote-unit-{number:05}.journal", "".join(runs(number)))
        self.expect_same(self.journals, repeats=True)

    def test_journal_that_went_on_in_another_file(self) -> None:
        begun, _, rest = "".join(runs(1)).partition("\n\n__CURSOR=s=00000000000000000000000000000001;i=60;")
        for path in self.journals.glob("*00001*"):
            path.unlink()
        self.add("remote-unit-00001@1.journal", begun + "\n\n")
        self.add("remote-unit-00001.journal", "__CURSOR=" + rest)
        self.expect_same(self.journals)

    def test_damaged_journals_are_named(self) -> None:
        whole = facts(self.journals)[1]
        cut, bad = self.journals / "remote-unit-00002.journal", self.journals / "remote-unit-00004.journal"
        cut.write_bytes(cut.read_bytes()[:4000000])
        content = bytearray(bad.read_bytes())
        place = content.rindex(b"MESSAGE=Updater", 0, content.rindex(b"MESSAGE=Updater"))
        content[place - 64 : place] = b"\xff" * 64
        bad.write_bytes(content)
        found, units = facts(self.journals)
        self.assertEqual([Path(item["input"]).name for item in found["unread"]],
                         ["remote-unit-00002", "remote-unit-00004"])
        self.assertEqual([unit for unit in units if unit["unit"] not in ("unit-00002", "unit-00004")],
                         whole[:1] + whole[2:3] + whole[4:])


if __name__ == "__main__":
    TOOL = take_path()
    if "--write" in sys.argv:
        sys.argv.remove("--write")
        WRITE = True
    unittest.main()
