"""What the doors of the server share: threaded HTTP/1.1 on the loopback interface with bounded bodies."""

from __future__ import annotations

import contextlib
import logging
import re
import socketserver
import ssl
import threading
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer
from typing import Any

LARGEST_BODY = 16 * 1024 * 1024
MOST_DISCARDED = 4 * LARGEST_BODY
IDLE_TIMEOUT = 120
DISCARD_TIMEOUT = 2
NUMBER = re.compile(r"[0-9]{1,18}")

log = logging.getLogger("identity-server")


class Refusal(Exception):
    """A request that is answered with an HTTP status and one line of text."""

    def __init__(self, status: int, text: str) -> None:
        super().__init__(text)
        self.status = status


class LoopbackServer(ThreadingHTTPServer):
    """One thread per connection. `app` is whatever the handler class works on."""

    daemon_threads = True
    request_queue_size = 128

    def __init__(self, host: str, port: int, handler: type[BaseHTTPRequestHandler], app: Any,
                 context: ssl.SSLContext | None = None) -> None:
        self.app = app
        self._context = context
        super().__init__((host, port), handler)

    @property
    def port(self) -> int:
        return self.server_address[1]

    def server_bind(self) -> None:
        """Without the name look-up of the base class, which can take seconds."""
        socketserver.TCPServer.server_bind(self)
        self.server_name, self.server_port = self.server_address[:2]

    def get_request(self) -> tuple[Any, Any]:
        """Wraps without shaking hands: in the connection's own thread a slow client holds up nobody."""
        connection, address = super().get_request()
        if self._context is not None:
            connection = self._context.wrap_socket(
                connection, server_side=True, do_handshake_on_connect=False)
        return connection, address

    def handle_error(self, request: Any, client_address: Any) -> None:
        log.debug("connection from %s ended", client_address, exc_info=True)

    def start(self) -> None:
        threading.Thread(target=self.serve_forever, name=f"port {self.port}", daemon=True).start()


class LoopbackHandler(BaseHTTPRequestHandler):
    """Header and body leave in one write, and at once."""

    protocol_version = "HTTP/1.1"
    server_version = "IdentityServer"
    sys_version = ""
    timeout = IDLE_TIMEOUT
    disable_nagle_algorithm = True
    wbufsize = 64 * 1024
    server: LoopbackServer

    def setup(self) -> None:
        super().setup()
        if isinstance(self.connection, ssl.SSLSocket):
            self.connection.do_handshake()

    def handle_expect_100(self) -> bool:
        """The go-ahead must not wait in the write buffer for the end of the request that waits for it."""
        proceed = super().handle_expect_100()
        self.wfile.flush()
        return proceed

    def read_body(self) -> bytes:
        """The whole body. After a refusal the connection ends, as the rest of the body may still be in it."""
        length = self.headers.get("Content-Length", "0")
        close_afterwards, self.close_connection = self.close_connection, True
        if "Transfer-Encoding" in self.headers:
            raise Refusal(411, "a body needs a Content-Length")
        if not NUMBER.fullmatch(length):
            raise Refusal(400, "Content-Length is not a number")
        if int(length) > LARGEST_BODY:
            self._discard(min(int(length), MOST_DISCARDED))
            raise Refusal(413, f"a body has at most {LARGEST_BODY} bytes")
        body = self.rfile.read(int(length))
        if len(body) < int(length):
            raise Refusal(400, "the body ends early")
        self.close_connection = close_afterwards
        return body

    def _discard(self, size: int) -> None:
        """Reads on for a while: a client still sending as the connection ends would not see the answer."""
        self.connection.settimeout(DISCARD_TIMEOUT)
        with contextlib.suppress(TimeoutError):
            while size > 0 and (chunk := self.rfile.read1(min(size, 1 << 20))):
                size -= len(chunk)

    def answer(self, status: int, body: bytes, content_type: str) -> None:
        self.send_head(status, len(body), content_type)
        self.wfile.write(body)

    def send_head(self, status: int, length: int, content_type: str) -> None:
        self.send_response(status)
        self.send_header("Content-Type", content_type)
        self.send_header("Content-Length", str(length))
        if self.close_connection:
            self.send_header("Connection", "close")
        self.end_headers()

    def log_message(self, format: str, *args: Any) -> None:
        log.debug("%s " + format, self.client_address, *args)
