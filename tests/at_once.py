"""A plugin of pytest (-p tests.at_once): runs the chosen tests each in a process of its own, many at once, as most of
them wait. Ends at the first that fails, and fails again alone.
"""

import os

import pytest

SKIPPED = 77  # tests/conftest.py
MOST = 100  # at once


def start(test: pytest.Item) -> int:
    process = os.fork()
    if process == 0:
        test.ihook.pytest_runtest_protocol(item=test, nextitem=None)
        has_passed = "passed" in test.config.pluginmanager.get_plugin("terminalreporter").stats
        os._exit(1 if test.session.testsfailed else 0 if has_passed else SKIPPED)
    return process


def pytest_runtestloop(session: pytest.Session) -> bool:
    session.config._tmp_path_factory.getbasetemp()  # type: ignore[attr-defined] # one for all
    waiting = session.items.copy()
    running: dict[int, pytest.Item] = {}
    has_passed = False
    while waiting or running:
        while waiting and len(running) < MOST:
            test = waiting.pop(0)
            running[start(test)] = test
        process, status = os.wait()
        test = running.pop(process)
        code = os.waitstatus_to_exitcode(status)
        if code not in (0, SKIPPED) and os.waitpid(start(test), 0)[1] != 0:
            pytest.exit(f"{test.nodeid} fails", pytest.ExitCode.TESTS_FAILED)
        has_passed |= code == 0
    if session.items and not has_passed:
        pytest.exit("every test was skipped", SKIPPED)
    return True
