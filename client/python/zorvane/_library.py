# SPDX-License-Identifier: Apache-2.0
"""The C library by ctypes: its functions with their types, and values taken over from one side to the other."""

import ctypes
import datetime
from ctypes import CFUNCTYPE, POINTER, Structure, c_char, c_char_p, c_double, c_int, c_int32, c_int64, c_size_t, c_uint8
from ctypes import c_uint32, c_uint64, c_void_p
from typing import Dict, List, Optional, Union

Value = Union[bool, int, float, str, bytes, datetime.datetime, List["Value"], Dict[str, "Value"]]

OK, NOT_FOUND, REFUSED, UNREACHABLE, TIMED_OUT, OTHER = range(6)
BOOLEAN, INTEGER, UNSIGNED, REAL, STRING, DATA, DATE, LIST, MAP = range(1, 10)
EPOCH = datetime.datetime(2001, 1, 1, tzinfo=datetime.timezone.utc)


class CError(Structure):
    _fields_ = [("kind", c_uint32), ("reserved", c_uint32), ("code", c_uint64), ("message", c_char * 1024),
                ("advice", c_char * 1024)]


class CAddress(Structure):
    _fields_ = [("container_class", c_uint32), ("user", c_uint32), ("identifier", c_char_p), ("uuid", c_uint8 * 16)]


Callback = CFUNCTYPE(None, c_void_p, c_void_p, POINTER(CError))
_address = POINTER(CAddress)
_error = POINTER(CError)

# Result and arguments; handles are c_void_p.
_functions = {
    "version": (c_char_p,),
    "code_meaning": (c_char_p, c_uint64),
    "class_by_name": (c_uint32, c_char_p),
    "class_name": (c_char_p, c_uint32),
    "default_user": (c_uint32, c_uint32, c_char_p),
    "value_boolean": (c_void_p, c_int),
    "value_integer": (c_void_p, c_int64),
    "value_unsigned": (c_void_p, c_uint64),
    "value_real": (c_void_p, c_double),
    "value_string": (c_void_p, c_char_p),
    "value_data": (c_void_p, c_char_p, c_size_t),
    "value_date": (c_void_p, c_double),
    "value_list": (c_void_p,),
    "value_map": (c_void_p,),
    "value_free": (None, c_void_p),
    "value_append": (c_int, c_void_p, c_void_p),
    "value_set": (c_int, c_void_p, c_char_p, c_void_p),
    "value_type": (c_int, c_void_p),
    "value_get_boolean": (c_int, c_void_p),
    "value_get_integer": (c_int64, c_void_p),
    "value_get_unsigned": (c_uint64, c_void_p),
    "value_get_real": (c_double, c_void_p),
    "value_get_string": (c_char_p, c_void_p),
    "value_get_data": (c_void_p, c_void_p, POINTER(c_size_t)),
    "value_count": (c_size_t, c_void_p),
    "value_at": (c_void_p, c_void_p, c_size_t),
    "value_get": (c_void_p, c_void_p, c_char_p),
    "value_next_key": (c_char_p, c_void_p, c_char_p),
    "request_lookup": (c_void_p, c_uint32, c_uint32, c_char_p, c_uint32),
    "request_list": (c_void_p, c_uint32, c_uint32, c_uint32),
    "request_list_page": (c_void_p, c_uint32, c_uint32, c_uint32, c_char_p),
    "request_delete": (c_void_p, c_uint32, c_uint32, c_char_p, c_uint32),
    "request_stage_for_delete": (c_void_p, _address, c_size_t),
    "request_empty_death_row": (c_void_p,),
    "request_replace": (c_void_p, _address, _address),
    "request_wipe": (c_void_p, c_uint32, c_uint32, c_char_p),
    "request_wipe_plugin_data": (c_void_p, c_uint32, c_char_p),
    "request_metadata": (c_void_p, _address),
    "request_info": (c_void_p, _address, c_char_p),
    "request_set_info": (c_void_p, _address, c_char_p, c_void_p),
    "request_disk_usage": (c_void_p, _address),
    "request_recreate_structure": (c_void_p, _address),
    "request_regenerate_directory": (c_void_p, _address),
    "request_set_protection": (c_void_p, c_uint32, c_uint32, c_char_p, c_int32, c_uint32),
    "request_group_paths": (c_void_p, c_uint32, c_char_p),
    "request_group_identifiers": (c_void_p, c_uint32, c_char_p),
    "request_system_path": (c_void_p, c_char_p),
    "request_system_group_paths": (c_void_p, c_char_p),
    "request_system_group_path": (c_void_p, c_char_p, c_char_p),
    "request_register": (c_void_p, c_char_p, c_void_p, c_char_p, c_uint32),
    "request_status": (c_void_p,),
    "request_retry_test": (c_void_p, c_uint32, c_uint64),
    "request_free": (None, c_void_p),
    "connect": (c_void_p, c_char_p, c_int64, _error),
    "client_free": (None, c_void_p),
    "call": (c_int, c_void_p, c_void_p, POINTER(c_void_p), _error),
    "result_free": (None, c_void_p),
    "result_path": (c_char_p, c_void_p),
    "result_identifier": (c_char_p, c_void_p),
    "result_uuid": (c_void_p, c_void_p),
    "result_existed": (c_int, c_void_p),
    "result_transient": (c_int, c_void_p),
    "result_bytes": (c_uint64, c_void_p),
    "result_value": (c_void_p, c_void_p),
    "result_count": (c_size_t, c_void_p),
    "result_identifier_at": (c_char_p, c_void_p, c_size_t),
    "result_path_at": (c_char_p, c_void_p, c_size_t),
    "result_uuid_at": (c_void_p, c_void_p, c_size_t),
    "result_next_page": (c_char_p, c_void_p),
    "async_new": (c_void_p, c_char_p, c_int64, _error),
    "async_free": (None, c_void_p),
    "async_fd": (c_int, c_void_p),
    "async_start": (c_uint64, c_void_p, c_void_p, Callback, c_void_p, _error),
    "async_dispatch": (c_size_t, c_void_p),
    "async_cancel": (c_int, c_void_p, c_uint64),
}


