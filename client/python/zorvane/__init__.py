# SPDX-License-Identifier: Apache-2.0
"""The client of zorvaned, the container manager.

    import zorvane

    with zorvane.Client() as client:
        notes = client.create(zorvane.DATA_APPLICATION, "org.example.notes")
        print(notes.path)

Failures are exceptions: NotFound, Refused, Unreachable, TimedOut, and Error for all else, which is the base of those.
A Client is used by one thread at a time; its calls release the interpreter's lock. AsyncClient is for asyncio. Values are
bool, int, float, str, bytes, datetime with a time zone, list, and dict with keys of str.
"""

import asyncio
import ctypes
import dataclasses
import uuid as _uuid
from typing import Any, Callable, Dict, Generic, Iterator, List, Optional, Sequence, Tuple, Type, TypeVar

from . import _library
from ._library import CAddress, CError, Value, decoded, encoded, lib, value_of_c, value_to_c

__all__ = ["AsyncClient", "Client", "Container", "Error", "Metadata", "NotFound", "Refused", "Request", "TimedOut",
           "Unreachable", "Value", "class_by_name", "class_name", "default_user", "requests", "version"]

(BUNDLE_APPLICATION, DATA_APPLICATION, BUNDLE_KOLVEX_PLUGIN, DATA_KOLVEX_PLUGIN, BUNDLE_VPN_PLUGIN, DATA_VPN_PLUGIN,
 SHARED_APP_GROUP, BUNDLE_FRAMEWORK, DATA_IPSI_SERVICE, DATA_INTERNAL_DAEMON, DATA_TEMP_DIR, DATA_SYSTEM,
 SHARED_SYSTEM_GROUP) = range(1, 14)
#: In place of a user's number: the current mobile user.
CURRENT_USER = 1
_CREATE, _TRANSIENT, _PLACEHOLDER, _THIRD_PARTY, _RETRY_IF_LOCKED = 1, 2, 4, 8, 16

T = TypeVar("T")


class Error(Exception):
    """code is the daemon's, or 0; advice, which may be empty, says what to do."""

    def __init__(self, message: str, code: int = 0, advice: str = "") -> None:
        super().__init__(message)
        self.code = code
        self.advice = advice


class NotFound(Error):
    """There is no such container or info key."""


class Refused(Error):
    """The daemon does not know this program, or does not do this for it."""


class Unreachable(Error):
    """The daemon cannot be reached, or ended while the call waited: what was to change may have been done or not."""


class TimedOut(Error):
    """The command may still be carried out."""


_kinds: Dict[int, Type[Error]] = {_library.NOT_FOUND: NotFound, _library.REFUSED: Refused,
                                  _library.UNREACHABLE: Unreachable, _library.TIMED_OUT: TimedOut}


def _error(error: CError) -> Error:
    return _kinds.get(error.kind, Error)(error.message.decode(), error.code, error.advice.decode())


@dataclasses.dataclass(frozen=True)
class Container:
    container_class: int
    user: int
    identifier: str
    uuid: _uuid.UUID
    #: Empty for one of a list.
    path: str = ""
    #: It was there before the call.
    existed: bool = True


@dataclasses.dataclass(frozen=True)
class Metadata:
    path: str
    transient: bool
    info: Dict[str, Value]


@dataclasses.dataclass(frozen=True)
class Request(Generic[T]):
    """One command: make gives the library's request, read takes the answer out of the library's result."""
    make: Callable[[], Optional[int]]
    read: Callable[[int], T]


def _address(container: Container) -> CAddress:
    return CAddress(container.container_class, container.user, encoded(container.identifier),
                    (ctypes.c_uint8 * 16)(*container.uuid.bytes))


def _uuid_at(place: Optional[int]) -> _uuid.UUID:
    return _uuid.UUID(bytes=ctypes.string_at(place, 16)) if place else _uuid.UUID(int=0)


def _nothing(result: int) -> None:
    return None


def _path(result: int) -> str:
    return decoded(lib.result_path(result))


def _value(result: int) -> Value:
    return value_of_c(lib.result_value(result))


def _entries(result: int) -> List[str]:
    return [decoded(lib.result_identifier_at(result, index)) for index in range(lib.result_count(result))]


def _paths(result: int) -> Dict[str, str]:
    return {identifier: decoded(lib.result_path_at(result, index)) for index, identifier in enumerate(_entries(result))}


