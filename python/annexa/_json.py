"""The JSON mapping of Annexa values: JSON's own literals, and objects of one tagged key for what
JSON lacks ({"$uuid": ...}, {"$data": ...}, {"$date": ...}, ...), as the library writes them."""

from __future__ import annotations

import base64
import binascii
import datetime
import json
import math
import re
import uuid
from typing import Any

__all__ = ["Descriptor", "dumps", "loads", "to_json", "from_json"]

_EXACT = 2**53
_INT64 = range(-(2**63), 2**63)
_UINT64 = range(0, 2**64)
_DATE = re.compile(r"(\d{4})-(\d\d)-(\d\d)T(\d\d):(\d\d):(\d\d)(?:\.(\d+))?Z")


class Descriptor(int):
    """A file descriptor in a message: its number in the process that wrote or reads the text."""

    def __repr__(self) -> str:
        return f"Descriptor({int(self)})"


def _date_text(when: datetime.datetime) -> str:
    if when.tzinfo is None:
        raise ValueError("a date in a message needs a time zone (datetime.timezone.utc)")
    when = when.astimezone(datetime.timezone.utc)
    text = when.strftime("%Y-%m-%dT%H:%M:%S")
    if when.microsecond:
        text += f".{when.microsecond:06d}".rstrip("0")
    return text + "Z"


def _date(text: str) -> datetime.datetime:
    m = _DATE.fullmatch(text)
    if not m:
        raise ValueError(f"not a date written YYYY-MM-DDThh:mm:ss[.ffffff]Z: {text!r}")
    fraction = (m.group(7) or "").ljust(6, "0")[:6]
    year, month, day, hour, minute, second = (int(g) for g in m.groups()[:6])
    return datetime.datetime(year, month, day, hour, minute, second, int(fraction), tzinfo=datetime.timezone.utc)


def to_json(value: Any) -> Any:
    """The JSON-ready form of a Python value: tags for UUIDs, bytes, dates, descriptors, integers
    beyond 2^53 and floats that are not finite."""
    if value is None or isinstance(value, (bool, str)):
        return value
    if isinstance(value, Descriptor):
        return {"$fd": int(value)}
    if isinstance(value, int):
        if abs(value) <= _EXACT:
            return value
        if value in _INT64:
            return {"$int64": str(value)}
        if value in _UINT64:
            return {"$uint64": str(value)}
        raise ValueError(f"{value} does not fit in 64 bits")
    if isinstance(value, float):
        if math.isnan(value):
            return {"$double": "nan"}
        if math.isinf(value):
            return {"$double": "inf" if value > 0 else "-inf"}
        return value
    if isinstance(value, uuid.UUID):
        return {"$uuid": str(value).upper()}
    if isinstance(value, (bytes, bytearray, memoryview)):
        return {"$data": base64.b64encode(bytes(value)).decode("ascii")}
    if isinstance(value, datetime.datetime):
        return {"$date": _date_text(value)}
    if isinstance(value, dict):
        out = {}
        for key, element in value.items():
            if not isinstance(key, str):
                raise TypeError(f"a dictionary key must be a string, not {type(key).__name__}")
            out[key] = to_json(element)
        if len(out) == 1 and next(iter(out)).startswith("$"):
            return {"$dictionary": out}
        return out
    if isinstance(value, (list, tuple)):
        return [to_json(element) for element in value]
    raise TypeError(f"{type(value).__name__} has no form in a message")


def _tag(tag: str, body: Any) -> Any:
    if tag == "$fd":
        if type(body) is not int or body < 0:
            raise ValueError(f"a $fd object holds a descriptor number, not {body!r}")
        return Descriptor(body)
    if tag == "$dictionary":
        if not isinstance(body, dict):
            raise ValueError("a $dictionary object holds an object")
        return {key: from_json(element) for key, element in body.items()}
    if not isinstance(body, str):
        raise ValueError(f"a {tag} object holds a string, not {body!r}")
    if tag == "$uuid":
        return uuid.UUID(body)
    if tag == "$data":
        try:
            return base64.b64decode(body, validate=True)
        except binascii.Error as e:
            raise ValueError(f"a $data object holds base64: {e}") from None
    if tag == "$date":
        return _date(body)
    if tag == "$double":
        if body not in ("nan", "inf", "-inf"):
            raise ValueError(f'a $double object holds "nan", "inf" or "-inf", not {body!r}')
        return float(body)
    if tag in ("$int64", "$uint64"):
        n = int(body)
        if n not in (_INT64 if tag == "$int64" else _UINT64):
            raise ValueError(f"{body} is out of range for {tag}")
        return n
    raise ValueError(f"unknown tag {tag!r}")


def from_json(value: Any) -> Any:
    """The Python value of parsed JSON: tagged objects become UUIDs, bytes, dates, ..."""
    if isinstance(value, list):
        return [from_json(element) for element in value]
    if isinstance(value, dict):
        if len(value) == 1:
            (key, body), = value.items()
            if key.startswith("$"):
                return _tag(key, body)
        return {key: from_json(element) for key, element in value.items()}
    return value


def dumps(value: Any) -> str:
    return json.dumps(to_json(value), ensure_ascii=False, allow_nan=False, separators=(",", ":"))


def loads(text: str) -> Any:
    return from_json(json.loads(text))