class _Library:
    """zorvane_NAME as its attribute NAME."""

    def __init__(self) -> None:
        library = ctypes.CDLL("libzorvane.so.0")
        for name, (result, *arguments) in _functions.items():
            function = getattr(library, "zorvane_" + name)
            function.restype = result
            function.argtypes = arguments
            setattr(self, name, function)

    def __getattr__(self, name: str):  # for type checkers: what __init__ has set is found before
        raise AttributeError(name)


lib = _Library()


def encoded(text: Optional[str]) -> Optional[bytes]:
    if text is not None and "\0" in text:
        raise ValueError("a text for zorvaned has a NUL in it")
    return None if text is None else text.encode()


def decoded(text: Optional[bytes]) -> str:
    return (text or b"").decode()


def value_to_c(value: Value) -> int:
    """A value of the library's, which the caller frees or gives away."""
    if isinstance(value, bool):
        made = lib.value_boolean(value)
    elif isinstance(value, int):
        if not -2**63 <= value < 2**64:
            raise OverflowError("an integer of a value has at most 64 bits")
        made = lib.value_integer(value) if value < 2**63 else lib.value_unsigned(value)
    elif isinstance(value, float):
        made = lib.value_real(value)
    elif isinstance(value, str):
        made = lib.value_string(encoded(value))
    elif isinstance(value, (bytes, bytearray)):
        made = lib.value_data(bytes(value), len(value))
    elif isinstance(value, datetime.datetime):
        if value.tzinfo is None:
            raise ValueError("a date without a time zone")
        made = lib.value_date((value - EPOCH).total_seconds())
    elif isinstance(value, (list, tuple)):
        made = lib.value_list()
        _fill(made, [(None, element) for element in value])
    elif isinstance(value, dict):
        made = lib.value_map()
        _fill(made, list(value.items()))
    else:
        raise TypeError(f"a value cannot be {type(value).__name__}")
    if not made:
        raise MemoryError
    return made


def _fill(container: int, elements) -> None:
    try:
        for key, element in elements:
            child = value_to_c(element)
            put = lib.value_append(container, child) if key is None else lib.value_set(container, encoded(key), child)
            if put != OK:
                raise MemoryError
    except BaseException:
        lib.value_free(container)
        raise


def _date(seconds: float) -> datetime.datetime:
    try:
        return EPOCH + datetime.timedelta(seconds=seconds)
    except (OverflowError, ValueError):  # other programs write dates too, and Python's end with the year 9999
        end = datetime.datetime.min if seconds < 0 else datetime.datetime.max
        return end.replace(tzinfo=datetime.timezone.utc)


def value_of_c(value: int) -> Value:
    """A copy of a value that the library owns."""
    kind = lib.value_type(value)
    if kind == BOOLEAN:
        return bool(lib.value_get_boolean(value))
    if kind == INTEGER:
        return lib.value_get_integer(value)
    if kind == UNSIGNED:
        return lib.value_get_unsigned(value)
    if kind == REAL:
        return lib.value_get_real(value)
    if kind == STRING:
        return decoded(lib.value_get_string(value))
    if kind == DATA:
        size = c_size_t()
        return ctypes.string_at(lib.value_get_data(value, size), size.value)
    if kind == DATE:
        return _date(lib.value_get_real(value))
    if kind == LIST:
        return [value_of_c(lib.value_at(value, index)) for index in range(lib.value_count(value))]
    entries: Dict[str, Value] = {}
    key = lib.value_next_key(value, None)
    while key is not None:
        entries[decoded(key)] = value_of_c(lib.value_get(value, key))
        key = lib.value_next_key(value, key)
    return entries
