"""Hosts and installers: the Client that talks to axd, the plug-ins it finds, their connections."""

from __future__ import annotations

import ctypes
import dataclasses
import enum
import uuid as uuidlib
from types import TracebackType
from typing import Any, Iterable, Iterator, Optional, TypeVar, Union

from . import _json, _library
from ._errors import ErrorCode, Unreachable
from ._library import call, encode, lib, texts

__all__ = ["MatchFlag", "PlugIn", "Connection", "Hold", "Watch", "Client"]


class MatchFlag(enum.IntFlag):
    """Options of a match (docs/discovery.md)."""

    NONE = 0
    ALL_VERSIONS = 0x1
    DUPLICATES = 0x4
    SYSTEM_ONLY = 0x8
    ALL = 0x200
    EXPLAIN = 0x10000


@dataclasses.dataclass(frozen=True)
class PlugIn:
    """A plug-in as a match returned it; `form` is everything the daemon said about it."""

    uuid: uuidlib.UUID
    identifier: str
    version: str
    path: str
    bundle_identifier: str
    attributes: dict[str, Any]
    annotations: dict[str, Any]
    form: dict[str, Any] = dataclasses.field(repr=False, compare=False)

    @classmethod
    def from_form(cls, form: dict[str, Any]) -> "PlugIn":
        raw = form.get("uuid")
        plugin_uuid = raw if isinstance(raw, uuidlib.UUID) else uuidlib.UUID(str(raw))
        info = form.get("info") or {}
        bundle = form.get("bundleInfo") or {}
        return cls(
            uuid=plugin_uuid,
            identifier=str(form.get("identifier", "")),
            version=str(form.get("version", "")),
            path=str(form.get("path", "")),
            bundle_identifier=str(bundle.get("KFBundleIdentifier", form.get("identifier", ""))),
            attributes=dict(info.get("KSExtensionAttributes") or {}),
            annotations=dict(form.get("annotations") or {}),
            form=form,
        )

    def connect(self) -> "Connection":
        """A connection to a running instance; the plug-in must have been got ready first
        (Client.ready)."""
        return Connection(self.bundle_identifier)


PlugInRef = Union[PlugIn, uuidlib.UUID, str]
_Self = TypeVar("_Self", bound="_Owned")


def _uuid_texts(plugins: Iterable[PlugInRef]) -> Any:
    items = []
    for p in plugins:
        items.append(str(p.uuid if isinstance(p, PlugIn) else p).upper())
    return texts(items), len(items)


class _Owned:
    """Owns one handle of the library: released by close(), at the end of a with block, or when
    the object goes."""

    _handle: Optional[int] = None

    def _release(self, handle: int) -> None:
        raise NotImplementedError

    def close(self) -> None:
        if self._handle is not None:
            handle, self._handle = self._handle, None
            self._release(handle)

    def __enter__(self: _Self) -> _Self:
        return self

    def __exit__(self, kind: Optional[type[BaseException]], value: Optional[BaseException], tb: Optional[TracebackType]) -> None:
        self.close()

    def __del__(self) -> None:
        self.close()


class Connection(_Owned):
    """A host's connection to a running plug-in: send() a dictionary, get its reply."""

    def __init__(self, bundle_identifier: str) -> None:
        error = ctypes.c_void_p()
        handle = lib.annexa_plugin_connect(bundle_identifier.encode("utf-8"), ctypes.byref(error))
        if not handle:
            _library.check(ErrorCode.UNREACHABLE, error)
        self._handle = handle
        lib.annexa_plugin_set_notation(handle, _library.NOTATION_JSON)

    def send(self, message: Any) -> Any:
        if self._handle is None:
            raise Unreachable(ErrorCode.UNREACHABLE, "the connection is closed")
        (reply,) = call(lib.annexa_plugin_send, self._handle, encode(message), outputs=1)
        return reply

    def _release(self, handle: int) -> None:
        lib.annexa_plugin_close(handle)


class Hold:
    """A hold on plug-ins, released by release() or at the end of a with block."""

    def __init__(self, client: "Client", token: uuidlib.UUID) -> None:
        self._client = client
        self.token = token
        self._held = True

    def release(self) -> None:
        if self._held:
            self._held = False
            self._client.unlock(self.token)

    def __enter__(self) -> "Hold":
        return self

    def __exit__(self, kind: Optional[type[BaseException]], value: Optional[BaseException], tb: Optional[TracebackType]) -> None:
        self.release()


