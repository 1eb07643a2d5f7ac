"""What can be set while the server runs."""

from __future__ import annotations

from dataclasses import dataclass
from typing import Any


@dataclass
class Settings:
    """The field names are those of the control endpoint; what replies carry is spelled as on the wire."""

    dsSessionValidityDuration: int | float | str | None = 300
    Version: int = 101
    SuggestValidDuration: int = 2592000
    record: bool = True

    def apply(self, changes: Any) -> None:
        """Sets the given values: all, or (ValueError) none. A null validity is left out of replies."""
        if not isinstance(changes, dict):
            raise ValueError("settings are an object")
        for name, value in changes.items():
            if type(value) not in KINDS.get(name, ()):
                raise ValueError(f'setting "{name}" is unknown or has a value of the wrong type')
        for name, value in changes.items():
            setattr(self, name, value)


KINDS: dict[str, tuple[type, ...]] = {
    "dsSessionValidityDuration": (int, float, str, type(None)),
    "Version": (int,),
    "SuggestValidDuration": (int,),
    "record": (bool,),
}
