"""The plug-in's side: serve hosts from a Python plug-in that spawnd launched.

    import annexa.plugin

    def handle(message):
        return {"echo": message}

    annexa.plugin.run(handle)
"""

from __future__ import annotations

import contextlib
import sys
import traceback
from typing import Any, Callable, Iterator, Optional

from ._errors import ErrorCode, InvalidArgument
from ._library import HANDLER, NOTATION_JSON, encode, lib
from . import _json

__all__ = ["run", "begin_busy", "end_busy", "busy"]

Handler = Callable[[Any], Optional[Any]]


def _reply(handler: Handler, message: bytes) -> Any:
    try:
        answer = handler(_json.loads(message.decode("utf-8")))
    except Exception as e:  # the host gets the error; the plug-in serves on
        traceback.print_exc(file=sys.stderr)
        answer = {"error": f"{type(e).__name__}: {e}"}
    try:
        text = encode({} if answer is None else answer)
    except (TypeError, ValueError) as e:
        text = encode({"error": f"the plug-in's reply has no form in a message: {e}"})
    return lib.annexa_copy_text(text)


def run(handler: Handler) -> None:
    """Serves every host connection, each message through `handler` (a dictionary or other value
    in, the reply out; None replies {}), one at a time, until spawnd ends the instance. Raises
    InvalidArgument when this process was not launched by spawnd."""
    callback = HANDLER(lambda message, _context: _reply(handler, message))
    if lib.annexa_plugin_serve(callback, None, NOTATION_JSON) != 0:
        raise InvalidArgument(ErrorCode.INVALID_ARGUMENT, "this process was not launched by spawnd")


def begin_busy(reason: str) -> int:
    """Reports the instance busy with `reason` until end_busy(the number returned)."""
    return int(lib.annexa_plugin_begin_busy(reason.encode("utf-8")))


def end_busy(assertion: int) -> None:
    lib.annexa_plugin_end_busy(assertion)


@contextlib.contextmanager
def busy(reason: str) -> Iterator[None]:
    """Busy for the length of a with block."""
    assertion = begin_busy(reason)
    try:
        yield
    finally:
        end_busy(assertion)

