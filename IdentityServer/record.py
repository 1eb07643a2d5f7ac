"""The record of the calls that arrived, for tests to look at and to wait on."""

from __future__ import annotations

import threading
import time
from collections import Counter, deque
from dataclasses import dataclass, field
from typing import Any

from methods import ANY, PREFIX
from wire import to_json

KEPT_CALLS = 10_000
MALFORMED = "(malformed)"


@dataclass
class Call:
    """One call. `name` is the full method name, or MALFORMED with the reason in `error`. What became of it comes
    later: the injection that it has met, and whether it was answered, or left without an answer on purpose."""

    name: str
    arguments: tuple[Any, ...]
    headers: dict[str, str]
    raw: bytes
    error: str | None = None
    at: float = field(default_factory=time.time)
    injection: dict[str, Any] | None = None
    answered: bool = False

    @property
    def method(self) -> str:
        """The short name."""
        return self.name.removeprefix(PREFIX)

    def json(self) -> dict[str, Any]:
        """`parameters` is the one argument where there is exactly one, as every good call has."""
        arguments = to_json(self.arguments)
        return {"method": self.method, "parameters": arguments[0] if len(arguments) == 1 else arguments,
                "headers": self.headers, "at": self.at, "error": self.error,
                "injection": self.injection, "answered": self.answered,
                "raw": self.raw.decode("utf-8", "replace")}


class Record:
    """The newest calls, and how many came of each method since the record was last emptied."""

    def __init__(self) -> None:
        self._changed = threading.Condition()
        self._calls: deque[Call] = deque(maxlen=KEPT_CALLS)
        self._counts: Counter[str] = Counter()

    def add(self, call: Call, keep: bool) -> None:
        """Counts the call, and keeps it unless told not to."""
        with self._changed:
            if keep:
                self._calls.append(call)
            self._counts.update((call.method, ANY))
            self._changed.notify_all()

    def received(self) -> list[Call]:
        with self._changed:
            return list(self._calls)

    def counts(self) -> dict[str, int]:
        """Count by method; the sum stands under ANY."""
        with self._changed:
            return dict(self._counts)

    def clear(self) -> None:
        with self._changed:
            self._calls.clear()
            self._counts.clear()

    def wait(self, method: str, count: int, timeout: float) -> int:
        """Blocks until `count` calls of the method (or ANY) came, or `timeout` seconds; returns how many."""
        with self._changed:
            self._changed.wait_for(lambda: self._counts[method] >= count, timeout)
            return self._counts[method]