def _with_value(value: Optional[Value], make: Callable[[Optional[int]], Optional[int]]) -> Optional[int]:
    made = None if value is None else value_to_c(value)
    try:
        return make(made)
    finally:
        lib.value_free(made)


class requests:
    """Every command as a Request, for Client.call and AsyncClient.call. An identifier of None is the caller's own."""

    @staticmethod
    def find(container_class: int, identifier: Optional[str] = None, user: int = CURRENT_USER, *,
             transient: bool = False, create: bool = False) -> "Request[Container]":
        flags = (_CREATE if create else 0) | (_TRANSIENT if transient else 0)
        return Request(lambda: lib.request_lookup(container_class, user, encoded(identifier), flags),
                       lambda result: Container(container_class, user, decoded(lib.result_identifier(result)),
                                                _uuid_at(lib.result_uuid(result)), _path(result),
                                                bool(lib.result_existed(result))))

    @staticmethod
    def page(container_class: int, user: int = CURRENT_USER, *, transient: bool = False,
             after: Optional[str] = None) -> "Request[Tuple[List[Container], Optional[str]]]":
        """A part of the list in the order of identifiers, and what to ask for after it: None at the end."""
        def read(result: int) -> Tuple[List[Container], Optional[str]]:
            following = lib.result_next_page(result)
            return [Container(container_class, user, identifier, _uuid_at(lib.result_uuid_at(result, index)))
                    for index, identifier in enumerate(_entries(result))], following and decoded(following)
        flags = _TRANSIENT if transient else 0
        return Request(lambda: lib.request_list_page(container_class, user, flags, encoded(after)), read)

    @staticmethod
    def delete(container_class: int, identifier: str, user: int = CURRENT_USER, *,
               transient: bool = False) -> "Request[None]":
        flags = _TRANSIENT if transient else 0
        return Request(lambda: lib.request_delete(container_class, user, encoded(identifier), flags), _nothing)

    @staticmethod
    def stage_for_delete(containers: Sequence[Container]) -> "Request[None]":
        addresses = (CAddress * len(containers))(*map(_address, containers))
        return Request(lambda: lib.request_stage_for_delete(addresses, len(addresses)), _nothing)

    @staticmethod
    def empty_death_row() -> "Request[None]":
        return Request(lib.request_empty_death_row, _nothing)

    @staticmethod
    def replace(old: Optional[Container], fresh: Container) -> "Request[None]":
        """Without an old one, the fresh one, a transient container, becomes the live one of its identifier."""
        return Request(lambda: lib.request_replace(old and _address(old), _address(fresh)), _nothing)

    @staticmethod
    def wipe(container: Container) -> "Request[None]":
        return Request(lambda: lib.request_wipe(container.container_class, container.user,
                                                encoded(container.identifier)), _nothing)

    @staticmethod
    def wipe_plugin_data(identifier: str, user: int = CURRENT_USER) -> "Request[None]":
        return Request(lambda: lib.request_wipe_plugin_data(user, encoded(identifier)), _nothing)

    @staticmethod
    def metadata(container: Container) -> "Request[Metadata]":
        return Request(lambda: lib.request_metadata(_address(container)),
                       lambda result: Metadata(_path(result), bool(lib.result_transient(result)),
                                               _value(result)))  # type: ignore[arg-type]

    @staticmethod
    def info(container: Container, key: str) -> "Request[Value]":
        return Request(lambda: lib.request_info(_address(container), encoded(key)), _value)

    @staticmethod
    def set_info(container: Container, key: str, value: Optional[Value]) -> "Request[None]":
        """None removes the key."""
        return Request(lambda: _with_value(value, lambda made: lib.request_set_info(_address(container), encoded(key),
                                                                                    made)), _nothing)

    @staticmethod
    def disk_usage(container: Container) -> "Request[int]":
        return Request(lambda: lib.request_disk_usage(_address(container)), lib.result_bytes)

    @staticmethod
    def recreate_structure(container: Container) -> "Request[None]":
        return Request(lambda: lib.request_recreate_structure(_address(container)), _nothing)

    @staticmethod
    def regenerate_directory(container: Container) -> "Request[None]":
        return Request(lambda: lib.request_regenerate_directory(_address(container)), _nothing)

    @staticmethod
    def set_protection(container: Container, protection_class: int, *, third_party: bool = False,
                       retry_if_locked: bool = False) -> "Request[None]":
        flags = (_THIRD_PARTY if third_party else 0) | (_RETRY_IF_LOCKED if retry_if_locked else 0)
        return Request(lambda: lib.request_set_protection(container.container_class, container.user,
                                                          encoded(container.identifier), protection_class, flags),
                       _nothing)

    @staticmethod
    def group_paths(identifier: Optional[str] = None, user: int = CURRENT_USER) -> "Request[Dict[str, str]]":
        return Request(lambda: lib.request_group_paths(user, encoded(identifier)), _paths)

    @staticmethod
    def group_identifiers(identifier: Optional[str] = None, user: int = CURRENT_USER) -> "Request[List[str]]":
        return Request(lambda: lib.request_group_identifiers(user, encoded(identifier)), _entries)

    @staticmethod
    def system_path(identifier: Optional[str] = None) -> "Request[str]":
        return Request(lambda: lib.request_system_path(encoded(identifier)), _path)

    @staticmethod
    def system_group_paths(identifier: Optional[str] = None) -> "Request[Dict[str, str]]":
        return Request(lambda: lib.request_system_group_paths(encoded(identifier)), _paths)

    @staticmethod
    def system_group_path(group: str, identifier: Optional[str] = None) -> "Request[str]":
        return Request(lambda: lib.request_system_group_path(encoded(group), encoded(identifier)), _path)

    @staticmethod
    def register(identifier: str, entitlements: Optional[Dict[str, Value]], *, parent: Optional[str] = None,
                 placeholder: bool = False) -> "Request[None]":
        """Without entitlements what is registered goes, with the containers that go with it."""
        flags = _PLACEHOLDER if placeholder else 0
        return Request(lambda: _with_value(entitlements, lambda made: lib.request_register(
            encoded(identifier), made, encoded(parent), flags)), _nothing)

    @staticmethod
    def status() -> "Request[Dict[str, Value]]":
        return Request(lib.request_status, _value)  # type: ignore[arg-type]

    @staticmethod
    def retry_test(crashes: int, user: int = CURRENT_USER) -> "Request[None]":
        return Request(lambda: lib.request_retry_test(user, crashes), _nothing)


