"""Usage: at_once.py [--only PREFIX] MODULE [ARGUMENT...]

Runs the tests of a module of unittest, each in a process of its own, all at once: most of them wait. Ends at the first
that fails, and fails again alone.
"""

import os
import runpy
import sys
import unittest
from collections.abc import Iterator

from tests.command_line import take_word


def tests_in(suite: unittest.TestSuite | unittest.TestCase) -> Iterator[unittest.TestCase]:
    if isinstance(suite, unittest.TestCase):
        yield suite
        return
    for each in suite:
        yield from tests_in(each)


def start(test: unittest.TestCase) -> int:
    process = os.fork()
    if process == 0:
        result = unittest.TestResult()
        unittest.TestSuite([test]).run(result)
        os._exit(0 if result.wasSuccessful() else 1)
    return process


def run_all(only: str) -> None:
    suite = unittest.defaultTestLoader.loadTestsFromModule(sys.modules["__main__"])
    running = {start(test): test for test in tests_in(suite) if type(test).__name__.startswith(only)}
    while running:
        process, status = os.wait()
        test = running.pop(process)
        if status != 0 and os.waitpid(start(test), 0)[1] != 0:
            print(f"{test.id()} fails")
            os._exit(1)
    os._exit(0)


if __name__ == "__main__":
    prefix = take_word()
    if prefix == "--only":
        prefix, module = take_word(), take_word()
    else:
        prefix, module = "", prefix
    unittest.main = lambda: run_all(prefix)  # type: ignore[misc, assignment]
    sys.argv[0] = module
    runpy.run_module(module, run_name="__main__", alter_sys=True)
