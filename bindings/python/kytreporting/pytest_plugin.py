"""The fixture kyt_listener for pytest: see kytreporting.testing."""

from __future__ import annotations

from typing import Iterator

import pytest

from .testing import Listener


@pytest.fixture
def kyt_listener(monkeypatch: pytest.MonkeyPatch) -> Iterator[Listener]:
    """A daemon of this test's own. Sessions without a socket of their own find it by KYTREPORTING_SOCKET."""
    with Listener() as listener:
        monkeypatch.setenv("KYTREPORTING_SOCKET", listener.socket_path)
        yield listener