def _milliseconds(timeout: Optional[float]) -> int:
    return -1 if timeout is None else max(1, round(timeout * 1000)) if timeout > 0 else 0


class Client:
    """A connection to the daemon of a root, which the next call makes anew after it has failed. timeout is in seconds, for
    connecting and for each call: None is the library's (a minute; for ever for what walks files), 0 for ever."""

    def __init__(self, root: str = "/", timeout: Optional[float] = None) -> None:
        error = CError()
        self._client: Optional[int] = lib.connect(encoded(root), _milliseconds(timeout), error)
        if not self._client:
            raise _error(error)

    def close(self) -> None:
        client, self._client = self._client, None
        lib.client_free(client)

    def __enter__(self) -> "Client":
        return self

    def __exit__(self, *exception: Any) -> None:
        self.close()

    def __del__(self) -> None:
        if getattr(self, "_client", None):
            self.close()

    def call(self, request: "Request[T]") -> T:
        """Any command of requests; the methods below are the short forms."""
        if not self._client:
            raise ValueError("the client is closed")
        error, result = CError(), ctypes.c_void_p()
        if lib.call(self._client, request.make(), result, error) != _library.OK:
            raise _error(error)
        try:
            return request.read(result.value or 0)
        finally:
            lib.result_free(result)

    def find(self, container_class: int, identifier: Optional[str] = None, user: int = CURRENT_USER, *,
             transient: bool = False) -> Optional[Container]:
        """None where there is no such container."""
        try:
            return self.call(requests.find(container_class, identifier, user, transient=transient))
        except NotFound:
            return None

    def create(self, container_class: int, identifier: Optional[str] = None, user: int = CURRENT_USER, *,
               transient: bool = False) -> Container:
        """The container, made where there is none."""
        return self.call(requests.find(container_class, identifier, user, transient=transient, create=True))

    def list(self, container_class: int, user: int = CURRENT_USER, *, transient: bool = False) -> Iterator[Container]:
        """In the order of identifiers; asked for in pages."""
        after: Optional[str] = ""
        while after is not None:
            containers, after = self.call(requests.page(container_class, user, transient=transient, after=after))
            yield from containers

    def delete(self, container_class: int, identifier: str, user: int = CURRENT_USER, *,
               transient: bool = False) -> None:
        self.call(requests.delete(container_class, identifier, user, transient=transient))

    def info(self, container: Container, key: str) -> Optional[Value]:
        """None where there is no such key."""
        try:
            return self.call(requests.info(container, key))
        except NotFound as error:
            if error.code == 24:
                return None
            raise

    def set_info(self, container: Container, key: str, value: Optional[Value]) -> None:
        self.call(requests.set_info(container, key, value))

    def metadata(self, container: Container) -> Metadata:
        return self.call(requests.metadata(container))

    def disk_usage(self, container: Container) -> int:
        return self.call(requests.disk_usage(container))

    def wipe(self, container: Container) -> None:
        self.call(requests.wipe(container))

    def replace(self, old: Optional[Container], fresh: Container) -> None:
        self.call(requests.replace(old, fresh))

    def group_paths(self, identifier: Optional[str] = None, user: int = CURRENT_USER) -> Dict[str, str]:
        return self.call(requests.group_paths(identifier, user))

    def system_path(self, identifier: Optional[str] = None) -> str:
        return self.call(requests.system_path(identifier))

    def register(self, identifier: str, entitlements: Optional[Dict[str, Value]], *, parent: Optional[str] = None,
                 placeholder: bool = False) -> None:
        self.call(requests.register(identifier, entitlements, parent=parent, placeholder=placeholder))

    def status(self) -> Dict[str, Value]:
        return self.call(requests.status())


