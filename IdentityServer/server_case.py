"""What the server's tests share: a server process of their own, and calls to it over real TLS."""

from __future__ import annotations

import atexit
import contextlib
import hashlib
import http.client
import ssl
import tempfile
import unittest
import xmlrpc.client
from pathlib import Path
from typing import Any
from urllib.parse import urlsplit

from control_client import IdentityServer

PREFIX = "com.velto.dir.idm.web.collaboration.PersonService."
JANE = "jane.roe@example.com"
JANE_HASH = hashlib.sha256(b"correct horse").hexdigest()
JOHN = "john.doe@example.com"
JOHN_HASH = hashlib.sha256(b"battery staple").hexdigest()
SIGN_IN = {"veltoConnect": JANE, "pwdHash": JANE_HASH}
TIMEOUT = 20

directory = tempfile.TemporaryDirectory()
atexit.register(directory.cleanup)
server = IdentityServer(Path(directory.name) / "state")


def setUpModule() -> None:
    """For test modules to import, so that their tests find the server running."""
    global trust
    server.start()
    unittest.addModuleCleanup(server.stop)
    trust = ssl.create_default_context(cafile=server.authority)


def exchange(body: bytes | None, url: str = "", verb: str = "POST", context: ssl.SSLContext | None = None,
             **headers: str) -> tuple[int, bytes]:
    """One HTTPS request; status and body of the answer."""
    address = urlsplit(url or server.url)
    connection = http.client.HTTPSConnection(address.netloc, timeout=TIMEOUT, context=context or trust)
    with contextlib.closing(connection):
        fields = {name.replace("_", "-"): value for name, value in headers.items()}
        connection.request(verb, address.path, body, {"Content-Type": "text/xml"} | fields)
        response = connection.getresponse()
        return response.status, response.read()


def call(method: str, parameters: Any, url: str = "") -> dict[str, Any]:
    """One remote call; raises `xmlrpc.client.Fault`."""
    status, body = exchange(xmlrpc.client.dumps((parameters,), PREFIX + method).encode(), url)
    if status != 200:
        raise AssertionError(f"{status}: {body!r}")
    return xmlrpc.client.loads(body, use_builtin_types=True)[0][0]


def signed_in(name: str = JANE, password_hash: str = JANE_HASH) -> dict[str, str]:
    """A new session and the id that goes with it, as the calls of an account carry them."""
    reply = call("authenticate", {"veltoConnect": name, "pwdHash": password_hash})
    return {key: reply[key] for key in ("dsSession", "encDsId")}


def fault_of(method: str, parameters: Any) -> int | None:
    try:
        call(method, parameters)
    except xmlrpc.client.Fault as fault:
        return fault.faultCode
    return None


class ServerTest(unittest.TestCase):
    def setUp(self) -> None:
        server.clear_next()
        server.reset_settings()
        self.owner = signed_in()
        self.session = {"dsSession": self.owner["dsSession"]}
        server.clear_received()
