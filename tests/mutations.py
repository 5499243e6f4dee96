"""Usage: tests/mutation [--sample NUMBER] [--seed NUMBER] [--since COMMIT] [--jobs NUMBER] [PATH...]

Makes single-line changes of the product, builds each and runs the tests that concern it. All this happens in copies of
the checkout in build/mutation, one for each job, which stay for the next time.
"""

import argparse
import collections
import concurrent.futures
import contextlib
import fcntl
import itertools
import os
import queue
import random
import re
import shutil
import signal
import subprocess
import sys
import tempfile
import time
from collections.abc import Iterator
from dataclasses import dataclass
from pathlib import Path

ROOT = Path(__file__).parent.parent
ACCEPTED = ROOT / "tests/mutation.accepted"
BUILD = "build/default"
CONFIGURE = [
    *("cmake", "--preset", "default", "-DCMAKE_CXX_FLAGS_RELEASE=-O1", "-DCMAKE_CXX_FLAGS=-Werror=return-type"),
    *("-DCMAKE_COMPILE_WARNING_AS_ERROR=OFF", "-DCMAKE_GTEST_DISCOVER_TESTS_DISCOVERY_MODE=PRE_TEST"),
]
BUILD_LIMIT = 300  # s
MOST_PROCESSES = 1000  # of a test: with some changes the hand-over calls itself for ever
SINCE_LIMIT = 80  # s, after which --since begins with no other change
SKIPPED = 77  # tests/conftest.py


@dataclass(frozen=True)
class Mutation:
    """One change: `before` and `after` are the line, or two neighbouring ones, without their indentation."""

    file: str
    line: int  # of the first
    before: str
    after: str
    place: str  # which one of several equal lines; empty for the only one

    def key(self) -> str:
        return f"{self.file}: {self.before}{self.place} -> {self.after}"


@dataclass
class Check:
    """A command in the checkout's folder, which must succeed once the targets are built."""

    name: str
    command: str
    targets: str
    limit: float | None = None  # s; None: the machine cannot run it


@dataclass(frozen=True)
class Part:
    """Files that the same tests concern, the quickest first."""

    files: list[str]
    checks: list[Check]


def gtest(program: str, only: str = "*", folder: str = ".", shards: int = 1) -> Check:
    """The tests of the program whose names match `only`, in as many processes at once as there are `shards`."""
    name = Path(program).name
    command = f"$PWD/{BUILD}/tests/{program} --gtest_fail_fast --gtest_filter={only}"
    shard = f"env --chdir={folder} GTEST_TOTAL_SHARDS={shards} GTEST_SHARD_INDEX=@ {command}"
    return Check(name, f"seq 0 {shards - 1} | xargs -P {shards} -I @ {shard}", name)


def pytest(file: str, only: str = "", targets: str = "", more: str = "") -> Check:
    """The tests of the file whose names match `only`."""
    chosen = f"-k '{only}'" if only else ""
    return Check(Path(file).stem, f"scripts/python -m pytest --exitfirst {more} {file} {chosen}", targets)


def at_once(file: str, only: str = "", targets: str = "") -> Check:
    return pytest(file, only, targets, "-p tests.at_once")


