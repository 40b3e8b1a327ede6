"""Errors of the library and of the daemon, as exceptions that carry the protocol's code."""

from __future__ import annotations

import enum

__all__ = ["ErrorCode", "Error", "InvalidArgument", "Unreachable", "Refused", "NotFound", "error_for"]


class ErrorCode(enum.IntEnum):
    """The library's own codes (negative) and the daemon's (docs/client-library.md)."""

    INVALID_ARGUMENT = -1
    UNREACHABLE = -2
    TIMED_OUT = -3
    REGISTRY_REFUSED = 2
    INVALID_REQUEST = 4
    BAD_PROTOCOL_SPEC = 6
    VERSION_MISMATCH = 7
    BAD_PATH = 9
    NOT_ENTITLED = 11
    PLUGIN_UNUSABLE = 12
    BUSY = 14
    RECEIPT_UNAVAILABLE = 15
    BAD_ANNOTATION = 18


class Error(Exception):
    """A call that failed: `code` is the protocol's error code, `text` what the daemon or the
    library said."""

    def __init__(self, code: int, text: str) -> None:
        super().__init__(f"{text} (error {code})")
        self.code = code
        self.text = text


class InvalidArgument(Error):
    """The call's arguments could not be used; nothing was sent."""


class Unreachable(Error):
    """The daemon or the plug-in cannot be reached, or the connection ended before the reply."""


class Refused(Error):
    """The daemon refused: the caller is not entitled, the registry refused, or plug-ins are busy."""


class NotFound(Error):
    """A path names no registered bundle."""


_CLASSES: dict[int, type[Error]] = {
    ErrorCode.INVALID_ARGUMENT: InvalidArgument,
    ErrorCode.UNREACHABLE: Unreachable,
    ErrorCode.REGISTRY_REFUSED: Refused,
    ErrorCode.NOT_ENTITLED: Refused,
    ErrorCode.BUSY: Refused,
    ErrorCode.RECEIPT_UNAVAILABLE: Refused,
    ErrorCode.BAD_PATH: NotFound,
}


def error_for(code: int, text: str) -> Error:
    return _CLASSES.get(code, Error)(code, text)
