"""A plugin of pytest (-p tests.at_once): runs the chosen tests each in a process of its own, all at once, as most of
them wait. Ends at the first that fails, and fails again alone.
"""

import os

import pytest


def start(test: pytest.Item) -> int:
    process = os.fork()
    if process == 0:
        test.ihook.pytest_runtest_protocol(item=test, nextitem=None)
        os._exit(1 if test.session.testsfailed else 0)
    return process


def pytest_runtestloop(session: pytest.Session) -> bool:
    session.config._tmp_path_factory.getbasetemp()  # type: ignore[attr-defined] # one for all
    running = {start(test): test for test in session.items}
    while running:
        process, status = os.wait()
        test = running.pop(process)
        if status != 0 and os.waitpid(start(test), 0)[1] != 0:
            pytest.exit(f"{test.nodeid} fails", pytest.ExitCode.TESTS_FAILED)
    return True
