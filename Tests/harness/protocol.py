"""The agent's names and numbers, read from the headers that the agent itself is built with."""

from __future__ import annotations

import pathlib
import re

_ROOM = pathlib.Path(__file__).resolve().parents[2] / "VeltoIDAuthentication" / "Protocol"


def _constants(header: str, value: str) -> dict[str, str]:
    return dict(re.findall(rf"inline constexpr [\w:\* ]*?\b(k\w+) =\s*{value};", (_ROOM / header).read_text()))


_NAMES = _constants("Names.h", r'"([^"]*)"')

# SET_VALUE for kSetValue.
globals().update({re.sub(r"(?<=[a-z])(?=[A-Z])", "_", name[1:]).upper(): int(number, 0)
                  for name, number in _constants("Commands.h", r"(0x[0-9A-Fa-f]+|\d+)").items()})
SERVICE = _NAMES["kVeltoIDAuthenticationServiceName"]
PASSWORD_SERVICE = _NAMES["kVeltoIDPasswordCheckServiceName"]
OBJECT = _NAMES["kVeltoIDObjectPath"]
INTERFACE = _NAMES["kVeltoIDMessageInterface"]
UNIT = _NAMES["kVeltoIDServiceUnit"]
TIMER = _NAMES["kVeltoIDRelaunchTimerUnit"]
