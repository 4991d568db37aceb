"""Python's values as the library's dictionaries and arrays."""

from __future__ import annotations

import ctypes
import datetime
from typing import Any, Dict, Iterable, Mapping, Optional, Sequence, Union

from ._errors import InvalidError
from ._library import lib

Scalar = Union[str, bool, int, float, bytes, bytearray, memoryview, datetime.datetime, None]
Payload = Mapping[str, Any]
"""Keys are texts; values are texts, whole numbers of 64 bits, floats, booleans, bytes, datetimes, and lists and mappings
of these. A mapping's entry that is None is left out; a list has no None."""

_MOST_NESTED = 64  # the wire allows 32 containers in a message


def text_bytes(value: str) -> bytes:
    if "\0" in value:
        raise InvalidError("a text with a NUL character cannot be sent")
    return value.encode("utf-8", "replace")


def checked_mapping(what: str, value: Any) -> None:
    """Raises for what is no mapping, and names what was given."""
    if not isinstance(value, Mapping):
        raise InvalidError(f"{what} must be a mapping, not a value of the type {type(value).__name__}")


def checked_number(what: str, value: Any, low: float, high: float, whole: bool = True) -> None:
    """Raises for what is no number of that range, and names what was given."""
    if not isinstance(value, int if whole else (int, float)):
        kind = "whole number" if whole else "number"
        raise InvalidError(f"{what} must be a {kind}, not a value of the type {type(value).__name__}")
    if not low <= value <= high:
        raise InvalidError(f"{what} must be from {low} to {high}, not {shown(value)}")


def _seconds(value: datetime.datetime) -> float:
    try:
        return value.timestamp()
    except (OverflowError, ValueError, OSError) as error:  # the local time's year 0, for one
        raise InvalidError(f"the date {value} cannot be sent: {error}") from None


def shown(value: float) -> str:
    """Python refuses to write a number of thousands of digits."""
    if isinstance(value, int) and value.bit_length() >= 1000:
        return f"a number of {value.bit_length()} bits"
    return str(value)


def _unknown(value: object) -> InvalidError:
    return InvalidError(f"a value of the type {type(value).__name__} cannot be sent")


class _Object:
    """A dictionary or an array of the library's, freed at the end of the with statement."""

    def __init__(self, prefix: str, depth: int) -> None:
        if depth > _MOST_NESTED:
            raise InvalidError("nested too deeply")
        self._depth = depth
        self._free = getattr(lib, prefix + "_free")
        self.pointer = getattr(lib, prefix + "_new")()
        if not self.pointer:
            raise MemoryError

    def __enter__(self) -> Any:
        return self

    def __exit__(self, *_: object) -> None:
        self._free(self.pointer)


class Dictionary(_Object):
    """kyt_dictionary."""

    def __init__(self, entries: Optional[Payload] = None, depth: int = 1) -> None:
        super().__init__("kyt_dictionary", depth)
        try:
            for key, value in (entries or {}).items():
                self.set(key, value)
        except BaseException:
            self._free(self.pointer)
            raise

    def set(self, key: str, value: Any) -> None:
        """None leaves the dictionary as it was."""
        if not isinstance(key, str):
            raise InvalidError(f"a key of the type {type(key).__name__}: keys are texts")
        if value is not None:
            _put(lib, "kyt_dictionary_set_", (self.pointer, text_bytes(key)), value, self._depth)


class Array(_Object):
    """kyt_array."""

    def __init__(self, values: Iterable[Any], depth: int = 1) -> None:
        super().__init__("kyt_array", depth)
        try:
            for value in values:
                _put(lib, "kyt_array_append_", (self.pointer,), value, self._depth)
        except BaseException:
            self._free(self.pointer)
            raise


def _put(library: Any, prefix: str, where: Sequence[Any], value: Any, depth: int) -> None:
    def put(kind: str, *what: Any) -> None:
        getattr(library, prefix + kind)(*where, *what)

    if isinstance(value, str):
        put("string", text_bytes(value))
    elif isinstance(value, bool):
        put("bool", value)
    elif isinstance(value, int):
        if not -(2**63) <= value < 2**64:
            raise InvalidError(f"{shown(value)}: whole numbers have 64 bits")
        put("int" if value < 2**63 else "uint", value)
    elif isinstance(value, float):
        put("double", value)
    elif isinstance(value, (bytes, bytearray, memoryview)):
        data = bytes(value)
        put("data", data, len(data))
    elif isinstance(value, datetime.datetime):
        put("date", _seconds(value))
    elif isinstance(value, Mapping):
        with Dictionary(value, depth + 1) as dictionary:
            put("dictionary", dictionary.pointer)
    elif isinstance(value, (list, tuple)):
        with Array(value, depth + 1) as array:
            put("array", array.pointer)
    else:
        raise _unknown(value)


# By the numbers of kyt_kind; what is not here is null.
_BOOL, _INT, _UINT, _DOUBLE, _DATE, _STRING, _DATA, _ARRAY, _DICTIONARY = range(1, 10)


def entries_of(dictionary: Optional[int]) -> Optional[Dict[str, Any]]:
    """A kyt_dictionary as Python's; None for null."""
    if not dictionary:
        return None
    entries: Dict[str, Any] = {}
    key = ctypes.c_char_p()
    for index in range(lib.kyt_dictionary_count(dictionary)):
        value = lib.kyt_dictionary_at(dictionary, index, ctypes.byref(key))
        entries[_key_of(key)] = _value_of(value)
    return entries


def _key_of(key: ctypes.c_char_p) -> str:
    return (key.value or b"").decode("utf-8", "replace")


def _value_of(value: int) -> Any:
    kind = lib.kyt_value_kind(value)
    if kind == _BOOL:
        return bool(lib.kyt_value_int(value))
    if kind == _INT:
        return lib.kyt_value_int(value)
    if kind == _UINT:
        return lib.kyt_value_uint(value)
    if kind == _DOUBLE:
        return lib.kyt_value_double(value)
    if kind == _DATE:
        return _date_of(lib.kyt_value_double(value))
    if kind in (_STRING, _DATA):
        length = ctypes.c_size_t()
        data = ctypes.string_at(lib.kyt_value_bytes(value, ctypes.byref(length)), length.value)
        return data if kind == _DATA else data.decode("utf-8", "replace")
    if kind in (_ARRAY, _DICTIONARY):
        return _container_of(value, kind)
    return None


def _container_of(value: int, kind: int) -> Any:
    key = ctypes.c_char_p()
    places = range(lib.kyt_value_count(value))
    if kind == _ARRAY:
        return [_value_of(lib.kyt_value_at(value, index, None)) for index in places]
    entries: Dict[str, Any] = {}
    for index in places:
        entry = lib.kyt_value_at(value, index, ctypes.byref(key))
        entries[_key_of(key)] = _value_of(entry)
    return entries


def _date_of(seconds: float) -> Any:
    try:
        return datetime.datetime.fromtimestamp(seconds, datetime.timezone.utc)
    except (OverflowError, ValueError, OSError):
        return seconds
