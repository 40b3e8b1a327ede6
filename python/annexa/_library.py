"""libannexa.so.1 through ctypes: the prototypes, and calls that turn the C conventions (return
codes, text out-parameters released with annexa_free) into values and exceptions."""

from __future__ import annotations

import ctypes
import os
from typing import Any, Optional, Sequence

from . import _json
from ._errors import error_for

NOTATION_JSON = 1
TIMED_OUT = -3

_p = ctypes.c_void_p
_text = ctypes.c_char_p
_out = ctypes.POINTER(ctypes.c_void_p)
_texts = ctypes.POINTER(ctypes.c_char_p)
_i64 = ctypes.c_int64
_u64 = ctypes.c_uint64
_size = ctypes.c_size_t

HANDLER = ctypes.CFUNCTYPE(ctypes.c_void_p, ctypes.c_char_p, ctypes.c_void_p)

_PROTOTYPES: dict[str, tuple[Any, list[Any]]] = {
    "annexa_client_create": (_p, [_text]),
    "annexa_client_destroy": (None, [_p]),
    "annexa_client_set_notation": (_i64, [_p, ctypes.c_int]),
    "annexa_send": (_i64, [_p, _text, _out, _out]),
    "annexa_add": (_i64, [_p, _texts, _size, _out]),
    "annexa_remove": (_i64, [_p, _texts, _size, _out]),
    "annexa_annotate": (_i64, [_p, _texts, _size, _text, _out]),
    "annexa_bulk_annotate": (_i64, [_p, _text, _out]),
    "annexa_match": (_i64, [_p, _text, _u64, _out, _out]),
    "annexa_ready": (_i64, [_p, _texts, _size, _out]),
    "annexa_access": (_i64, [_p, _texts, _size, _out, _out]),
    "annexa_lock": (_i64, [_p, _texts, _size, _u64, _out, _out]),
    "annexa_unlock": (_i64, [_p, _text, _out]),
    "annexa_watch_start": (_p, [_p, _out]),
    "annexa_watch_fd": (ctypes.c_int, [_p]),
    "annexa_watch_next": (_i64, [_p, ctypes.c_int, _out, _out]),
    "annexa_watch_stop": (None, [_p]),
    "annexa_plugin_connect": (_p, [_text, _out]),
    "annexa_plugin_set_notation": (_i64, [_p, ctypes.c_int]),
    "annexa_plugin_send": (_i64, [_p, _text, _out, _out]),
    "annexa_plugin_close": (None, [_p]),
    "annexa_plugin_serve": (_i64, [HANDLER, _p, ctypes.c_int]),
    "annexa_plugin_begin_busy": (_u64, [_text]),
    "annexa_plugin_end_busy": (None, [_u64]),
    "annexa_copy_text": (_p, [_text]),
    "annexa_free": (None, [_p]),
}


def _load() -> ctypes.CDLL:
    # ANNEXA_LIBRARY names another copy (a build tree's, or one a plug-in carries in its bundle).
    lib = ctypes.CDLL(os.environ.get("ANNEXA_LIBRARY") or "libannexa.so.1")
    for name, (restype, argtypes) in _PROTOTYPES.items():
        function = getattr(lib, name)
        function.restype = restype
        function.argtypes = argtypes
    return lib


lib = _load()


def take_text(slot: ctypes.c_void_p) -> Optional[str]:
    """The text a call left in an out-parameter, released."""
    if not slot.value:
        return None
    try:
        return ctypes.string_at(slot.value).decode("utf-8")
    finally:
        lib.annexa_free(slot.value)
        slot.value = None


def check(code: int, error: ctypes.c_void_p) -> None:
    text = take_text(error)
    if code != 0:
        raise error_for(code, text or "error")


def texts(items: Sequence[str]) -> Any:
    return (ctypes.c_char_p * len(items))(*[item.encode("utf-8") for item in items])


def call(function: Any, *arguments: Any, outputs: int = 0) -> list[Any]:
    """Calls an annexa_* function whose last parameters are `outputs` texts in JSON and the error
    text; raises the error, or returns the outputs as Python values."""
    slots = [ctypes.c_void_p() for _ in range(outputs)]
    error = ctypes.c_void_p()
    code = function(*arguments, *[ctypes.byref(s) for s in slots], ctypes.byref(error))
    values = [take_text(s) for s in slots]
    check(code, error)
    return [None if v is None else _json.loads(v) for v in values]


def encode(value: Any) -> bytes:
    return _json.dumps(value).encode("utf-8")


__all__ = ["lib", "call", "check", "texts", "encode", "take_text", "HANDLER", "NOTATION_JSON", "TIMED_OUT"]
