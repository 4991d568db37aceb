"""Where messages are."""

from __future__ import annotations

import dataclasses

from ._library import Figures


@dataclasses.dataclass(frozen=True)
class Statistics:
    """Where a session's messages are, and what else happened to it. Whenever nothing is in motion,

        accepted == sent + queued + lost_on_connection_end + lost_in_queue + dropped_unsendable + dropped_too_late

    and what was refused (dropped_queue_full, dropped_closed, dropped_invalid) was not accepted.
    """

    sent: int
    """Written to the daemon, and not lost with their connection."""
    dropped_queue_full: int
    """Refused: the queue was full."""
    lost_on_connection_end: int
    """Written; their connection ended before the daemon is known to have taken them."""
    dropped_closed: int
    """Refused: sent after the end."""
    dropped_invalid: int
    """Refused: category or type out of range, or wrong session information."""
    connections: int
    """Connections made, the first included."""
    queued: int
    """In the queue now."""
    waited_too_long: int
    """Calls whose answer waited for a daemon until the deadline."""
    replay_failed: int
    """Values that a daemon that came back could not be told again."""
    sent_unconfigured: int
    """Sent before the session was configured: the daemon dropped them."""
    accepted: int
    """Messages that were not refused."""
    lost_in_queue: int
    """Still in the queue when the session ended."""
    dropped_unsendable: int
    """Larger than a megabyte, or nested too deeply."""
    dropped_too_late: int
    """No daemon took them within the call deadline."""

    @property
    def dropped(self) -> int:
        """Accepted, and not to arrive any more."""
        return self.lost_on_connection_end + self.lost_in_queue + self.dropped_unsendable + self.dropped_too_late


def statistics_of(figures: Figures) -> Statistics:
    """The same as a value of its own."""
    return Statistics(**{field.name: getattr(figures, field.name) for field in dataclasses.fields(Statistics)})
