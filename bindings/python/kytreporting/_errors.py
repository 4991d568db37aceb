"""What goes wrong, with the library's own texts."""

from __future__ import annotations


class Error(Exception):
    """Of all errors that this module raises itself. The text is the library's."""


class NotConnectedError(Error):
    """The connection ended before the answer, or there is no daemon."""


class ClosedError(Error):
    """The session was closed."""


class QueueFullError(Error):
    """The bounded queue had no room."""


class RefusedError(Error):
    """The daemon answered with an error."""


class InvalidError(Error, ValueError):
    """The arguments cannot be meant or sent so; the text names what."""


class TimedOutError(Error, TimeoutError):
    """No daemon took the call within the call deadline, or there was no answer within the caller's time."""


class BackEndError(Error):
    """What was asked for was tried, and failed: "Nothing to flush", or what a server said."""


# By the numbers of kyt_error.
_BY_NUMBER = {
    1: NotConnectedError,
    2: ClosedError,
    3: QueueFullError,
    4: RefusedError,
    5: InvalidError,
    6: TimedOutError,
}


def error_of(number: int, text: str) -> Error:
    """The exception for a number of kyt_error."""
    return _BY_NUMBER.get(number, BackEndError)(text)
