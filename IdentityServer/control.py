"""The control door: JSON over plain HTTP on a second loopback port, for tests and demonstrations."""

from __future__ import annotations

import json
import os
from dataclasses import dataclass
from typing import Any, Callable

from accounts import Accounts
from certificates import IssuedCertificates
from loopback_http import LoopbackHandler, Refusal
from methods import ANY
from rpc import Service

LONGEST_WAIT = 600


@dataclass(frozen=True)
class Control:
    """The commands. Each takes the request's JSON value (or None) and returns the answer's."""

    service: Service
    accounts: Accounts
    issued: IssuedCertificates

    def commands(self) -> dict[tuple[str, str], Callable[[Any], Any]]:
        service = self.service
        return {
            ("POST", "/next"): lambda value: {"queued": service.injections.add(value)},
            ("GET", "/next"): lambda _: service.injections.pending(),
            ("DELETE", "/next"): lambda _: service.injections.clear(),
            ("GET", "/received"): lambda _: [call.json() for call in service.record.received()],
            ("DELETE", "/received"): lambda _: service.record.clear(),
            ("GET", "/counts"): lambda _: service.record.counts(),
            ("POST", "/accounts"): lambda value: {"accounts": self.accounts.apply(value)},
            ("POST", "/settings"): self._settings,
            ("DELETE", "/settings"): lambda _: service.settings.reset(),
            ("GET", "/certificates"): lambda _: [certificate.json() for certificate in self.issued.all()],
            ("POST", "/revoke"): self._revoke,
            ("POST", "/wait"): self._wait,
            ("GET", "/health"): lambda _: {"ok": True, "pid": os.getpid()},
        }

    def _settings(self, value: Any) -> Any:
        self.service.settings.apply(value)
        return vars(self.service.settings)

    def _revoke(self, serial: Any) -> Any:
        certificate = self.issued.find(serial) if isinstance(serial, str) else None
        if certificate is None:
            raise ValueError("no certificate of this serial number")
        certificate.revoked = True
        return certificate.json()

    def _wait(self, value: Any) -> Any:
        defaults = {"method": ANY, "count": 1, "timeout": 10}
        if not isinstance(value, dict) or not value.keys() <= defaults.keys():
            raise ValueError("wait takes method, count and timeout")
        request = defaults | value
        method, count, timeout = request["method"], request["count"], request["timeout"]
        if not isinstance(method, str) or not isinstance(count, int) or not isinstance(timeout, (int, float)):
            raise ValueError("wait takes a text, an integer and a number")
        if not 0 <= timeout <= LONGEST_WAIT:
            raise ValueError(f"a wait lasts at most {LONGEST_WAIT} seconds")
        received = self.service.record.wait(method, count, timeout)
        return {"reached": received >= count, "count": received}


class ControlHandler(LoopbackHandler):
    """One connection of a test."""

    def do_POST(self) -> None:
        try:
            status, text = 200, json.dumps(self._run())
        except Refusal as refusal:
            status, text = refusal.status, json.dumps({"error": str(refusal)})
        except (ValueError, RecursionError) as error:
            status, text = 400, json.dumps({"error": str(error)})
        self.answer(status, text.encode() + b"\n", "application/json")

    do_GET = do_DELETE = do_PUT = do_POST

    def _run(self) -> Any:
        body = self.read_body()
        commands = self.server.app.commands()
        command = commands.get((self.command, self.path))
        if command is None:
            known = any(path == self.path for _, path in commands)
            raise Refusal(405 if known else 404, "method not allowed here" if known else "no such command")
        return command(json.loads(body) if self.command == "POST" else None)
