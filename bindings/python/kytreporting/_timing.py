"""Durations and sums as messages."""

from __future__ import annotations

import functools
import inspect
import threading
import time
from types import TracebackType
from typing import TYPE_CHECKING, Any, Callable, List, Optional, Type, TypeVar, cast

if TYPE_CHECKING:
    from ._session import Session

F = TypeVar("F", bound=Callable[..., Any])


class Timer:
    """Sends how long something took: `duration` in seconds, and `error`, the exception's name, where one left it.

        with session.timed(20, 1, step="index"):
            ...

        @session.timed(20, 2)
        def search(words): ...      # also async functions

    One Timer may be used again and from several threads. Sending never keeps the caller's exception back.
    """

    def __init__(self, session: "Session", category: int, type: int, /, **fields: Any) -> None:
        self._session = session
        self._category = category
        self._type = type
        self._fields = fields
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
        payload = dict(self._fields, duration=duration)
        if error is not None:
            payload["error"] = error.__name__
        try:
            self._session.send(self._category, self._type, payload)
        except Exception:  # pylint: disable=broad-except  # the caller's own matters more
            if error is None:
                raise

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


class Counter:
    """Sums up what happens too often for a message each.

        requests = session.counter(21, 1, interval=60, kind="request")
        requests.add()

    The sum leaves as one message, with `count` and `seconds` since the last, when add() finds that the interval is over,
    and with flush() and finish(); a sum of nothing never leaves. Any thread.
    """

    def __init__(self, session: "Session", category: int, type: int, /, *, interval: float = 60.0, **fields: Any) -> None:
        self._session = session
        self._category = category
        self._type = type
        self._interval = interval
        self._fields = fields
        self._start_anew()

    def _start_anew(self) -> None:
        self._lock = threading.Lock()
        self._count = 0
        self._begun = time.monotonic()

    def add(self, count: int = 1) -> None:
        """Adds to the sum."""
        with self._lock:
            self._count += count
            over = time.monotonic() - self._begun >= self._interval
        if over:
            self.send()

    def send(self) -> None:
        """Sends the sum now, if there is one."""
        with self._lock:
            count, self._count = self._count, 0
            now = time.monotonic()
            seconds, self._begun = now - self._begun, now
        if count:
            self._session.send(self._category, self._type, dict(self._fields, count=count, seconds=seconds))
