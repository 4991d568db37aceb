"""Sessions."""

from __future__ import annotations

import asyncio
import atexit
import concurrent.futures
import contextlib
import ctypes
import enum
import functools
import itertools
import math
import os
import secrets
import sys
import threading
import time
import weakref
from types import TracebackType
from typing import Any, Callable, Dict, Iterator, List, Mapping, Optional, Sequence, Tuple, Type, Union

from . import _calls
from ._aggregation import Aggregated, aggregated
from ._errors import ClosedError, Error, InvalidError, error_of
from ._library import AGGREGATION_CALLBACK, STATE_CALLBACK, Figures, Options, lib
from ._statistics import Statistics, statistics_of
from ._timing import Counter, Timer
from ._values import Array, Dictionary, Payload, checked_mapping, checked_number, shown, text_bytes

_REASON_BYTES = 512
_MOST_SECONDS = 4_294_967  # 49 days: 32 bits of milliseconds
_LAST_SECOND = 1.0  # what the end of a program waits for messages that are queued


class State(enum.IntEnum):
    """How far a session's messages get, as far as the library can know."""

    NO_DAEMON = 0
    """No connection: no socket, nobody listens, or the connection ended."""
    REFUSED = 1
    """The daemon does not serve this program."""
    CONNECTED = 2
    """Connected, and not configured yet: the daemon drops what is sent."""
    NO_STOREBAG = 3
    """Configured; no storebag, or one without back ends: the daemon drops all."""
    NO_LIVE_BACK_END = 4
    """Configured, and no back end takes events."""
    LIVE = 5
    """At least one back end takes events."""


class Flag(enum.IntFlag):
    """How a message is to leave."""

    NONE = 0
    """As configured: batched or sent."""
    REALTIME = 1
    """Sent at once, to the realtime address; what was batched before goes first."""
    EXPEDITE = 2
    """A session held back by sampling is let go with the next message."""


class _Places(threading.local):
    """For texts that the library writes, one for each thread."""

    def __init__(self) -> None:
        self.text = ctypes.create_string_buffer(_REASON_BYTES)

    def read(self) -> str:
        return self.text.value.decode("utf-8", "replace")


_places = _Places()
_sessions: "weakref.WeakValueDictionary[int, Session]" = weakref.WeakValueDictionary()
_numbers = itertools.count(1)


class _Program:
    """Nothing of the library's is opened once the program has ended: its answer would come to no interpreter."""

    def __init__(self) -> None:
        self.opening = threading.RLock()  # while something is; a callback of a call that fails at once may open more
        self.ended = False
        self.watches_process = 0  # the one whose multiprocessing is to call _at_exit()

    @contextlib.contextmanager
    def goes_on(self) -> Iterator[None]:
        """While this lasts the program does not end."""
        with self.opening:
            if self.ended:
                raise ClosedError("the program ends")
            yield


_program = _Program()


# The library's thread calls these two with the interpreter's lock, which ctypes takes. An exception goes to
# sys.unraisablehook, which prints it, and the program goes on.


def _tell_state(state: int, why: bytes, number: int) -> None:
    session = _sessions.get(number)
    if session is None or session._told is None:
        return
    change = (State(state), why.decode("utf-8", "replace"))
    if session._opener == threading.get_ident():  # its end, within the call that opens it: there is no session yet
        session._early.append(change)
    else:
        _calls.run(session._told, *change)


def _tell_aggregated(
    info: Optional[int], timestamp: float, category: int, type: int, payload: Optional[int], number: int
) -> None:
    session = _sessions.get(number)
    if session is not None and session._aggregates is not None:
        _calls.run(session._aggregates, aggregated(info, timestamp, category, type, payload))


_on_state_change = STATE_CALLBACK(_tell_state)
_on_aggregated = AGGREGATION_CALLBACK(_tell_aggregated)


def _path_bytes(path: Union[str, "os.PathLike[str]"]) -> bytes:
    encoded = os.fsencode(path)
    if b"\0" in encoded:  # which would end the path for the library
        raise InvalidError("a path with a NUL character names nothing")
    return encoded


def _milliseconds(what: str, seconds: float) -> int:
    """Whole ones, and at least one of what is not 0: for the library 0 has a meaning of its own."""
    if not isinstance(seconds, (int, float)):
        raise InvalidError(f"{what} must be a number of seconds, not a value of the type {type(seconds).__name__}")
    if not 0 <= seconds <= _MOST_SECONDS:
        raise InvalidError(f"{what}: {shown(seconds)} is no number of seconds from 0 to {_MOST_SECONDS}")
    return math.ceil(seconds * 1000)