SCENARIOS = ["package-and-board", "not-a-service", "up-to-date", "i2cset-missing", "sound-absent"]
GOLDEN_LOGS = "tests/companion/golden/log"
LARGE = "Stick.FourGigabytesOfNothingAreRefusedAtOnce"
PARTS = [
    Part(
        [
            *("common/src/Log.h", "common/src/Sleep.h", "common/src/UpdateManager.h", "remote/LedManager.h"),
            *("remote/RemoteUpdateManager.h", "remote/SoundManager.h", "common/src/Log.cpp"),
            *("common/src/UpdateManager.cpp", "remote/LedManager.cpp", "remote/RemoteUpdateManager.cpp"),
            *("remote/SoundManager.cpp", "remote/main.cpp"),
        ],
        [
            gtest("unit-tests"),
            gtest("unit-tests", "Flashing.ThreadThatIsStopped*"),  # alone: no test has stopped the flashing before
            gtest("process-tests"),
            gtest("faults/fault-matrix", "*OneFault*/RemoteHead__stopharl_exit1"),  # the order of main()
            *(
                pytest("tests/program/program_test.py", f"[{scenario}]", "harl-updater call_recorder")
                for scenario in SCENARIOS
            ),
            gtest("schedules/schedules", "*/NothingToUpdate:Flashing.*"),  # they represent the others
        ],
    ),
    Part(
        ["service/hand_over.cpp", "service/limits.h"],
        [
            at_once("tests/service/hand_over_test.py", "TestPanel", "hand-over"),
            at_once("tests/service/hand_over_test.py", "TestPassedOn", "hand-over"),
            at_once("tests/service/hand_over_test.py", targets="hand-over-short"),
        ],
    ),
    Part(["service/give-back"], [at_once("tests/service/give_back_test.py")]),
    Part(["service/prepare"], [at_once("tests/service/prepare_test.py")]),
    Part(
        ["service/verify-stick"],
        [at_once("tests/companion/stick/make_test.py", "TestSigned", "harl-updater-tool")],
    ),
    Part(
        ["companion/log/run.cpp", "companion/log/catalogue.cpp"],
        [
            gtest("companion/log-tests", "-Each/Knowledge.*", GOLDEN_LOGS),
            at_once("tests/companion/log/command_test.py", targets="harl-updater-tool"),
            gtest("companion/log-tests", "Each/Knowledge.*", GOLDEN_LOGS),
        ],
    ),
    Part(
        ["companion/stick/stick_check.cpp", "companion/stick/archive.cpp"],
        [
            gtest("companion/stick-tests", f"-{LARGE}", shards=8),
            at_once("tests/companion/stick/make_test.py", targets="harl-updater-tool"),
            gtest("companion/stick-tests", LARGE),
        ],
    ),
    Part(
        ["companion/stick/signature.cpp"],
        [
            gtest("companion/unit-check-tests", "Check.Tells*"),
            at_once("tests/companion/stick/make_test.py", "Signed", "harl-updater-tool"),
        ],
    ),
    Part(
        [
            *("companion/check/check.cpp", "companion/unit/unit_check.cpp", "companion/unit/packages.cpp"),
            "companion/unit/selftest.cpp",
        ],
        [
            gtest("companion/unit-check-tests", shards=8),  # most of them wait
            gtest("companion/tool-tests", shards=8),
            at_once(
                "tests/companion/golden_checks_test.py",
                targets="harl-updater-tool unit-on-standin call_recorder harl-updater",
            ),
        ],
    ),
]


# What can be changed

CPP_SWAPS = {
    "==": "!=",
    "!=": "==",
    "<=": "<",
    ">=": ">",
    "&&": "||",
    "||": "&&",
    "++": "--",
    " < ": " <= ",
    " > ": " >= ",
    " + ": " - ",
    " / ": " * ",
    " | ": " & ",
    "true": "false",
    "false": "true",
    "break;": "",
    "join()": "detach()",
    "notify_one()": "notify_all()",
}
SHELL_SWAPS = {
    " = ": " != ",
    " != ": " = ",
    "&&": "||",
    "||": "&&",
    " -lt ": " -le ",
    " -ge ": " -gt ",
    " -n ": " -z ",
    " -z ": " -n ",
    " + ": " - ",
    "if ": "if ! ",
    "while ": "until ",
    "until ": "while ",
    "break": ":",
}
NUMBER = re.compile(r"(?<![\w.\"'])(?:0x[0-9A-Fa-f]+|\d+)(?![\w.\"'])")


@dataclass(frozen=True)
class Language:
    """How the lines of a file are read."""

    swaps: dict[str, str]
    text: re.Pattern[str]
    comment: re.Pattern[str]
    passed_over: tuple[str, ...]
    statement: re.Pattern[str]
    declaration: re.Pattern[str]  # the order of two of them says nothing
    before_statement: str  # one of these ends the line before
    nothing: str  # in the place of a statement


CPP = Language(
    CPP_SWAPS,
    re.compile(r'R"\(.*?\)"|"(?:[^"\\]|\\.)*"'),
    re.compile("//.*"),
    ("//", "#", "namespace", "using", "__attribute__"),
    re.compile(r"(?!using|return;|break;|#|//|static_assert|friend|public|private|[}\]]).*;(\s*//.*)?"),
    re.compile(
        r"(?!return |delete |throw )(static )?(const )?(struct )?[\w:]+(<[\w:<>, ()*]*>)?[*&]? "
        r"\w+(\[[^]]*\]|\{[\w, ]*\})?( = ([\w:.*'{}< -]+|\"[^\"]*\"|R\"\(.*?\)\"))?;"
    ),
    r"[;{}:]",
    "",
)
SHELL = Language(
    SHELL_SWAPS,
    re.compile(r"\"(?:[^\"\\]|\\.)*\"|'[^']*'"),
    re.compile(r"(^|\s)#.*"),
    ("#",),
    re.compile(
        r"(?!(if|elif|else|fi|for|while|until|do|done|case|esac|then|return|break|export)\b"
        r"|[{}()]|[^\s(]*\)(\s|$)|\w+\(\))"
        r".*(?<![|&\\({;])(?<!; do)(?<!; then)"
    ),
    re.compile(r"\w+=[\w./'-]*"),
    r"[^|&\\]",
    ":",
)


