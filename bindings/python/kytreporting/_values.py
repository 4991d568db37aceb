"""Python's values as the library's dictionaries and arrays."""

from __future__ import annotations

import datetime
from typing import Any, Iterable, Mapping, Optional, Sequence, Union

from ._errors import InvalidError
from ._library import lib

Scalar = Union[str, bool, int, float, bytes, bytearray, memoryview, datetime.datetime, None]
Payload = Mapping[str, Any]
"""Keys are texts; values are texts, whole numbers of 64 bits, floats, booleans, bytes, datetimes, and lists and mappings
of these. None is an entry that is left out."""

_MOST_NESTED = 64  # the wire allows 32 containers in a message


def _text(value: str) -> bytes:
    if "\0" in value:
        raise InvalidError("a text with a NUL character cannot be sent")
    return value.encode("utf-8", "replace")


def _seconds(value: datetime.datetime) -> float:
    return value.timestamp()


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
            _put(lib, "kyt_dictionary_set_", (self.pointer, _text(key)), value, self._depth)


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
        put("string", _text(value))
    elif isinstance(value, bool):
        put("bool", value)
    elif isinstance(value, int):
        if not -(2**63) <= value < 2**64:
            raise InvalidError(f"{value}: whole numbers have 64 bits")
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