def _checked(information: Mapping[str, Any]) -> None:
    for key, value in information.items():
        if value is None:  # which would be left out: of the consent's reach, for one
            raise InvalidError(f'session information: "{key}" is None')
    with Dictionary(information) as dictionary:
        if not lib.kyt_session_info_check(dictionary.pointer, _places.text, _REASON_BYTES):
            raise InvalidError(_places.read())


def _names(client: Optional[str], service: Optional[str], more: Optional[Payload]) -> Optional[Dict[str, Any]]:
    if more is not None:
        checked_mapping("user_info", more)
    for what, name in (("client", client), ("service", service)):
        if name is not None and not isinstance(name, str):
            raise InvalidError(f"{what} must be a text, not a value of the type {type(name).__name__}")
    user: Dict[str, Any] = dict(more or {})
    if client is not None:
        user["ClientName"] = client
    if service is not None:
        user["ServiceName"] = service
    return user or None


class Session:
    """One reporting session.

    client_type: 0 to 23, which kind of client; types 5 to 23 have a storebag.
    client, service: choose the storebag's entry for this program, and go with every record.
    user_info: further entries that go with every record.
    session_id: 32 bits, yours; a random one otherwise,
        of each process its own. client_version: 16 bits.
    batch: events are collected until a flush, a threshold or the session's end.
    require_user_info: the owner's consent, and country, device, filter and sampling rules apply. False is for what says
        nothing about anyone.
    hierarchy: token and level, for sessions that belong together: 0 is the top. Make the token 128 random bits as text.
    socket: the daemon's, instead of the environment's KYTREPORTING_SOCKET or the fixed one.
    max_queued_messages, max_queued_bytes: bounds of the queue (64 to 65536; at least 4096).
    on_state_change: called as (State, reason) on the library's thread; it must not wait for answers.
    on_aggregated: the session aggregates: called as (Aggregated) on the library's thread with each of its own messages and
        of those beneath it in its hierarchy, where no session above does; it must not wait for answers.
    call_deadline: seconds that an answer waits for a daemon that is not there; 0: as long as the session lives.
    finish_waits_for_daemon: whether finish() waits for a daemon that was never there.
    flush_interval: seconds that an event is batched at most; 0: until something else flushes.
    wait_for_daemon: False ends a session that finds no daemon when it first tries to connect.
    configure: asks to be configured at once. Without, nothing arrives before configure() was called.

    Raises InvalidError for information that cannot be meant so. Opening never waits: a daemon that is not there yet is
    waited for. In a forked child the session is opened anew at its first use, with figures of its own.
    """

    def __init__(
        self,
        client_type: int,
        client: Optional[str] = None,
        service: Optional[str] = None,
        *,
        user_info: Optional[Payload] = None,
        session_id: Optional[int] = None,
        client_version: int = 0,
        batch: bool = False,
        require_user_info: bool = True,
        hierarchy: Optional[Tuple[str, int]] = None,
        socket: Optional[str] = None,
        max_queued_messages: int = 0,
        max_queued_bytes: int = 0,
        on_state_change: Optional[Callable[[State, str], object]] = None,
        on_aggregated: Optional[Callable[[Aggregated], object]] = None,
        call_deadline: float = 30.0,
        finish_waits_for_daemon: bool = False,
        flush_interval: float = 0.0,
        wait_for_daemon: bool = True,
        configure: bool = True,
    ) -> None:
        for what, function in (("on_state_change", on_state_change), ("on_aggregated", on_aggregated)):
            if function is not None and not callable(function):
                raise InvalidError(f"{what} must be a function, not a value of the type {type(function).__name__}")
        if hierarchy is not None and not (isinstance(hierarchy, (tuple, list)) and len(hierarchy) == 2):
            raise InvalidError("hierarchy must be a token and a level")
        if hierarchy is not None and None in hierarchy:  # which would be left out: the level is 0 then
            raise InvalidError("hierarchy must be a token and a level, neither of them None")
        for what, flag in (
            ("finish_waits_for_daemon", finish_waits_for_daemon),
            ("wait_for_daemon", wait_for_daemon),
            ("configure", configure),
        ):
            if not isinstance(flag, int):
                raise InvalidError(f"{what} must be a boolean, not a value of the type {type(flag).__name__}")
        self._information: Dict[str, Any] = {
            "SessionID": secrets.randbits(32) if session_id is None else session_id,
            "ClientType": client_type,
            "ClientVersion": client_version,
            "BatchEvent": batch,
            "RequireUserInfo": require_user_info,
        }
        if hierarchy is not None:
            self._information["HierarchyToken"] = {"TokenID": hierarchy[0], "Level": hierarchy[1]}
        _checked(self._information)
        self._user = _names(client, service, user_info)
        self._socket = None if socket is None else _path_bytes(socket)
        checked_number("the bound max_queued_messages", max_queued_messages, 0, 2**63 - 1)
        checked_number("the bound max_queued_bytes", max_queued_bytes, 0, 2**63 - 1)
        self._bounds = (max_queued_messages, max_queued_bytes)
        self._told = on_state_change
        self._aggregates = on_aggregated
        self._deadline = _milliseconds("call_deadline", call_deadline)
        self._waits = bool(finish_waits_for_daemon)
        self._flush_interval = _milliseconds("flush_interval", flush_interval)
        self._needs_daemon = not wait_for_daemon
        self._configured = configure
        self._shared: Dict[str, Any] = {}
        self._digest: Optional[Tuple[bytes, int]] = None
        self._counters: "weakref.WeakSet[Counter]" = weakref.WeakSet()
        self._ended = False
        self._lock = threading.Lock()  # while it is opened
        self._opener = 0  # the thread that opens it
        self._early: List[Tuple[State, str]] = []  # what that one was told meanwhile
        self._pointer: Optional[int] = None
        self._finalizer: Optional[weakref.finalize] = None
        self._forked = False  # this process is a child of the one that made it
        self._random_id = session_id is None
        self._number = next(_numbers)  # under which the library's callbacks find it
        _sessions[self._number] = self
        self._handle()

    # --- opening, here and in a forked child

    def _handle(self) -> int:
        pointer = self._pointer
        if pointer is not None:
            return pointer
        with self._lock:
            if self._pointer is None:
                if self._ended:
                    raise ClosedError("the session is closed")
                with _program.goes_on():
                    self._opener = threading.get_ident()
                    try:
                        self._pointer = self._opened()
                    finally:
                        self._opener = 0
            pointer = self._pointer
            early, self._early = self._early, []
        for change in early:  # without the lock: the program's function may use the session
            if self._told is not None:
                _calls.run(self._told, *change)
        return pointer

    def _opened(self) -> int:
        multiprocessing_process = sys.modules.get("multiprocessing.process")
        if multiprocessing_process is not None and multiprocessing_process.parent_process() is not None:
            _finish_with_process()
        options = Options(size=ctypes.sizeof(Options))
        options.socket_path = self._socket
        options.max_queued_messages, options.max_queued_bytes = self._bounds
        options.call_deadline_milliseconds = self._deadline or -1
        options.finish_waits_for_daemon = self._waits
        options.flush_interval_milliseconds = self._flush_interval
        options.ends_without_daemon = self._needs_daemon
        if self._told is not None:
            options.on_state_change = _on_state_change
            options.state_context = self._number
        if self._aggregates is not None:
            options.aggregation = _on_aggregated
            options.aggregation_context = self._number
        with Dictionary(self._information) as information, Dictionary(self._user) as user:
            options.session_info = information.pointer
            if self._user is not None:
                options.user_info = user.pointer
            pointer: int = lib.kyt_session_open(ctypes.byref(options))
        self._finalizer = weakref.finalize(self, lib.kyt_session_close, pointer)
        self._finalizer.atexit = False
        if self._configured:
            lib.kyt_session_configure(pointer, _calls.nobody, None)
        if self._shared:
            with Dictionary(self._shared) as entries:
                lib.kyt_session_update_shared_data(pointer, entries.pointer)
        if self._digest is not None:
            lib.kyt_session_set_digest_key(pointer, self._digest[0], len(self._digest[0]), self._digest[1])
        return pointer

    def _leave_to_parent(self) -> None:
        if self._finalizer is not None:
            self._finalizer.detach()
        self._finalizer = None
        self._pointer = None
        self._lock = threading.Lock()
        self._opener = 0
        self._early = []
        self._forked = True
        if self._random_id:
            self._information["SessionID"] = secrets.randbits(32)
        for counter in list(self._counters):
            counter._start_anew()

    # --- messages

    def send(
        self, category: int, type: int, payload: Optional[Payload] = None, /, *, flag: int = Flag.NONE, **fields: Any
    ) -> bool:
        """Queues one message; whether there was room for it. Category and type are 0 to 65535; category 0 is the daemon's.

        The payload is a mapping, keywords, or both. What reaches a server are texts, numbers, booleans and dates. Raises
        InvalidError for what cannot be meant so, ClosedError after the end. Does not wait for anything.
        """
        checked_number("flag", flag, 0, 3)
        with _message(category, type, payload, fields) as dictionary:
            problem = lib.kyt_session_try_send(
                self._handle(), category, type, dictionary.pointer, flag, _places.text, _REASON_BYTES
            )
        if problem == 0:
            return True
        if problem == 3:
            return False
        raise error_of(problem, _places.read())

    def send_with_reply(
        self,
        category: int,
        type: int,
        payload: Optional[Payload] = None,
        /,
        *,
        flag: int = Flag.NONE,
        timeout: Optional[float] = None,
        **fields: Any,
    ) -> Optional[str]:
        """The same, and waits for the daemon's answer: the text of what was posted, or None."""
        return _calls.wait(lambda: self._reply(category, type, payload, fields, flag), timeout)

    async def asend_with_reply(
        self, category: int, type: int, payload: Optional[Payload] = None, /, *, flag: int = Flag.NONE, **fields: Any
    ) -> Optional[str]:
        """send_with_reply() for asyncio."""
        return await asyncio.wrap_future(self._reply(category, type, payload, fields, flag))

    def _reply(
        self, category: int, type: int, payload: Optional[Payload], fields: Mapping[str, Any], flag: int
    ) -> "concurrent.futures.Future[Optional[str]]":
        checked_number("flag", flag, 0, 3)
        with _message(category, type, payload, fields) as dictionary:
            handle = self._handle()
            number, future = _calls.begin()
            lib.kyt_session_send_with_reply(
                handle, category, type, dictionary.pointer, flag, _calls.on_text, number
            )
        return future

    def timed(self, category: int, type: int, /, **fields: Any) -> Timer:
        """For a with statement, or to decorate a function: sends how long it took, see Timer."""
        return Timer(self, category, type, **fields)

    def counter(self, category: int, type: int, /, *, interval: float = 60.0, **fields: Any) -> Counter:
        """Sums up what is too frequent for messages of its own, see Counter."""
        counter = Counter(self, category, type, interval=interval, **fields)
        self._counters.add(counter)
        return counter

    # --- calls with an answer

    def configure(self, timeout: Optional[float] = None) -> Optional[List[str]]:
        """Asks the daemon to configure the session. The names of the live back ends; None without a storebag."""
        return _calls.wait(self._configuration, timeout)

    async def aconfigure(self) -> Optional[List[str]]:
        """configure() for asyncio."""
        return await asyncio.wrap_future(self._configuration())

    def _configuration(self) -> "concurrent.futures.Future[Optional[List[str]]]":
        self._configured = True
        number, future = self._begin()
        lib.kyt_session_configure(self._handle(), _calls.on_states, number)
        return future

    def fetch_states(
        self, user_info: Optional[Payload] = None, *, timeout: Optional[float] = None
    ) -> Optional[List[str]]:
        """The live back ends. With user information that takes the place of what there was: then as of that."""
        return _calls.wait(lambda: self._states(user_info), timeout)

    async def afetch_states(self, user_info: Optional[Payload] = None) -> Optional[List[str]]:
        """fetch_states() for asyncio."""
        return await asyncio.wrap_future(self._states(user_info))

    def _states(self, user_info: Optional[Payload]) -> "concurrent.futures.Future[Optional[List[str]]]":
        if user_info is not None:
            checked_mapping("user_info", user_info)
        entries = self._user if user_info is None else dict(user_info)
        with Dictionary(entries) as user:
            number, future = self._begin()
            self._user = entries  # now that it can be meant so
            pointer = None if entries is None else user.pointer
            lib.kyt_session_fetch_states(self._handle(), pointer, _calls.on_states, number)
        return future

    def fetch_display_url(self, timeout: Optional[float] = None) -> Optional[str]:
        """The address for people that the storebag names."""
        return _calls.wait(self._display_url, timeout)

    async def afetch_display_url(self) -> Optional[str]:
        """fetch_display_url() for asyncio."""
        return await asyncio.wrap_future(self._display_url())

    def _display_url(self) -> "concurrent.futures.Future[Optional[str]]":
        number, future = self._begin()
        lib.kyt_session_fetch_display_url(self._handle(), _calls.on_text, number)
        return future

    def flush(self, timeout: Optional[float] = None) -> Optional[str]:
        """Posts what is batched, and waits for the servers. The text of what was posted, where it may be shown.

        Raises BackEndError with the first back end's text, such as "Nothing to flush".
        """
        return _calls.wait(self._flush, timeout)

    async def aflush(self) -> Optional[str]:
        """flush() for asyncio."""
        return await asyncio.wrap_future(self._flush())

    def _flush(self) -> "concurrent.futures.Future[Optional[str]]":
        for counter in list(self._counters):
            counter.send()
        number, future = self._begin()
        lib.kyt_session_flush(self._handle(), _calls.on_text, number)
        return future

    def upload_file(self, path: Union[str, "os.PathLike[str]"], timeout: Optional[float] = None) -> bool:
        """Whether a back end took the file. It is opened at once, with this program's rights."""
        return _calls.wait(lambda: self._upload(path), timeout)

    async def aupload_file(self, path: Union[str, "os.PathLike[str]"]) -> bool:
        """upload_file() for asyncio."""
        return await asyncio.wrap_future(self._upload(path))

    def _upload(self, path: Union[str, "os.PathLike[str]"]) -> "concurrent.futures.Future[bool]":
        encoded = _path_bytes(path)
        number, future = self._begin()
        lib.kyt_session_upload_file(self._handle(), encoded, _calls.on_success, number)
        return future

    def upload_log_data(self, log_data: Sequence[Any], timeout: Optional[float] = None) -> bool:
        """Whether a back end took the data."""
        return _calls.wait(lambda: self._upload_data(log_data), timeout)

    async def aupload_log_data(self, log_data: Sequence[Any]) -> bool:
        """upload_log_data() for asyncio."""
        return await asyncio.wrap_future(self._upload_data(log_data))

    def _upload_data(self, log_data: Sequence[Any]) -> "concurrent.futures.Future[bool]":
        if not isinstance(log_data, (list, tuple)):
            raise InvalidError(f"log_data must be a list, not a value of the type {type(log_data).__name__}")
        with Array(log_data) as array:
            number, future = self._begin()
            lib.kyt_session_upload_log_data(self._handle(), array.pointer, _calls.on_success, number)
        return future

    def _begin(self) -> "Tuple[int, concurrent.futures.Future[Any]]":
        self._handle()  # raises before a number is given out
        return _calls.begin()

    # --- what the session shares and signs with

    def update_shared_data(self, entries: Optional[Payload] = None, /, **more: Any) -> None:
        """What goes into the records of all sessions of the hierarchy."""
        if entries is not None:
            checked_mapping("entries", entries)
        merged = {**(entries or {}), **more}
        with Dictionary(merged) as dictionary:
            lib.kyt_session_update_shared_data(self._handle(), dictionary.pointer)
        self._shared.update(merged)

    def remove_shared_data(self, key: str) -> None:
        """Takes one entry of it back."""
        if not isinstance(key, str):
            raise InvalidError(f"a key of the type {type(key).__name__}: keys are texts")
        lib.kyt_session_remove_shared_data(self._handle(), text_bytes(key))
        self._shared.pop(key, None)

    def set_digest_key(self, key: bytes, algorithm: int = 0) -> None:
        """Key of the digests of the posts of the back end "qrs"; algorithm 0 is HMAC-SHA1."""
        if not isinstance(key, (bytes, bytearray)):
            raise InvalidError(f"key must be bytes, not a value of the type {type(key).__name__}")
        checked_number("algorithm", algorithm, -(2**31), 2**31 - 1)
        key = bytes(key)
        lib.kyt_session_set_digest_key(self._handle(), key, len(key), algorithm)
        self._digest = (key, algorithm)

    # --- where it stands

    @property
    def state(self) -> State:
        """Where the session stands."""
        return State.NO_DAEMON if self._unopened() else State(lib.kyt_session_state(self._handle()))

    @property
    def state_reason(self) -> str:
        """Why, as a text for people."""
        if self._unopened():
            return "nothing was sent from this forked process yet"
        lib.kyt_session_state_reason(self._handle(), _places.text, _REASON_BYTES)
        return _places.read()

    def statistics(self) -> Statistics:
        """Where the session's messages are. In a forked child they begin at zero."""
        figures = Figures()
        if not self._unopened():
            lib.kyt_session_read_statistics(self._handle(), ctypes.byref(figures), ctypes.sizeof(figures))
        return statistics_of(figures)

    def _unopened(self) -> bool:
        """In a forked child: whoever only looks opens nothing."""
        return self._pointer is None and self._forked and not self._lock.locked()

    # --- the end

    def finish(self, timeout: float = 5.0) -> bool:
        """Sends what is queued, says goodbye and waits so many seconds at most; whether the daemon has taken all.

        Gives up at once where no daemon ever took anything and none is there. False also when it has ended before.
        Ctrl-C, or another handler that raises, ends the waiting and the session at once: what is queued is lost.
        """
        if not isinstance(timeout, (int, float)):
            raise InvalidError(f"timeout must be a number of seconds, not a value of the type {type(timeout).__name__}")
        milliseconds = _milliseconds("timeout", min(max(0.0, timeout), _MOST_SECONDS))
        if self._pointer is None and (self._ended or not self._has_sums()):  # nothing was sent in this forked child
            self._ended = True
            return True
        for counter in list(self._counters):
            if not self._ended:
                counter.send()
        try:
            self._ended = True
            return self._say_goodbye(milliseconds)
        except BaseException:
            self.close()
            raise

    def _say_goodbye(self, milliseconds: int) -> bool:
        """On the main thread by another one: there signals are handled, and not before a call of the library's returns."""

        def say() -> bool:
            return bool(lib.kyt_session_finish(self._pointer, milliseconds))

        if threading.current_thread() is not threading.main_thread():
            return say()
        said: "concurrent.futures.Future[bool]" = concurrent.futures.Future()
        try:
            threading.Thread(target=lambda: said.set_result(say()), name="kyt-finish").start()
        except RuntimeError:  # the system has none, or the interpreter ends
            return say()
        return said.result()

    def _has_sums(self) -> bool:
        return any(counter._has_sum() for counter in list(self._counters))

    async def afinish(self, timeout: float = 5.0) -> bool:
        """finish() for asyncio: a thread of the loop's executor waits. Cancelled, it ends the session at once."""
        finish = functools.partial(self.finish, timeout)
        try:
            return await asyncio.get_running_loop().run_in_executor(None, finish)
        except asyncio.CancelledError:
            self.close()  # the end of the loop waits for that thread
            raise

    def close(self) -> None:
        """Ends the session without waiting: what is queued is lost. No callback runs once it has returned."""
        self._ended = True
        if self._pointer is not None:
            lib.kyt_session_end(self._pointer)

    def __enter__(self) -> "Session":
        return self

    def __exit__(
        self,
        kind: Optional[Type[BaseException]],
        value: Optional[BaseException],
        traceback: Optional[TracebackType],
    ) -> None:
        try:
            self.finish()
        finally:  # by Ctrl-C too
            self.close()

    async def __aenter__(self) -> "Session":
        return self

    async def __aexit__(
        self,
        kind: Optional[Type[BaseException]],
        value: Optional[BaseException],
        traceback: Optional[TracebackType],
    ) -> None:
        try:
            await self.afinish()
        finally:  # of a task that is cancelled too
            self.close()


