"""Between XML-RPC documents, Python values and JSON.

Documents are read and written by Python's own XML-RPC module, which makes this server an independent
witness of what clients write. JSON has neither dates nor bytes; they stand there as {"$date":
"20260117T01:58:42Z"} and {"$base64": "QUJD"}, in both directions.
"""

from __future__ import annotations

import base64
import datetime
import math
import re
import xmlrpc.client
from typing import Any

DATE_TEXT = re.compile(r"\d{8}T\d{2}:\d{2}:\d{2}Z?")


def decode_call(body: bytes) -> tuple[str, tuple[Any, ...]]:
    """Method name and arguments of a methodCall document; any exception means that it is not one.

    `use_builtin_types` stays off for reading: with it the module refuses dates that end in the zone letter Z.
    """
    arguments, method = xmlrpc.client.loads(body)
    if not method:
        raise ValueError("the document names no method")
    return method, tuple(_native(argument) for argument in arguments)


def encode_reply(reply: dict[str, Any]) -> bytes:
    return xmlrpc.client.dumps((reply,), methodresponse=True, allow_none=False).encode()


def encode_fault(code: int, text: str) -> bytes:
    return xmlrpc.client.dumps(xmlrpc.client.Fault(code, text), methodresponse=True).encode()


def to_json(value: Any) -> Any:
    """A decoded value in terms that JSON has."""
    if isinstance(value, dict):
        return {key: to_json(entry) for key, entry in value.items()}
    if isinstance(value, (list, tuple)):
        return [to_json(entry) for entry in value]
    if isinstance(value, datetime.datetime):
        return {"$date": value.strftime("%Y%m%dT%H:%M:%SZ")}
    if isinstance(value, bytes):
        return {"$base64": base64.b64encode(value).decode()}
    if isinstance(value, float) and not math.isfinite(value):
        return {"$double": repr(value)}
    return value


def from_json(value: Any) -> Any:
    """The opposite of `to_json`, for values to be sent; ValueError when a date or bytes are malformed."""
    if isinstance(value, list):
        return [from_json(entry) for entry in value]
    if not isinstance(value, dict):
        return value
    if value.keys() == {"$date"}:
        return _date(value["$date"])
    if value.keys() == {"$base64"}:
        return base64.b64decode(value["$base64"], validate=True)
    return {key: from_json(entry) for key, entry in value.items()}


def _native(value: Any) -> Any:
    if isinstance(value, dict):
        return {key: _native(entry) for key, entry in value.items()}
    if isinstance(value, list):
        return [_native(entry) for entry in value]
    if isinstance(value, xmlrpc.client.DateTime):
        return _date(value.value)
    if isinstance(value, xmlrpc.client.Binary):
        return value.data
    return value


def _date(text: Any) -> datetime.datetime:
    if not isinstance(text, str) or not DATE_TEXT.fullmatch(text):
        raise ValueError(f"not a date: {text!r}")
    return datetime.datetime.strptime(text.rstrip("Z"), "%Y%m%dT%H:%M:%S")