def language_of(file: str) -> Language:
    return CPP if Path(file).suffix in (".cpp", ".h") else SHELL


def code_of(line: str, language: Language) -> str:
    """The line with the insides of its texts and its comment blanked, so that columns stay."""
    code = language.text.sub(lambda match: match[0][0] + " " * (len(match[0]) - 2) + match[0][-1], line)
    return language.comment.sub(lambda match: " " * len(match[0]), code)


def successor(number: str) -> str:
    """The next number; in C++ one that begins with 0 is octal."""
    return f"0{int(number, 8) + 1:o}" if re.fullmatch("0[0-7]+", number) else str(int(number, 0) + 1)


def changed_lines(line: str, language: Language, dice: random.Random) -> Iterator[str]:
    code = code_of(line, language)
    for old, new in language.swaps.items():
        for match in re.finditer((r"\b" if old[0].isalpha() else "") + re.escape(old), code):
            word = old.isalpha() and re.search(r"\w", code[match.end() : match.end() + 1])
            if not word:
                yield line[: match.start()] + new + line[match.end() :]
    for match in re.finditer(r"!(?!=) ?", code):
        yield line[: match.start()] + line[match.end() :]
    for match in re.finditer(r"\bif \((.*)\) \{", code):
        yield line[: match.start(1)] + "!(" + line[match.start(1) : match.end(1)] + ")" + line[match.end(1) :]
    for match in NUMBER.finditer(code):
        yield line[: match.start()] + successor(match[0]) + line[match.end() :]
    if not code.startswith("#"):
        for match in language.text.finditer(line):
            inside = range(match.start() + (3 if match[0][0] == "R" else 1), match.end() - 1)
            letters = [place for place in inside if line[place].isalnum() and line[place - 1] not in "\\%0"]
            if letters and code[match.start()] != " ":  # not in a comment
                place = dice.choice(letters)
                yield line[:place] + ("x" if line[place] != "x" else "y") + line[place + 1 :]


def balanced(code: str) -> bool:
    return all(code.count(left) == code.count(right) for left, right in (("(", ")"), ("{", "}"), ("[", "]")))


def is_statement(lines: list[str], index: int, language: Language) -> bool:
    """A whole statement on one line: the one before has ended."""
    code = code_of(lines[index], language).strip()
    above = (code_of(line, language).strip() for line in reversed(lines[:index]))
    before = next((line for line in above if line), "")
    ended = before == "" or re.fullmatch(language.before_statement, before[-1]) is not None
    return bool(code) and language.statement.fullmatch(code) is not None and balanced(code) and ended


def mutations_of(file: str) -> Iterator[Mutation]:
    language = language_of(file)
    lines = [line.strip() for line in (ROOT / file).read_text().splitlines()]
    for index, line in enumerate(lines):
        if not line or line.startswith(language.passed_over):
            continue
        place = f" [{lines[: index + 1].count(line)}]" if lines.count(line) > 1 else ""
        dice = random.Random(f"{file}: {line}{place}")
        for after in changed_lines(line, language, dice):
            yield Mutation(file, index + 1, line, after.strip(), place)
        if not is_statement(lines, index, language):
            continue
        yield Mutation(file, index + 1, line, language.nothing, place)
        if index + 1 < len(lines) and is_statement(lines, index + 1, language):
            below = lines[index + 1]
            plain = language.declaration.match(line) and language.declaration.match(below)
            if below != line and not plain:
                yield Mutation(file, index + 1, f"{line} {below}", f"{below} {line}", place)


def apply(mutation: Mutation, original: str) -> str:
    lines = original.splitlines()
    if mutation.before != lines[mutation.line - 1].strip():
        lines[mutation.line - 1 : mutation.line + 1] = reversed(lines[mutation.line - 1 : mutation.line + 1])
    else:
        lines[mutation.line - 1] = mutation.after
    return "\n".join(lines) + "\n"


