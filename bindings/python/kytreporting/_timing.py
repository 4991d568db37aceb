"""Durations and sums as messages."""

from __future__ import annotations

import functools
import inspect
import threading
import time
from types import TracebackType
from typing import TYPE_CHECKING, Any, Callable, Dict, List, Optional, Type, TypeVar, cast

from ._errors import InvalidError
from ._values import Dictionary

if TYPE_CHECKING:
    from ._session import Session

F = TypeVar("F", bound=Callable[..., Any])


class _Measure:
    """What a Timer and a Counter send. What cannot be meant is told when they are made; sending raises nothing, for no
    program's own work is to fail for what is measured of it."""

    def __init__(self, session: "Session", category: int, type: int, fields: Dict[str, Any]) -> None:
        if not (0 <= category <= 0xFFFF and 0 <= type <= 0xFFFF):
            raise InvalidError(f"category {category} and type {type}: both are 0 to 65535")
        with Dictionary(fields):
            self._session = session
        self._category = category
        self._type = type
        self._fields = fields

    def _send_with(self, **measured: Any) -> bool:
        """Whether it was queued. What was not is in the session's statistics."""
        try:
            return self._session.send(self._category, self._type, dict(self._fields, **measured))
        except Exception:  # pylint: disable=broad-except
            return False


class Timer(_Measure):
    """Sends how long something took: `duration` in seconds, and `error`, the exception's name, where one left it.

        with session.timed(20, 1, step="index"):
            ...

        @session.timed(20, 2)
        def search(words): ...      # also async functions

    One Timer may be used again and from several threads. Sending raises nothing, and keeps the caller's exception and
    result as they are: what the session does not take, ended or without a daemon, is in its statistics.
    """

    def __init__(self, session: "Session", category: int, type: int, /, **fields: Any) -> None:
        super().__init__(session, category, type, fields)
        self._begun = threading.local()

    def __enter__(self) -> "Timer":
        if not hasattr(self._begun, "times"):
            self._begun.times = []
        cast(List[float], self._begun.times).append(time.perf_counter())
        return self

    def __exit__(
        self,
        kind: Optional[Type[BaseException]],
        value: Optional[BaseException],
        traceback: Optional[TracebackType],
    ) -> None:
        self._send(time.perf_counter() - self._begun.times.pop(), kind)

    def _send(self, duration: float, error: Optional[Type[BaseException]]) -> None:
        if error is None:
            self._send_with(duration=duration)
        else:
            self._send_with(duration=duration, error=error.__name__)

    def __call__(self, function: F) -> F:
        if inspect.iscoroutinefunction(function):

            @functools.wraps(function)
            async def timed_later(*arguments: Any, **named: Any) -> Any:
                begun = time.perf_counter()  # of this task: others run on the same thread meanwhile
                error: Optional[Type[BaseException]] = None
                try:
                    return await function(*arguments, **named)
                except BaseException as raised:
                    error = type(raised)
                    raise
                finally:
                    self._send(time.perf_counter() - begun, error)

            return cast(F, timed_later)

        @functools.wraps(function)
        def timed(*arguments: Any, **named: Any) -> Any:
            with self:
                return function(*arguments, **named)

        return cast(F, timed)


class Counter(_Measure):
    """Sums up what happens too often for a message each.

        requests = session.counter(21, 1, interval=60, kind="request")
        requests.add()

    The sum leaves as one message, with `count` and `seconds` since the last, when add() finds that the interval is over,
    and with flush() and finish(); a sum of nothing never leaves, and one that finds no room goes along with the next.
    Raises nothing. Any thread.
    """

    def __init__(self, session: "Session", category: int, type: int, /, *, interval: float = 60.0, **fields: Any) -> None:
        super().__init__(session, category, type, fields)
        self._interval = interval
        self._start_anew()

    def _start_anew(self) -> None:
        self._lock = threading.Lock()
        self._count = 0
        self._begun = self._tried = time.monotonic()

    def add(self, count: int = 1) -> None:
        """Adds to the sum."""
        with self._lock:
            self._count += count
            over = time.monotonic() - self._tried >= self._interval
        if over:
            self.send()

    def send(self) -> None:
        """Sends the sum now, if there is one."""
        with self._lock:
            count, self._count = self._count, 0
            begun, self._begun = self._begun, time.monotonic()
            self._tried = self._begun
        if count and not self._send_with(count=count, seconds=self._tried - begun):
            with self._lock:
                self._count += count
                self._begun = min(self._begun, begun)

    def _has_sum(self) -> bool:
        return self._count != 0
