"""The queue of injections: what the next calls are to be answered instead of, or around, the normal reply.

Everything that can be refused is refused when an injection is queued, and documents are encoded then, so
that a call that meets an injection cannot fail because of it.
"""

from __future__ import annotations

import base64
import threading
from dataclasses import dataclass, field
from typing import Any, Collection

from methods import ANY
from wire import encode_fault, encode_reply, from_json

CLOSE_POINTS = ("before", "headers", "middle")
OUTCOMES = ("fault", "status", "body", "bodyBase64", "size", "close", "set")
KEYS = ("method", "times", "delay", *OUTCOMES)
LARGEST_REPLY = 256 * 1024 * 1024
LONGEST_DELAY = 600


@dataclass(frozen=True)
class Answer:
    """A finished HTTP answer that replaces the running of the method."""

    status: int
    body: bytes


@dataclass
class Injection:
    """At most one of answer, size, close_at and changes is set; a delay goes with any of them."""

    method: str
    times: int
    delay: float = 0
    answer: Answer | None = None
    size: int | None = None
    close_at: str | None = None
    changes: dict[str, Any] = field(default_factory=dict)
    # As it was queued.
    request: dict[str, Any] | None = None


class Injections:
    """First in, first used; an injection is used up after its number of times."""

    def __init__(self, methods: Collection[str]) -> None:
        self._methods = methods
        self._lock = threading.Lock()
        self._queue: list[Injection] = []

    def add(self, requests: Any) -> int:
        """Queues one JSON object or a list of them: all, or (ValueError) none. Returns how many wait now."""
        requests = requests if isinstance(requests, list) else [requests]
        fresh = [self._parse(request) for request in requests]
        with self._lock:
            self._queue += fresh
            return len(self._queue)

    def take(self, method: str) -> Injection | None:
        """The injection for a call of this method that arrived just now."""
        with self._lock:
            for injection in self._queue:
                if injection.method in (ANY, method):
                    injection.times -= 1
                    if injection.times == 0:
                        self._queue.remove(injection)
                    return injection
        return None

    def pending(self) -> list[dict[str, Any]]:
        with self._lock:
            return [{"method": injection.method, "times": injection.times} for injection in self._queue]

    def clear(self) -> None:
        with self._lock:
            self._queue.clear()

    def _parse(self, request: Any) -> Injection:
        if not isinstance(request, dict) or not request.keys() <= set(KEYS):
            raise ValueError(f"an injection is an object with keys of {', '.join(KEYS)}")
        method = request.get("method", ANY)
        if method != ANY and method not in self._methods:
            raise ValueError(f"unknown method {method!r}")
        outcomes = {key for key in OUTCOMES if key in request}
        if len(outcomes - {"status"} if outcomes & {"body", "bodyBase64"} else outcomes) > 1:
            raise ValueError("an injection has one outcome; only a status may come with a body")
        if not outcomes and "delay" not in request:
            raise ValueError("an injection needs an outcome or a delay")
        injection = Injection(method, int(_number(request, "times", 1, 1, 2**31)),
                              _number(request, "delay", 0, 0, LONGEST_DELAY), _answer(request), request=request)
        if "size" in request:
            injection.size = int(_number(request, "size", 0, 1, LARGEST_REPLY))
        if "close" in request:
            injection.close_at = _close_point(request["close"])
        if "set" in request:
            injection.changes = _changes(request["set"])
        return injection


def merge(reply: dict[str, Any], changes: dict[str, Any]) -> dict[str, Any]:
    """The reply with changed fields; None takes a field away."""
    return {key: value for key, value in (reply | changes).items() if value is not None}


def pad(reply: dict[str, Any], size: int) -> bytes:
    """The reply's document, grown by one member to exactly `size` bytes where that is possible."""
    missing = size - len(encode_reply(reply | {"Padding": ""}))
    return encode_reply(reply | {"Padding": "x" * missing} if missing >= 0 else reply)


def _answer(request: dict[str, Any]) -> Answer | None:
    if "fault" in request:
        return Answer(200, _fault(request["fault"]))
    if "status" in request or "body" in request or "bodyBase64" in request:
        return Answer(int(_number(request, "status", 200, 200, 599)), _body(request))
    return None


def _fault(fault: Any) -> bytes:
    if not isinstance(fault, dict) or not fault.keys() <= {"code", "string"}:
        raise ValueError('a fault is an object with a "code" and a "string"')
    text = fault.get("string", "injected fault")
    if not isinstance(text, str):
        raise ValueError("a fault's string is a text")
    return encode_fault(int(_number(fault, "code", None, -2**31, 2**31 - 1)), text)


def _body(request: dict[str, Any]) -> bytes:
    text = request.get("bodyBase64", request.get("body", ""))
    if not isinstance(text, str):
        raise ValueError("a body is a text")
    return base64.b64decode(text, validate=True) if "bodyBase64" in request else text.encode()


def _changes(changes: Any) -> dict[str, Any]:
    if not isinstance(changes, dict):
        raise ValueError("set is an object of reply fields")
    try:
        decoded = from_json(changes)
        encode_reply(merge({}, decoded))
    except (TypeError, OverflowError, AttributeError) as error:
        # Such as an integer beyond 32 bits or a null inside: the XML-RPC module cannot write it.
        raise ValueError(f"cannot be sent: {error}") from error
    return decoded


def _close_point(point: Any) -> str:
    if point not in CLOSE_POINTS:
        raise ValueError(f"close is one of {', '.join(CLOSE_POINTS)}")
    return point


def _number(request: dict[str, Any], key: str, default: float | None, low: float, high: float) -> float:
    value = request.get(key, default)
    if isinstance(value, bool) or not isinstance(value, (int, float)) or not low <= value <= high:
        raise ValueError(f"{key} is a number from {low} to {high}")
    return value
