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
        self.session = {"dsSession": call("authenticate", SIGN_IN)["dsSession"]}
        server.clear_received()
