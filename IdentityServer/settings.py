"""What can be set while the server runs."""

from __future__ import annotations

import math
from dataclasses import dataclass, fields
from typing import Any, Callable


@dataclass
class Settings:
    """The field names are those of the control endpoint; what replies carry is spelled as on the wire."""

    dsSessionValidityDuration: int | float | str | None = 300
    Version: int = 101
    SuggestValidDuration: int = 2592000
    record: bool = True
    issuance: str = "at-once"
    issuanceDelay: int | float | None = 0
    pendingPolls: int = 0
    pendingAnswer: str = "fault"
    unknownCertStatus: str = "UNDER_REVIEW"
    dsCertAsArray: bool = False
    expiresAsText: bool = False
    certificateLifetime: int | float | None = None
    wrongIntermediate: bool = False
    wrongKey: bool = False
    findPersonValidInterval: int | float | None = None
    validationRecordFormat: str = "xml"
    validationRecordTampering: str | None = None
    validAsOfAsText: bool = False

    def apply(self, changes: Any) -> None:
        """Sets the given values: all, or (ValueError) none."""
        if not isinstance(changes, dict):
            raise ValueError("settings are an object")
        for name, value in changes.items():
            if name not in CHECKS or not CHECKS[name](value):
                raise ValueError(f'setting "{name}" is unknown or cannot have this value')
        for name, value in changes.items():
            setattr(self, name, value)

    def reset(self) -> None:
        for field in fields(self):
            setattr(self, field.name, field.default)


def _one_of(*choices: str | None) -> Callable[[Any], bool]:
    return lambda value: value in choices


def _is_flag(value: Any) -> bool:
    return type(value) is bool


def _is_text(value: Any) -> bool:
    return type(value) is str


def _is_integer(value: Any) -> bool:
    """One that a reply can carry."""
    return type(value) is int and -2**31 <= value < 2**31


def _is_number(value: Any) -> bool:
    return _is_integer(value) or type(value) is float and math.isfinite(value)


def _or_null(check: Callable[[Any], bool]) -> Callable[[Any], bool]:
    return lambda value: value is None or check(value)


CHECKS: dict[str, Callable[[Any], bool]] = {
    "dsSessionValidityDuration": _or_null(lambda value: _is_number(value) or _is_text(value)),
    "Version": _is_integer,
    "SuggestValidDuration": _is_integer,
    "record": _is_flag,
    "issuance": _one_of("at-once", "token", "refuse", "token-refuse", "never", "unknown"),
    "issuanceDelay": _or_null(_is_number),
    "pendingPolls": lambda value: _is_integer(value) and value >= 0,
    "pendingAnswer": _one_of("fault", "dsCert"),
    "unknownCertStatus": _is_text,
    "dsCertAsArray": _is_flag,
    "expiresAsText": _is_flag,
    "certificateLifetime": _or_null(_is_number),
    "wrongIntermediate": _is_flag,
    "wrongKey": _is_flag,
    "findPersonValidInterval": _or_null(_is_number),
    "validationRecordFormat": _one_of("xml", "binary", "array", "text"),
    "validationRecordTampering": _one_of(None, "content", "signature", "detached"),
    "validAsOfAsText": _is_flag,
}
