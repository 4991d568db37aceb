"""Durations and sums as messages."""

from __future__ import annotations

import contextvars
import functools
import inspect
import threading
import time
from types import TracebackType
from typing import TYPE_CHECKING, Any, Callable, Dict, Optional, Tuple, Type, TypeVar, cast

from ._errors import InvalidError
from ._values import Dictionary, checked_number, shown

if TYPE_CHECKING:
    from ._session import Session

F = TypeVar("F", bound=Callable[..., Any])


# The Timers that this thread or task is within, the innermost last. A task begins with a copy of its maker's.
_begun: "contextvars.ContextVar[Tuple[Tuple[Timer, float], ...]]" = contextvars.ContextVar("_begun", default=())


class _Measure:
    """What a Timer and a Counter send. What cannot be meant is told when they are made; sending raises nothing, for no
    program's own work is to fail for what is measured of it."""

    def __init__(self, session: "Session", category: int, type: int, fields: Dict[str, Any]) -> None:
        for number in (category, type):
            if not isinstance(number, int):
                raise InvalidError("category and type are whole numbers")
        if not (0 <= category <= 0xFFFF and 0 <= type <= 0xFFFF):
            raise InvalidError(f"category {shown(category)} and type {shown(type)}: both are 0 to 65535")
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

    One Timer may be used again, from several threads and tasks. A generator is timed from its first step to its end; an
    asynchronous one cannot be decorated. Sending raises nothing, and keeps the caller's exception and
    result as they are: what the session does not take, ended or without a daemon, is in its statistics.
    """

    def __init__(self, session: "Session", category: int, type: int, /, **fields: Any) -> None:
        super().__init__(session, category, type, fields)

    def __enter__(self) -> "Timer":
        _begun.set(_begun.get() + ((self, time.perf_counter()),))
        return self

    def __exit__(
        self,
        kind: Optional[Type[BaseException]],
        value: Optional[BaseException],
        traceback: Optional[TracebackType],
    ) -> None:
        now = time.perf_counter()
        begun = _begun.get()
        for place in reversed(range(len(begun))):
            if begun[place][0] is self:
                _begun.set(begun[:place] + begun[place + 1 :])
                self._send(now - begun[place][1], kind)
                return

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

        if inspect.isasyncgenfunction(function):
            raise InvalidError("an asynchronous generator cannot be timed: use a with statement within it")
        if inspect.isgeneratorfunction(function):

            @functools.wraps(function)
            def timed_steps(*arguments: Any, **named: Any) -> Any:
                begun = time.perf_counter()  # of this generator: others run between its steps
                error: Optional[Type[BaseException]] = None
                try:
                    return (yield from function(*arguments, **named))
                except GeneratorExit:  # whoever asked wanted no more
                    raise
                except BaseException as raised:
                    error = type(raised)
                    raise
                finally:
                    self._send(time.perf_counter() - begun, error)

            return cast(F, timed_steps)

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
        checked_number("interval", interval, 0, 2**53, whole=False)
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