def _message(category: int, type: int, payload: Optional[Payload], fields: Mapping[str, Any]) -> Dictionary:
    for number in (category, type):
        if not isinstance(number, int):
            raise InvalidError("category and type are whole numbers")
        if not 0 <= number < 2**32:  # the library refuses the rest, and counts it
            raise InvalidError(f"category {shown(category)}, type {shown(type)}: both are whole numbers from 0 to 65535")
    if payload is None:
        return Dictionary(fields)
    checked_mapping("payload", payload)
    return Dictionary({**payload, **fields} if fields else payload)


def total_statistics() -> Statistics:
    """The sums over all sessions of this process, ended ones and single messages included."""
    figures = Figures()
    lib.kyt_total_read_statistics(ctypes.byref(figures), ctypes.sizeof(figures))
    return statistics_of(figures)


def send_single(
    category: int,
    type: int,
    payload: Optional[Payload] = None,
    /,
    *,
    client_type: int,
    client: Optional[str] = None,
    service: Optional[str] = None,
    user_info: Optional[Payload] = None,
    session_id: int = 1,
    require_user_info: bool = True,
    socket: Optional[str] = None,
    timeout: Optional[float] = None,
    **fields: Any,
) -> str:
    """One event without a session, on a connection of its own; waits for the answer.

    "finished": the daemon had a storebag and has offered the event to its back ends; or "storebag not available".
    """
    names = (client_type, client, service, user_info, session_id, require_user_info, socket)
    return _calls.wait(lambda: _single(category, type, payload, fields, *names), timeout) or ""


