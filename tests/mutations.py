"""Usage: tests/mutation [--sample NUMBER [--seed NUMBER]] [--since COMMIT] [--jobs NUMBER]

Makes single-line changes of the product, builds each and runs the tests on it. All this happens in a copy of the tree
in a temporary folder: the tests are built there once, and for each change only the files that it affects.
"""

import argparse
import collections
import concurrent.futures
import os
import random
import re
import shutil
import signal
import subprocess
import sys
import tempfile
import threading
import time
from collections.abc import Iterator
from dataclasses import dataclass
from pathlib import Path

ROOT = Path(__file__).parent.parent
ACCEPTED = ROOT / "tests/mutation.accepted"
LIBRARY = [
    "common/src/Log.cpp",
    "common/src/UpdateManager.cpp",
    "remote/LedManager.cpp",
    "remote/RemoteUpdateManager.cpp",
    "remote/SoundManager.cpp",
]
MAIN = "remote/main.cpp"
HEADERS = [
    "common/src/Log.h",
    "common/src/Sleep.h",
    "common/src/UpdateManager.h",
    "remote/LedManager.h",
    "remote/RemoteUpdateManager.h",
    "remote/SoundManager.h",
]
SOURCES = [*HEADERS, *LIBRARY, MAIN]
TESTS = ["unit-tests", "process-tests"]
SCENARIOS = ["package-and-board", "not-a-service", "up-to-date", "i2cset-missing", "sound-absent"]
EXPLORED = "--gtest_filter=*/NothingToUpdate:Flashing.*"  # the two explorations that represent the others
FLAGS = ["-std=c++17", "-O0", "-Werror=return-type", "-pthread"]
CONFIGURE = ["cmake", "--preset", "default", "-DCMAKE_CXX_FLAGS_RELEASE=-O0"]
BUILD_LIMIT = 120  # s
TEST_LIMIT = 120  # s


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


# What can be changed

