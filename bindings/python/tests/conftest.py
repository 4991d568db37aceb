"""What the tests share."""

import os
import subprocess
import sys
import textwrap
import time

import pytest

pytest_plugins = ["kytreporting.pytest_plugin"]


@pytest.fixture
def program():
    """Runs a program of its own to its end: what it printed. It must end with status 0."""

    def run(text, **environment):
        done = subprocess.run(
            [sys.executable, "-W", "error", "-c", textwrap.dedent(text)],
            env={**os.environ, **environment},
            capture_output=True,
            text=True,
            timeout=60,
            check=False,
        )
        assert done.returncode == 0, done.stderr
        assert done.stderr == ""
        return done.stdout

    return run


def eventually(condition, timeout=20.0):
    """Whether the condition comes to hold in time."""
    end = time.monotonic() + timeout
    while not condition():
        if time.monotonic() > end:
            return False
        time.sleep(0.005)
    return True


def closes(figures):
    """Whether the books close."""
    return figures.accepted == figures.sent + figures.queued + figures.dropped
