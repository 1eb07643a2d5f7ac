"""What the remote methods share: faults, and reading of parameters."""

from __future__ import annotations

from typing import Any
from xmlrpc.client import Fault

FAULT_OTHER = -1
FAULT_PENDING = -4164
FAULT_WRONG_PASSWORD = -20101
FAULT_DISABLED = -20209

Struct = dict[str, Any]


def text(parameters: Struct, key: str) -> str:
    """The text under this key, empty when there is none."""
    value = parameters.get(key)
    return value if isinstance(value, str) else ""


def needed_text(parameters: Struct, key: str) -> str:
    """The text under this key; a fault when it is missing or empty."""
    value = text(parameters, key)
    if not value:
        raise refusal(f'the parameter "{key}" is missing or no text')
    return value


def refusal(reason: str) -> Fault:
    """The fault, for raising, of a call that makes no sense."""
    return Fault(FAULT_OTHER, reason)
