"""Runs the development identity server as a subprocess and speaks to its control endpoint.

Stands alone (no other module of the server is imported), so that end-to-end tests and the demo can use it
from anywhere:

    with IdentityServer(state_dir) as server:
        server.next("getMyInfo", fault={"code": -20101, "string": "refused"})
        ... run a client against server.url, trusting server.authority ...
        assert server.wait("getMyInfo")
"""

from __future__ import annotations

import http.client
import json
import select
import subprocess
from pathlib import Path
from typing import Any
from urllib.parse import urlsplit

# The server needs the distribution's cryptography package, which another interpreter on PATH may not have.
INTERPRETER = "/usr/bin/python3"
START_TIMEOUT = 20
STOP_TIMEOUT = 10
ANSWER_TIMEOUT = 30


class ControlError(Exception):
    """The control endpoint refused a command."""

    def __init__(self, status: int, text: str) -> None:
        super().__init__(f"{status}: {text}")
        self.status = status


class IdentityServer:
    """One server process; started by entering the context or by `start`."""

    def __init__(self, state_dir: str | Path, *options: str) -> None:
        program = str(Path(__file__).resolve().parent)
        self._command = [INTERPRETER, program, "--state-dir", str(state_dir), *options]
        self._process: subprocess.Popen[str] | None = None
        self.url = self.wrong_name_url = self.unknown_authority_url = self.client_certificate_url = ""
        self.control = self.authority = self.intermediate = ""
        self.pid = 0

    def start(self) -> IdentityServer:
        """Returns when the server is ready; RuntimeError when it ends, or is not ready in time."""
        self._process = subprocess.Popen(self._command, stdout=subprocess.PIPE, text=True)
        readable, _, _ = select.select([self._process.stdout], [], [], START_TIMEOUT)
        line = self._process.stdout.readline() if readable else ""
        if not line:
            self.stop()
            raise RuntimeError("the identity server did not get ready")
        ready = json.loads(line)
        self.url, self.control = ready["url"], ready["control"]
        self.authority, self.intermediate = ready["authority"], ready["intermediate"]
        self.client_certificate_url = ready["clientCertificateUrl"]
        self.wrong_name_url, self.unknown_authority_url = ready["wrongNameUrl"], ready["unknownAuthorityUrl"]
        self.pid = ready["pid"]
        return self

    def stop(self) -> int:
        """Ends the server and returns its exit status."""
        if self._process is None:
            raise RuntimeError("the identity server was not started")
        self._process.terminate()
        try:
            return self._process.wait(STOP_TIMEOUT)
        except subprocess.TimeoutExpired:
            self._process.kill()
            return self._process.wait()
        finally:
            self._process.stdout.close()

    def __enter__(self) -> IdentityServer:
        return self.start()

    def __exit__(self, *_: object) -> None:
        self.stop()

    def next(self, method: str = "*", **injection: Any) -> None:
        """Queues an injection, e.g. next("authenticate", times=2, status=503)."""
        self.command("POST", "/next", {"method": method, **injection})

    def pending(self) -> list[dict[str, Any]]:
        """The injections that no call has used up."""
        return self.command("GET", "/next")

    def clear_next(self) -> None:
        self.command("DELETE", "/next")

    def received(self, method: str | None = None) -> list[dict[str, Any]]:
        """The recorded calls, oldest first, all or those of one method."""
        return [call for call in self.command("GET", "/received") if method in (None, call["method"])]

    def clear_received(self) -> None:
        """Empties the record and its counts."""
        self.command("DELETE", "/received")

    def counts(self) -> dict[str, int]:
        return self.command("GET", "/counts")

    def accounts(self, *accounts: dict[str, Any]) -> None:
        """Adds or changes accounts."""
        self.command("POST", "/accounts", list(accounts))

    def settings(self, **settings: Any) -> dict[str, Any]:
        """Changes run-time settings; returns all of them."""
        return self.command("POST", "/settings", settings)

    def reset_settings(self) -> None:
        """Back to what they are at the start."""
        self.command("DELETE", "/settings")

    def certificates(self, account: str | None = None) -> list[dict[str, Any]]:
        """The certificates issued since the start, oldest first, all or those of one account name."""
        return [entry for entry in self.command("GET", "/certificates") if account in (None, entry["account"])]

    def revoke(self, serial: str) -> None:
        """Revokes a certificate behind its owner's back."""
        self.command("POST", "/revoke", serial)

    def wait(self, method: str = "*", count: int = 1, timeout: float = 10) -> bool:
        """Whether `count` calls (since the record was last emptied) arrived in time."""
        request = {"method": method, "count": count, "timeout": timeout}
        return self.command("POST", "/wait", request, ANSWER_TIMEOUT + timeout)["reached"]

    def command(self, verb: str, path: str, value: Any = None, timeout: float = ANSWER_TIMEOUT) -> Any:
        """One control command; ControlError when it is refused."""
        connection = http.client.HTTPConnection(urlsplit(self.control).netloc, timeout=timeout)
        try:
            connection.request(verb, path, None if value is None else json.dumps(value))
            response = connection.getresponse()
            answer = json.loads(response.read())
        finally:
            connection.close()
        if response.status != 200:
            raise ControlError(response.status, answer["error"])
        return answer