SWAPS = {
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
TEXT = re.compile(r'R"\(.*?\)"|"(?:[^"\\]|\\.)*"')
NUMBER = re.compile(r"(?<![\w.\"'])(?:0x[0-9A-Fa-f]+|\d+)(?![\w.\"'])")
DECLARATION = re.compile(r"(static )?(const )?(std::)?(string|bool|int|int32_t|Color|Led) \w+( = [\w.-]+)?;")
STATEMENT = re.compile(r"^(?!using|return;|break;|#|//|static_assert|friend|public|private|[}\]]).*;(\s*//.*)?$")


def code_of(line: str) -> str:
    """The line with the insides of its texts and its comment blanked, so that columns stay."""
    code = TEXT.sub(lambda match: '"' + " " * (len(match[0]) - 2) + '"', line)
    comment = code.find("//")
    return code if comment < 0 else code[:comment] + " " * (len(code) - comment)


def changed_lines(line: str, dice: random.Random) -> Iterator[str]:
    code = code_of(line)
    for old, new in SWAPS.items():
        for match in re.finditer(re.escape(old), code):
            word = old.isalpha() and re.search(r"\w", code[match.end() : match.end() + 1])
            if not word:
                yield line[: match.start()] + new + line[match.end() :]
    for match in re.finditer(r"!(?!=)", code):
        yield line[: match.start()] + line[match.end() :]
    for match in re.finditer(r"\bif \((.*)\) \{", code):
        yield line[: match.start(1)] + "!(" + line[match.start(1) : match.end(1)] + ")" + line[match.end(1) :]
    for match in NUMBER.finditer(code):
        yield line[: match.start()] + str(int(match[0], 0) + 1) + line[match.end() :]
    if not code.startswith("#"):
        for match in TEXT.finditer(line):
            inside = range(match.start() + (3 if match[0][0] == "R" else 1), match.end() - 1)
            letters = [place for place in inside if line[place].isalnum() and line[place - 1] not in "\\%0"]
            if letters:
                place = dice.choice(letters)
                yield line[:place] + ("x" if line[place] != "x" else "y") + line[place + 1 :]


def balanced(code: str) -> bool:
    return all(code.count(left) == code.count(right) for left, right in (("(", ")"), ("{", "}"), ("[", "]")))


def is_statement(lines: list[str], index: int) -> bool:
    """A whole statement on one line: the one before has ended."""
    code = code_of(lines[index].strip())
    before = next((code_of(line).strip() for line in reversed(lines[:index]) if code_of(line).strip()), "")
    return bool(STATEMENT.match(code.strip())) and balanced(code) and (before == "" or before[-1] in ";{}:")


def mutations_of(file: str) -> Iterator[Mutation]:
    dice = random.Random(file)
    lines = (ROOT / file).read_text().splitlines()
    stripped = [line.strip() for line in lines]
    for index, line in enumerate(stripped):
        if not line or line.startswith(("//", "#", "namespace", "using")):
            continue
        place = f" [{stripped[: index + 1].count(line)}]" if stripped.count(line) > 1 else ""
        for after in changed_lines(line, dice):
            yield Mutation(file, index + 1, line, after.strip(), place)
        if not is_statement(lines, index):
            continue
        yield Mutation(file, index + 1, line, "", place)
        if index + 1 < len(lines) and is_statement(lines, index + 1):
            below = stripped[index + 1]
            plain = DECLARATION.match(line) and DECLARATION.match(below)  # their order says nothing
            if below != line and not plain:
                yield Mutation(file, index + 1, f"{line} {below}", f"{below} {line}", place)


def apply(mutation: Mutation) -> str:
    lines = (ROOT / mutation.file).read_text().splitlines()
    if mutation.before != lines[mutation.line - 1].strip():
        lines[mutation.line - 1 : mutation.line + 1] = reversed(lines[mutation.line - 1 : mutation.line + 1])
    else:
        lines[mutation.line - 1] = mutation.after
    return "\n".join(lines) + "\n"


def lines_since(commit: str) -> set[tuple[str, int]]:
    """Lines of the sources added or changed since this branch left that of `commit`."""
    base = subprocess.run(["git", "merge-base", commit, "HEAD"], cwd=ROOT, capture_output=True, text=True)
    if base.returncode != 0:
        sys.exit(f"tests/mutation: {commit}: no commit to compare with: {base.stderr.strip()}")
    command = ["git", "diff", "--unified=0", base.stdout.strip(), "--", *SOURCES]
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


class Trial:
    """The copy of the tree, with its tests built."""

    def __init__(self, folder: Path) -> None:
        self.tree = folder / "tree"
        self.scratch = folder / "changes"
        self.scratch.mkdir()
        list_files = ["git", "ls-files", "-z", "--cached", "--others", "--exclude-standard"]
        files = subprocess.run(list_files, cwd=ROOT, check=True, capture_output=True, text=True).stdout.split("\0")
        for file in filter(None, files):
            if (ROOT / file).exists():
                (self.tree / file).parent.mkdir(parents=True, exist_ok=True)
                shutil.copy2(ROOT / file, self.tree / file, follow_symlinks=False)
        self.build = self.tree / "build/default"
        targets = [*TESTS, "harl-updater", "schedules"]
        self.rebuilt_tree = folder / "rebuilt"
        self.rebuilding = threading.Lock()
        self.run_quietly(CONFIGURE, self.tree)
        build = ["cmake", "--build", "--preset", "default", "--target", *targets, "call_recorder"]
        self.run_quietly(build, self.tree)
        self.links = {target: self.link_command(target) for target in targets}

    def run_quietly(self, command: list[str], tree: Path) -> None:
        done = subprocess.run(command, cwd=tree, capture_output=True, text=True)
        if done.returncode != 0:
            sys.exit(f"{' '.join(command)} failed in the copy of the tree:\n{done.stdout}{done.stderr}")

    def link_command(self, target: str) -> list[str]:
        """The words of the command that links `target`, without its output and the product's own objects."""
        show = ["ninja", "-t", "commands", target]
        commands = subprocess.run(show, cwd=self.build, check=True, capture_output=True, text=True).stdout
        words = commands.splitlines()[-1].split()
        words = words[words.index("&&") + 1 :]
        words = words[: words.index("&&")]
        del words[words.index("-o") : words.index("-o") + 2]
        return words

    def compile(self, source: str, folder: Path, mutation: Mutation) -> Path | None:
        """Compiles a file of the product with the change; the compiler finds the changed file before the original."""
        result = folder / (Path(source).stem + ".o")
        path = folder / Path(source).name
        if source != mutation.file:
            shutil.copy(self.tree / source, path)
        command = ["g++-11", *FLAGS, f"-I{folder}", f"-I{self.tree / 'common/src'}", f"-I{self.tree / 'remote'}"]
        done = subprocess.run([*command, "-c", str(path), "-o", str(result)], capture_output=True, timeout=BUILD_LIMIT)
        return result if done.returncode == 0 else None

    def link(self, target: str, objects: list[Path], folder: Path) -> Path | None:
        replaced = tuple(f"/{each.stem}.cpp.o" for each in objects)
        words = [word for word in self.links[target] if not word.endswith(replaced)]
        program = folder / target
        command = [words[0], *map(str, objects), *words[1:], "-o", str(program)]
        done = subprocess.run(command, cwd=self.build, capture_output=True, timeout=BUILD_LIMIT)
        return program if done.returncode == 0 else None

    def verdict(self, mutation: Mutation) -> str:
        """What detected the change: a test program, "compiler", or "" for nothing."""
        with tempfile.TemporaryDirectory(dir=self.scratch) as name:
            folder = Path(name)
            (folder / Path(mutation.file).name).write_text(apply(mutation))
            header = mutation.file in HEADERS
            sources = [*LIBRARY, MAIN] if header else [mutation.file]
            objects = [self.compile(source, folder, mutation) for source in sources]
            if None in objects:
                return "compiler"
            built = [each for each in objects if each]
            library = [each for each in built if each.stem != "main"]
            for target in TESTS if library else []:
                program = self.link(target, library, folder)
                if program is None:
                    return "compiler"
                if not self.passes([str(program), "--gtest_fail_fast"], folder):
                    return target
            program = self.link("harl-updater", built, folder)
            if program is None:
                return "compiler"
            if not self.program_passes(program, folder):
                return "harl-updater"
            if header:
                return self.verdict_of_rebuilt_tests(mutation)
            program = self.link("schedules", library, folder) if library else None
            return "schedules" if program and not self.passes([str(program), EXPLORED], folder) else ""

    def verdict_of_rebuilt_tests(self, mutation: Mutation) -> str:
        """The verdict when the tests, too, are built with a changed header, as those of a release are."""
        tree = self.rebuilt_tree
        with self.rebuilding:
            if not tree.exists():
                built = str(self.tree)
                shutil.copytree(built, tree, ignore=lambda name, _: ["build"] if name == built else [], symlinks=True)
                self.run_quietly(CONFIGURE, tree)
            (tree / mutation.file).write_text(apply(mutation))
            try:
                for target in TESTS:
                    command = ["cmake", "--build", "--preset", "default", "--target", target]
                    if subprocess.run(command, cwd=tree, capture_output=True).returncode != 0:
                        return "compiler"
                    if not self.passes([str(tree / "build/default/tests" / target), "--gtest_fail_fast"], tree):
                        return target
            finally:
                shutil.copy(self.tree / mutation.file, tree / mutation.file)
                os.utime(tree / mutation.file)
        return ""

    def passes(self, command: list[str], folder: Path) -> bool:
        nothing = subprocess.DEVNULL
        test = subprocess.Popen(
            command, cwd=folder, stdin=nothing, stdout=nothing, stderr=nothing, start_new_session=True
        )
        try:
            return test.wait(TEST_LIMIT) == 0
        except subprocess.TimeoutExpired:
            os.killpg(test.pid, signal.SIGKILL)  # with what it started
            test.wait()
            return False

    def program_passes(self, program: Path, folder: Path) -> bool:
        """The program tests, which look for the updater and the recorder in one build folder."""
        build = folder / "program"
        (build / "bench").mkdir(parents=True)
        (build / "harl-updater").symlink_to(program)
        (build / "bench/call_recorder.so").symlink_to(self.build / "bench/call_recorder.so")
        command = [str(self.tree / "scripts/python"), "-m", "tests.program.program_test"]
        return all(self.passes([*command, scenario, str(build)], self.tree) for scenario in SCENARIOS)


def accepted() -> dict[str, str]:
    """The survivors without a visible effect: the key of each, and why."""
    if not ACCEPTED.exists():
        return {}
    entries = [line.rsplit(" # ", 1) for line in ACCEPTED.read_text().splitlines() if line and line[0] != "#"]
    return {key: reason for key, reason in entries}


def main() -> int:
    parser = argparse.ArgumentParser(usage=(__doc__ or "").splitlines()[0].removeprefix("Usage: "))
    parser.add_argument("--sample", type=int)
    parser.add_argument("--seed", type=int, default=1)
    parser.add_argument("--since")
    parser.add_argument("--jobs", type=int, default=2)
    arguments = parser.parse_args()

    changes = [mutation for file in SOURCES for mutation in mutations_of(file)]
    if arguments.since:
        lines = lines_since(arguments.since)
        changes = [change for change in changes if (change.file, change.line) in lines]
    if arguments.sample and arguments.sample < len(changes):
        changes = sorted(random.Random(arguments.seed).sample(changes, arguments.sample), key=lambda one: one.key())
    if not changes:
        print("no line to change")
        return 0

    begin = time.monotonic()
    noticed: collections.Counter[str] = collections.Counter()
    survivors = []
    with tempfile.TemporaryDirectory(prefix="mutation-") as folder:
        trial = Trial(Path(folder))
        with concurrent.futures.ThreadPoolExecutor(arguments.jobs) as workers:
            for change, by in zip(changes, workers.map(trial.verdict, changes), strict=True):
                noticed[by] += 1
                if not by:
                    survivors.append(change)
                    print(f"{change.file}:{change.line}: not noticed: {change.key()}", file=sys.stderr, flush=True)
    built = len(changes) - noticed["compiler"]
    known = accepted()
    unknown = [change for change in survivors if change.key() not in known]
    print(f"{len(changes)} changes, {built} of them build; noticed: {built - len(survivors)}", end="")
    print("".join(f", {by} {noticed[by]}" for by in (*TESTS, "harl-updater", "schedules")), end="")
    print(f"; accepted: {len(survivors) - len(unknown)}; {time.monotonic() - begin:.0f} s")
    for change in unknown:
        print(f"{change.file}:{change.line}: not noticed: {change.key()}")
    return 1 if unknown else 0


if __name__ == "__main__":
    sys.exit(main())