def lines_since(commit: str, files: list[str]) -> set[tuple[str, int]]:
    """Lines of the files added or changed since this branch left that of `commit`."""
    base = subprocess.run(["git", "merge-base", commit, "HEAD"], cwd=ROOT, capture_output=True, text=True)
    if base.returncode != 0:
        sys.exit(f"tests/mutation: {commit}: no commit to compare with: {base.stderr.strip()}")
    command = ["git", "diff", "--unified=0", base.stdout.strip(), "--", *files]
    changed = set()
    file = ""
    for line in subprocess.run(command, cwd=ROOT, check=True, capture_output=True, text=True).stdout.splitlines():
        if line.startswith("+++ b/"):
            file = line[6:]
        elif match := re.match(r"@@ \S+ \+(\d+)(?:,(\d+))? @@", line):
            first = int(match[1])
            changed |= {(file, number) for number in range(first, first + int(match[2] or 1))}
    return changed


# Building and running


# Root could change the host: a changed line may take the host's folders for a test's own.
READ_ONLY = """
host=$(findmnt --real --raw --noheadings --output TARGET)
for folder in . /tmp "$TMPDIR"; do mount --bind "$folder" "$folder"; done
for folder in $host; do mount -o remount,bind,ro "$folder"; done
cd "$PWD"
exec "$@"
"""


def namespace() -> list[str]:
    """The words before a command that end all of its processes with it and, as root, leave it only its folder and the
    temporary ones to write to; none where the machine does not allow another user that."""
    words = ["unshare", "--mount", "--pid", "--fork", "--kill-child", "--mount-proc"]
    root = os.geteuid() == 0
    words += ["sh", "-ec", READ_ONLY, "sh"] if root else ["--map-root-user"]
    with tempfile.TemporaryDirectory(prefix="mutation-") as scratch:
        tried = subprocess.run([*words, "true"], cwd=scratch, env=os.environ | {"TMPDIR": scratch}, capture_output=True)
    if root and tried.returncode != 0:
        sys.exit("tests/mutation: root may not protect this machine from what is changed: run it as another user")
    return words if tried.returncode == 0 else []


class Tree:
    """A copy of the checkout, with its build."""

    def __init__(self, parts: list[Part]) -> None:
        trees = ROOT / "build/mutation"
        trees.mkdir(parents=True, exist_ok=True)
        for number in itertools.count():
            self.lock = (trees / f"{number}.lock").open("w")
            with contextlib.suppress(BlockingIOError):  # another run's
                fcntl.flock(self.lock, fcntl.LOCK_EX | fcntl.LOCK_NB)
                break
        self.folder = trees / str(number)
        self.namespace = namespace()
        list_files = ["git", "ls-files", "-z", "--cached", "--others", "--exclude-standard"]
        files = subprocess.run(list_files, cwd=ROOT, check=True, capture_output=True, text=True).stdout.split("\0")
        for name in filter(None, files):
            source, copy = ROOT / name, self.folder / name
            same = copy.exists() and copy.read_bytes() == source.read_bytes()
            if source.exists() and not same:
                copy.parent.mkdir(parents=True, exist_ok=True)
                shutil.copy(source, copy)
        self.demand(CONFIGURE)
        targets = {target for part in parts for check in part.checks for target in check.targets.split()}
        if targets:
            self.demand(["ninja", "-C", BUILD, *sorted(targets)])

    def demand(self, command: list[str]) -> None:
        done = subprocess.run(command, cwd=self.folder, capture_output=True, text=True)
        if done.returncode != 0:
            sys.exit(f"{' '.join(command)} failed in {self.folder}:\n{done.stdout}{done.stderr}")

    def measure(self, part: Part) -> None:
        """Runs the tests of a part without a change, which must pass."""
        for check in part.checks:
            begin = time.monotonic()
            status = self.status(check, BUILD_LIMIT)
            if status == 0:
                check.limit = min(10 + 5 * (time.monotonic() - begin), BUILD_LIMIT)
            elif status == SKIPPED:
                print(f"left out, as this machine cannot run it: {check.command}")
            else:
                sys.exit(f"tests/mutation: ends with status {status} without any change: {check.command}")

    def verdict(self, mutation: Mutation, part: Part) -> str:
        """What detected the change: a check, "compiler", or "" for nothing."""
        path = self.folder / mutation.file
        original = path.read_text()
        path.write_text(apply(mutation, original))
        try:
            shell = language_of(mutation.file) is SHELL
            if shell and subprocess.run(["dash", "-n", path], capture_output=True).returncode != 0:
                return "compiler"
            for check in part.checks:
                if check.targets:
                    # Else some changed sources would let CMake configure anew.
                    os.utime(self.folder / BUILD / "build.ninja")
                    build = ["ninja", "-C", BUILD, *check.targets.split()]
                    if subprocess.run(build, cwd=self.folder, capture_output=True, timeout=BUILD_LIMIT).returncode:
                        return "compiler"
                if check.limit is not None and self.status(check, check.limit) != 0:
                    return check.name
        finally:
            path.write_text(original)
        return ""

    def status(self, check: Check, limit: float) -> int | None:
        """The status of a check; None when it took too long or too many processes, all of which end with it."""
        nothing = subprocess.DEVNULL
        end = time.monotonic() + limit
        with tempfile.TemporaryDirectory(prefix="mutation-", ignore_cleanup_errors=True) as scratch:
            os.chmod(scratch, 0o755)  # some tests act as another user
            test = subprocess.Popen(
                [*self.namespace, "sh", "-c", f"{check.command}; exit $?"],
                cwd=self.folder,
                env=os.environ | {"PYTHONPATH": str(self.folder), "TMPDIR": scratch},
                stdin=nothing,
                stdout=nothing,
                stderr=nothing,
                start_new_session=True,
            )
            try:
                while test.poll() is None and time.monotonic() < end and self.processes(test.pid) < MOST_PROCESSES:
                    time.sleep(0.05)
                return test.poll()
            finally:
                with contextlib.suppress(ProcessLookupError):
                    os.killpg(test.pid, signal.SIGKILL)
                test.wait()

    def processes(self, test: int) -> int:
        """How many processes are in the namespace of a test."""
        with contextlib.suppress(OSError, IndexError):  # it has just ended
            first = Path(f"/proc/{test}/task/{test}/children").read_text().split()[0]
            return len(os.listdir(f"/proc/{first}/root/proc")) if self.namespace else 0
        return 0