class Watch(_Owned):
    """The registry's events as they happen: installs, uninstalls, annotations and holds. Iterate
    over it, or call next(timeout) and poll fileno() in an event loop of your own."""

    def __init__(self, client_handle: int) -> None:
        error = ctypes.c_void_p()
        handle = lib.annexa_watch_start(client_handle, ctypes.byref(error))
        if not handle:
            _library.check(ErrorCode.UNREACHABLE, error)
        self._handle = handle

    def fileno(self) -> int:
        """Readable while an event waits."""
        return int(lib.annexa_watch_fd(self._handle)) if self._handle is not None else -1

    def next(self, timeout: Optional[float] = None) -> Optional[dict[str, Any]]:
        """The next event; None when none came within `timeout` seconds. Raises Unreachable once
        the daemon ended the watch."""
        if self._handle is None:
            raise Unreachable(ErrorCode.UNREACHABLE, "the watch is closed")
        milliseconds = -1 if timeout is None else max(0, int(timeout * 1000))
        event = ctypes.c_void_p()
        error = ctypes.c_void_p()
        code = lib.annexa_watch_next(self._handle, milliseconds, ctypes.byref(event), ctypes.byref(error))
        if code == _library.TIMED_OUT:
            _library.take_text(error)
            return None
        text = _library.take_text(event)
        _library.check(code, error)
        return _json.loads(text) if text is not None else None

    def __iter__(self) -> Iterator[dict[str, Any]]:
        while True:
            event = self.next()
            if event is not None:
                yield event

    def _release(self, handle: int) -> None:
        lib.annexa_watch_stop(handle)


class Client(_Owned):
    """A connection to axd. Every call waits for the daemon's reply and raises annexa.Error (or a
    subclass) when it reports one."""

    def __init__(self, service_name: Optional[str] = None) -> None:
        handle = lib.annexa_client_create(service_name.encode("utf-8") if service_name else None)
        if not handle:
            raise MemoryError("annexa_client_create")
        self._handle = handle
        lib.annexa_client_set_notation(handle, _library.NOTATION_JSON)

    @property
    def _h(self) -> int:
        if self._handle is None:
            raise Unreachable(ErrorCode.UNREACHABLE, "the client is closed")
        return self._handle

    def send(self, message: dict[str, Any]) -> Any:
        """Any request, as written ({"request": "bulk", "version": 3}); the reply, whatever it says."""
        (reply,) = call(lib.annexa_send, self._h, encode(message), outputs=1)
        return reply

    def match(self, rules: Optional[dict[str, Any]] = None, *, flags: int = MatchFlag.NONE) -> list[PlugIn]:
        """The plug-ins that fit the rules (all of them without rules)."""
        (forms,) = call(lib.annexa_match, self._h, encode(rules) if rules is not None else None, int(flags), outputs=1)
        return [PlugIn.from_form(form) for form in forms or []]

    def annotate(self, plugins: Iterable[PlugInRef], *, election: Optional[int] = None,
                 extension: Optional[dict[str, Any]] = None) -> None:
        """Records the user's choices: the election, and/or the extension dictionary."""
        annotations: dict[str, Any] = {}
        if election is not None:
            annotations["election"] = int(election)
        if extension is not None:
            annotations["extension"] = extension
        array, count = _uuid_texts(plugins)
        call(lib.annexa_annotate, self._h, array, count, encode(annotations))

    def ready(self, plugins: Iterable[PlugInRef]) -> None:
        """Gets plug-ins ready for this process: all of them, or none."""
        array, count = _uuid_texts(plugins)
        call(lib.annexa_ready, self._h, array, count)

    def access(self, plugins: Iterable[PlugInRef]) -> list[str]:
        """Read tokens for the plug-ins' bundles."""
        array, count = _uuid_texts(plugins)
        (tokens,) = call(lib.annexa_access, self._h, array, count, outputs=1)
        return list(tokens or [])

    def lock(self, paths: Iterable[str], *, plugins: bool = False) -> Hold:
        """Holds the plug-ins of applications (or, with plugins=True, plug-in bundles themselves)
        until the Hold is released; use it in a with block."""
        items = list(paths)
        slot = ctypes.c_void_p()
        error = ctypes.c_void_p()
        code = lib.annexa_lock(self._h, texts(items), len(items), 2 if plugins else 1, ctypes.byref(slot), ctypes.byref(error))
        token = _library.take_text(slot)
        _library.check(code, error)
        return Hold(self, uuidlib.UUID(token))

    def unlock(self, token: Union[uuidlib.UUID, str]) -> None:
        call(lib.annexa_unlock, self._h, str(token).upper().encode("utf-8"))

    def add(self, paths: Iterable[str]) -> None:
        """Registers bundles (absolute paths)."""
        items = list(paths)
        call(lib.annexa_add, self._h, texts(items), len(items))

    def remove(self, paths: Iterable[str]) -> None:
        """Unregisters bundles; needs the manager entitlement."""
        items = list(paths)
        call(lib.annexa_remove, self._h, texts(items), len(items))

    def watch(self) -> Watch:
        return Watch(self._h)

    def _release(self, handle: int) -> None:
        lib.annexa_client_destroy(handle)