async def asend_single(
    category: int,
    type: int,
    payload: Optional[Payload] = None,
    /,
    *,
    client_type: int,
    client: Optional[str] = None,
    service: Optional[str] = None,
    user_info: Optional[Payload] = None,
    session_id: int = 1,
    require_user_info: bool = True,
    socket: Optional[str] = None,
    **fields: Any,
) -> str:
    """send_single() for asyncio."""
    names = (client_type, client, service, user_info, session_id, require_user_info, socket)
    answer = await asyncio.wrap_future(_single(category, type, payload, fields, *names))
    return answer or ""


def _single(
    category: int,
    type: int,
    payload: Optional[Payload],
    fields: Mapping[str, Any],
    client_type: int,
    client: Optional[str],
    service: Optional[str],
    user_info: Optional[Payload],
    session_id: int,
    require_user_info: bool,
    socket: Optional[str],
) -> "concurrent.futures.Future[Optional[str]]":
    information = {"SessionID": session_id, "ClientType": client_type, "RequireUserInfo": require_user_info}
    _checked(information)
    user_entries = _names(client, service, user_info)
    options = Options(size=ctypes.sizeof(Options))
    options.socket_path = None if socket is None else _path_bytes(socket)
    with Dictionary(information) as session_info, Dictionary(user_entries) as user:
        with _message(category, type, payload, fields) as message:
            options.session_info = session_info.pointer
            if user_entries is not None:
                options.user_info = user.pointer
            with _program.goes_on():
                number, future = _calls.begin()
                lib.kyt_send_single_message(
                    ctypes.byref(options), category, type, message.pointer, _calls.on_text, number
                )
    return future