class AsyncClient:
    """The same for asyncio: `await client.call(zorvane.requests.find(…))`. Calls of one client are carried out one after
    the other. Used in the loop that is running when it is made."""

    def __init__(self, root: str = "/", timeout: Optional[float] = None) -> None:
        self._loop = asyncio.get_running_loop()
        self._waiting: Dict[int, Tuple["asyncio.Future[Any]", Request[Any]]] = {}
        self._started = 0
        error = CError()
        self._async: Optional[int] = lib.async_new(encoded(root), _milliseconds(timeout), error)
        if not self._async:
            raise _error(error)
        self._callback = _library.Callback(self._answered)
        self._loop.add_reader(lib.async_fd(self._async), lib.async_dispatch, self._async)

    def close(self) -> None:
        """Calls that are waited for are cancelled."""
        if self._async:
            self._loop.remove_reader(lib.async_fd(self._async))
            lib.async_free(self._async)
            self._async = None
            for future, _ in self._waiting.values():
                future.cancel()
            self._waiting.clear()

    async def __aenter__(self) -> "AsyncClient":
        return self

    async def __aexit__(self, *exception: Any) -> None:
        self.close()

    async def call(self, request: "Request[T]") -> T:
        if not self._async:
            raise ValueError("the client is closed")
        future: "asyncio.Future[T]" = self._loop.create_future()
        self._started += 1
        key = self._started
        self._waiting[key] = (future, request)
        error = CError()
        number = 0
        try:
            number = lib.async_start(self._async, request.make(), self._callback, key, error)
            if not number:
                raise _error(error)
            return await future
        except asyncio.CancelledError:
            if self._async and number:
                lib.async_cancel(self._async, number)
            raise
        finally:
            self._waiting.pop(key, None)

    def _answered(self, key: int, result: Optional[int], error: Any) -> None:
        future, request = self._waiting[key]
        try:
            if future.done():
                return
            if error:
                raise _error(error.contents)
            future.set_result(request.read(result or 0))
        except Exception as exception:  # nothing of it may reach the library
            future.set_exception(exception)
        finally:
            lib.result_free(result)


def version() -> str:
    """The library's."""
    return decoded(lib.version())


def class_by_name(name: str) -> int:
    """Number of a class by its name, the same as one types it ("data-application"), or the beginning of one name alone."""
    number = lib.class_by_name(encoded(name))
    if not number:
        raise ValueError(f"no container class has the name {name!r}")
    return number


def class_name(container_class: int) -> str:
    return decoded(lib.class_name(container_class))


def default_user(container_class: int, root: str = "/") -> int:
    """The user that owns containers of a class when nobody is named."""
    return lib.default_user(container_class, encoded(root))
