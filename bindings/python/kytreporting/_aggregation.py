"""What a session is told that aggregates."""

from __future__ import annotations

import dataclasses
from typing import Any, Dict, Optional

from ._values import entries_of


@dataclasses.dataclass(frozen=True)
class Aggregated:
    """A message of an aggregating session or of one beneath it.

    The last one, when the daemon ends the aggregation or another session above takes it over, has no session information,
    no payload, and zeros: see is_last.
    """

    session_info: Optional[Dict[str, Any]]
    """Who sent it: session information and user information."""
    timestamp: float
    """When, in seconds since 1970."""
    category: int
    """0 is the daemon's own: a session's start (type 0) and end (type 1)."""
    type: int
    """As the sender gave it."""
    payload: Optional[Dict[str, Any]]
    """Dates are datetimes in UTC; one that Python cannot hold stays a float, in seconds since 1970."""

    @property
    def is_last(self) -> bool:
        """Nothing comes any more, unless the session aggregates again, at a daemon that comes back."""
        return self.session_info is None


def aggregated(
    session_info: Optional[int], timestamp: float, category: int, type: int, payload: Optional[int]
) -> Aggregated:
    """The same of what the library's callback gets, whose dictionaries are gone when that returns."""
    return Aggregated(entries_of(session_info), timestamp, category, type, entries_of(payload))