def accepted() -> dict[str, str]:
    """The survivors without a visible effect: the key of each, and why."""
    entries = [line.rsplit(" # ", 1) for line in ACCEPTED.read_text().splitlines() if line and line[0] != "#"]
    return {key: reason for key, reason in entries}


def main() -> int:
    parser = argparse.ArgumentParser(usage=(__doc__ or "").splitlines()[0].removeprefix("Usage: "))
    parser.add_argument("--sample", type=int)
    parser.add_argument("--seed", type=int, default=1)
    parser.add_argument("--since")
    parser.add_argument("--jobs", type=int)
    parser.add_argument("paths", nargs="*", default=[""])
    arguments = parser.parse_args()

    part_of = {file: part for part in PARTS for file in part.files}
    files = [file for file in part_of if file.startswith(tuple(arguments.paths))]
    changes = [mutation for file in files for mutation in mutations_of(file)]
    if arguments.since:
        lines = lines_since(arguments.since, files)
        changes = [change for change in changes if (change.file, change.line) in lines]
    if not changes:
        print("no line to change")
        return 0
    found = len(changes)
    if arguments.since or arguments.sample:
        random.Random(arguments.seed).shuffle(changes)
        changes = changes[: arguments.sample]

    begin = time.monotonic()
    parts = [part for part in PARTS if any(change.file in part.files for change in changes)]
    trees: queue.Queue[Tree] = queue.Queue()
    first = Tree(parts)
    for part in parts:
        first.measure(part)
    trees.put(first)
    jobs = arguments.jobs or (1 if arguments.since else 2)
    for _ in range(1, jobs):
        trees.put(Tree(parts))
    end = begin + SINCE_LIMIT if arguments.since else float("inf")

    def verdict(change: Mutation) -> str | None:
        if time.monotonic() > end and change is not changes[0]:
            return None
        tree = trees.get()
        try:
            return tree.verdict(change, part_of[change.file])
        finally:
            trees.put(tree)

    noticed: collections.Counter[str] = collections.Counter()
    survivors = []
    with concurrent.futures.ThreadPoolExecutor(jobs) as workers:
        for change, by in zip(changes, workers.map(verdict, changes), strict=True):
            if by is None:
                continue
            noticed[by] += 1
            if not by:
                survivors.append(change)
                print(f"{change.file}:{change.line}: not noticed: {change.key()}", file=sys.stderr, flush=True)
    tried = noticed.total()
    built = tried - noticed.pop("compiler", 0)
    known = accepted()
    unknown = [change for change in survivors if change.key() not in known]
    if tried < found:
        print(f"of {found} changes only {tried}, chosen with seed {arguments.seed}")
    print(f"{tried} changes, {built} of them build; noticed: {built - noticed.pop('', 0)}", end="")
    print("".join(f", {by} {number}" for by, number in noticed.most_common()), end="")
    print(f"; accepted: {len(survivors) - len(unknown)}; {time.monotonic() - begin:.0f} s")
    for change in unknown:
        print(f"{change.file}:{change.line}: not noticed: {change.key()}")
    return 1 if unknown else 0


if __name__ == "__main__":
    sys.exit(main())
