"""A table that forgets its oldest entries, since a server under load for days must not grow."""

from __future__ import annotations

import threading
from collections import OrderedDict
from typing import Generic, Hashable, TypeVar

Key = TypeVar("Key", bound=Hashable)
Entry = TypeVar("Entry")

KEPT_ENTRIES = 10_000


class Recent(Generic[Key, Entry]):
    """Usable from any thread."""

    def __init__(self) -> None:
        self._lock = threading.Lock()
        self._entries: OrderedDict[Key, Entry] = OrderedDict()

    def put(self, key: Key, entry: Entry) -> None:
        """Adds or replaces the entry, which becomes the newest."""
        with self._lock:
            self._entries[key] = entry
            self._entries.move_to_end(key)
            if len(self._entries) > KEPT_ENTRIES:
                self._entries.popitem(last=False)

    def get(self, key: Key) -> Entry | None:
        with self._lock:
            return self._entries.get(key)

    def take(self, key: Key) -> Entry | None:
        """The entry, which the table has no more."""
        with self._lock:
            return self._entries.pop(key, None)

    def all(self) -> list[Entry]:
        """Oldest first."""
        with self._lock:
            return list(self._entries.values())