def _at_exit() -> None:
    """What is queued is sent, then nothing of the library's calls into the interpreter any more."""
    end = time.monotonic() + _LAST_SECOND
    try:
        for session in list(_sessions.values()):
            if not session._ended and (session._pointer is not None or session._has_sums()):
                try:
                    session.finish(max(0.0, end - time.monotonic()))
                except Error as error:
                    print(f"kytreporting: {error}", file=sys.stderr)
    finally:  # whatever the program was told meanwhile, by Ctrl-C too
        _program.ended = True
        try:
            with _program.opening:  # who has begun to open something is done
                pass
        finally:  # by a second Ctrl-C too
            lib.kyt_close_all()


def _is_of_a_forkserver() -> bool:
    """Such a process was forked before it imported this module, and ends without what atexit has. Its arguments are those
    of its server."""
    return any("multiprocessing.forkserver" in text for text in getattr(sys, "orig_argv", ()))


def _finish_with_process(_: object = None) -> None:
    """A process of multiprocessing ends by os._exit(), and does before it what is registered with it."""
    if _program.watches_process != os.getpid():
        _program.watches_process = os.getpid()
        sys.modules["multiprocessing.util"].Finalize(None, _at_exit, exitpriority=0)


def _after_fork_in_child() -> None:
    _calls.forget_all()
    multiprocessing_util = sys.modules.get("multiprocessing.util")
    if multiprocessing_util is not None:  # which forgets what is to be done at the end when its process begins
        multiprocessing_util.register_after_fork(_program, _finish_with_process)
    _program.opening = threading.RLock()  # another thread may have held it
    for session in list(_sessions.values()):
        session._leave_to_parent()


atexit.register(_at_exit)
if _is_of_a_forkserver() and "multiprocessing.util" in sys.modules:
    # What is to be done at its end is forgotten once more before its work begins.
    sys.modules["multiprocessing.util"].register_after_fork(_program, _finish_with_process)
os.register_at_fork(after_in_child=_after_fork_in_child)
