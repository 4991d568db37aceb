"""libkytreporting as ctypes sees it. ctypes gives up the interpreter's lock in each call, and takes it for callbacks."""

from __future__ import annotations

import ctypes
from ctypes import c_char_p, c_double, c_int, c_int32, c_int64, c_size_t, c_uint, c_uint16, c_uint32, c_uint64, c_void_p

STATES_CALLBACK = ctypes.CFUNCTYPE(None, ctypes.POINTER(c_char_p), c_size_t, c_int, c_char_p, c_void_p)
SUCCESS_CALLBACK = ctypes.CFUNCTYPE(None, c_int, c_char_p, c_void_p)
TEXT_CALLBACK = ctypes.CFUNCTYPE(None, c_char_p, c_char_p, c_void_p)
STATE_CALLBACK = ctypes.CFUNCTYPE(None, c_int, c_char_p, c_void_p)
AGGREGATION_CALLBACK = ctypes.CFUNCTYPE(None, c_void_p, c_double, c_uint16, c_uint16, c_void_p, c_void_p)


class Options(ctypes.Structure):
    """kyt_options. It begins with its size, so the library knows which of its fields this module has."""

    _fields_ = [
        ("size", c_size_t),
        ("socket_path", c_char_p),
        ("session_info", c_void_p),
        ("user_info", c_void_p),
        ("aggregation", AGGREGATION_CALLBACK),
        ("aggregation_context", c_void_p),
        ("max_queued_messages", c_size_t),
        ("max_queued_bytes", c_size_t),
        ("on_state_change", STATE_CALLBACK),
        ("state_context", c_void_p),
        ("call_deadline_milliseconds", c_int64),
        ("finish_waits_for_daemon", c_int),
        ("flush_interval_milliseconds", c_int64),
        ("finish_on_close_milliseconds", c_int64),
        ("ends_without_daemon", c_int),
    ]


class Figures(ctypes.Structure):
    """kyt_statistics, as far as this module knows it: the library is told its size."""

    _fields_ = [
        ("sent", c_uint64),
        ("dropped_queue_full", c_uint64),
        ("lost_on_connection_end", c_uint64),
        ("dropped_closed", c_uint64),
        ("dropped_invalid", c_uint64),
        ("connections", c_uint64),
        ("queued", c_uint64),
        ("waited_too_long", c_uint64),
        ("replay_failed", c_uint64),
        ("sent_unconfigured", c_uint64),
        ("accepted", c_uint64),
        ("lost_in_queue", c_uint64),
        ("dropped_unsendable", c_uint64),
        ("dropped_too_late", c_uint64),
    ]


_P = c_void_p
_FUNCTIONS = {
    "kyt_dictionary_new": (_P, []),
    "kyt_dictionary_free": (None, [_P]),
    "kyt_dictionary_set_string": (None, [_P, c_char_p, c_char_p]),
    "kyt_dictionary_set_int": (None, [_P, c_char_p, c_int64]),
    "kyt_dictionary_set_uint": (None, [_P, c_char_p, c_uint64]),
    "kyt_dictionary_set_double": (None, [_P, c_char_p, c_double]),
    "kyt_dictionary_set_bool": (None, [_P, c_char_p, c_int]),
    "kyt_dictionary_set_date": (None, [_P, c_char_p, c_double]),
    "kyt_dictionary_set_data": (None, [_P, c_char_p, c_char_p, c_size_t]),
    "kyt_dictionary_set_dictionary": (None, [_P, c_char_p, _P]),
    "kyt_dictionary_set_array": (None, [_P, c_char_p, _P]),
    "kyt_dictionary_count": (c_size_t, [_P]),
    "kyt_dictionary_at": (_P, [_P, c_size_t, ctypes.POINTER(c_char_p)]),
    "kyt_value_kind": (c_int, [_P]),
    "kyt_value_int": (c_int64, [_P]),
    "kyt_value_uint": (c_uint64, [_P]),
    "kyt_value_double": (c_double, [_P]),
    "kyt_value_bytes": (_P, [_P, ctypes.POINTER(c_size_t)]),
    "kyt_value_count": (c_size_t, [_P]),
    "kyt_value_at": (_P, [_P, c_size_t, ctypes.POINTER(c_char_p)]),
    "kyt_array_new": (_P, []),
    "kyt_array_free": (None, [_P]),
    "kyt_array_append_string": (None, [_P, c_char_p]),
    "kyt_array_append_int": (None, [_P, c_int64]),
    "kyt_array_append_uint": (None, [_P, c_uint64]),
    "kyt_array_append_double": (None, [_P, c_double]),
    "kyt_array_append_bool": (None, [_P, c_int]),
    "kyt_array_append_date": (None, [_P, c_double]),
    "kyt_array_append_data": (None, [_P, c_char_p, c_size_t]),
    "kyt_array_append_dictionary": (None, [_P, _P]),
    "kyt_array_append_array": (None, [_P, _P]),
    "kyt_callback_error": (c_int, []),
    "kyt_session_info_check": (c_int, [_P, c_char_p, c_size_t]),
    "kyt_session_open": (_P, [ctypes.POINTER(Options)]),
    "kyt_session_close": (None, [_P]),
    "kyt_session_end": (None, [_P]),
    "kyt_close_all": (None, []),
    "kyt_session_finish": (c_int, [_P, c_uint]),
    "kyt_session_state": (c_int, [_P]),
    "kyt_session_state_reason": (None, [_P, c_char_p, c_size_t]),
    "kyt_session_configure": (None, [_P, STATES_CALLBACK, _P]),
    "kyt_session_fetch_states": (None, [_P, _P, STATES_CALLBACK, _P]),
    "kyt_session_try_send": (c_int, [_P, c_uint32, c_uint32, _P, c_uint32, c_char_p, c_size_t]),
    "kyt_session_send_with_reply": (None, [_P, c_uint32, c_uint32, _P, c_uint32, TEXT_CALLBACK, _P]),
    "kyt_session_fetch_display_url": (None, [_P, TEXT_CALLBACK, _P]),
    "kyt_session_flush": (None, [_P, TEXT_CALLBACK, _P]),
    "kyt_session_update_shared_data": (None, [_P, _P]),
    "kyt_session_remove_shared_data": (None, [_P, c_char_p]),
    "kyt_session_set_digest_key": (None, [_P, c_char_p, c_size_t, c_int32]),
    "kyt_session_upload_file": (None, [_P, c_char_p, SUCCESS_CALLBACK, _P]),
    "kyt_session_upload_log_data": (None, [_P, _P, SUCCESS_CALLBACK, _P]),
    "kyt_session_read_statistics": (None, [_P, ctypes.POINTER(Figures), c_size_t]),
    "kyt_total_read_statistics": (None, [ctypes.POINTER(Figures), c_size_t]),
    "kyt_send_single_message": (None, [ctypes.POINTER(Options), c_uint32, c_uint32, _P, TEXT_CALLBACK, _P]),
}


def _load() -> ctypes.CDLL:
    library = ctypes.CDLL("libkytreporting.so.8")
    for name, (result, arguments) in _FUNCTIONS.items():
        function = getattr(library, name)
        function.restype = result
        function.argtypes = arguments
    return library


lib = _load()
