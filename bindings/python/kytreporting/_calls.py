"""Calls that are answered later: the library's callbacks, and the futures that they complete.

The callbacks run on the library's thread, or within the call that fails at once; ctypes takes the interpreter's lock for
them. There are only these few, made once and never freed; a call passes the number under which its future stands. None
runs once the program has ended: at_exit() of _session sees to that.
"""

from __future__ import annotations

import concurrent.futures
import itertools
import threading
from typing import Any, Callable, Dict, List, Optional, TypeVar

from ._errors import InvalidError, TimedOutError, error_of
from ._library import STATES_CALLBACK, SUCCESS_CALLBACK, TEXT_CALLBACK, lib

T = TypeVar("T")

_pending: Dict[int, "concurrent.futures.Future[Any]"] = {}
_numbers = itertools.count(1)
within = threading.local()  # .callback: this thread runs one now


def run(function: Callable[..., object], *arguments: Any) -> None:
    """One of the program's own callbacks."""
    before = getattr(within, "callback", False)
    within.callback = True
    try:
        function(*arguments)
    finally:
        within.callback = before


def begin() -> "tuple[int, concurrent.futures.Future[Any]]":
    """A number for the library, and the future that it will complete."""
    future: "concurrent.futures.Future[Any]" = concurrent.futures.Future()
    future.set_running_or_notify_cancel()  # what was asked of the library cannot be taken back
    number = next(_numbers)
    _pending[number] = future
    return number, future


def wait(ask: "Callable[[], concurrent.futures.Future[T]]", timeout: Optional[float]) -> T:
    """Asks, and waits for the answer, or its error. None waits as long as the library does."""
    seconds = None if timeout is None else _seconds_of(timeout)  # before anything is asked
    future = ask()
    if getattr(within, "callback", False) and not future.done():
        raise RuntimeError("a callback runs on the thread that would bring the answer: it may not wait for one")
    try:
        return future.result(seconds)
    except concurrent.futures.TimeoutError as late:
        if isinstance(late, TimedOutError):
            raise
        raise TimedOutError(f"no answer within {seconds:g} s") from None


def _seconds_of(timeout: float) -> float:
    """What a thread can wait for, which is some 290 years."""
    if not isinstance(timeout, (int, float)):
        raise InvalidError(f"timeout must be a number of seconds, not a value of the type {type(timeout).__name__}")
    if timeout != timeout:
        raise InvalidError("timeout must be a number of seconds, not nan")
    return float(max(0.0, min(timeout, threading.TIMEOUT_MAX)))


def forget_all() -> None:
    """In a child process: the answers will come to the parent."""
    _pending.clear()
    within.__dict__.clear()


def _complete(number: int, result: Any, error: Optional[bytes]) -> None:
    future = _pending.pop(number, None)
    if future is None:
        return
    if error is None:
        run(future.set_result, result)
    else:
        run(future.set_exception, error_of(lib.kyt_callback_error(), error.decode("utf-8", "replace")))


def _text(text: Optional[bytes]) -> Optional[str]:
    return None if text is None else text.decode("utf-8", "replace")


def _on_states(names: Any, count: int, has_storebag: int, error: Optional[bytes], number: int) -> None:
    """Live back ends, or None without a storebag."""
    states: Optional[List[str]] = None
    if has_storebag:
        states = [names[i].decode("utf-8", "replace") for i in range(count)]
    _complete(number, states, error)


def _on_text(text: Optional[bytes], error: Optional[bytes], number: int) -> None:
    """A text, or None."""
    _complete(number, _text(text), error)


def _on_success(success: int, error: Optional[bytes], number: int) -> None:
    """Whether it was done."""
    _complete(number, bool(success), error)


on_states = STATES_CALLBACK(_on_states)
on_text = TEXT_CALLBACK(_on_text)
on_success = SUCCESS_CALLBACK(_on_success)
nobody = STATES_CALLBACK(0)  # who is told of no states
