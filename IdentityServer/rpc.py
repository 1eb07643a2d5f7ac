"""The HTTPS door: takes XML-RPC calls, records them, applies injections and answers."""

from __future__ import annotations

import time
from dataclasses import dataclass
from xmlrpc.client import Fault

from faults import Injection, Injections, merge, pad
from loopback_http import LoopbackHandler, Refusal, log
from methods import Methods
from record import MALFORMED, Call, Record
from settings import Settings
from wire import decode_call, encode_fault, encode_reply

PATH = "/dsservices/dsxmlrpc"
XML = "text/xml"


@dataclass(frozen=True)
class Service:
    """What the door needs of the rest of the server."""

    methods: Methods
    injections: Injections
    record: Record
    settings: Settings


class RpcHandler(LoopbackHandler):
    """One HTTPS connection of a client."""

    def do_POST(self) -> None:
        try:
            body = self.read_body()
            if self.path != PATH:
                raise Refusal(404, "not found")
            call = self._read_call(body)
            try:
                self._answer_call(call)
            finally:
                call.answered = True
        except Refusal as refusal:
            self.answer(refusal.status, f"{refusal}\n".encode(), "text/plain; charset=utf-8")

    def do_GET(self) -> None:
        self.close_connection = True
        status, text = (405, b"POST only\n") if self.path == PATH else (404, b"not found\n")
        self.answer(status, b"" if self.command == "HEAD" else text, "text/plain; charset=utf-8")

    do_HEAD = do_PUT = do_DELETE = do_PATCH = do_OPTIONS = do_GET

    def _read_call(self, body: bytes) -> Call:
        """The recorded call; a malformed one is recorded too, so that one can see what was wrong with it."""
        service: Service = self.server.app
        headers = dict(self.headers.items())
        try:
            if self.headers.get_content_type() != XML:
                raise ValueError(f"the content is not {XML}")
            method, arguments = decode_call(body)
        except Exception as error:  # the decoder raises many kinds
            reason = f"{type(error).__name__}: {error}"
            service.record.add(Call(MALFORMED, (), headers, body, reason, answered=True), service.settings.record)
            raise Refusal(400, reason) from error
        call = Call(method, arguments, headers, body)
        service.record.add(call, service.settings.record)
        return call

    def _answer_call(self, call: Call) -> None:
        service: Service = self.server.app
        injection = service.injections.take(call.method) or Injection(call.method, 1)
        call.injection = injection.request
        if injection.delay:
            time.sleep(injection.delay)
        if injection.close_at == "before":
            self.close_connection = True
        elif injection.answer is not None:
            self.answer(injection.answer.status, injection.answer.body, XML)
        else:
            self._send(*_run(service.methods, call, injection), injection.close_at)

    def _send(self, status: int, document: bytes, close_at: str | None) -> None:
        if close_at is None:
            self.answer(status, document, XML)
            return
        self.send_head(status, len(document), XML)
        if close_at == "middle":
            self.wfile.write(document[:len(document) // 2])
        self.close_connection = True


def _run(methods: Methods, call: Call, injection: Injection) -> tuple[int, bytes]:
    """Status and document of the method's own reply. Nothing is merged into a fault."""
    try:
        reply = merge(methods.call(call.name, call.arguments), injection.changes)
        return 200, encode_reply(reply) if injection.size is None else pad(reply, injection.size)
    except Fault as fault:
        return 200, encode_fault(fault.faultCode, fault.faultString)
    except Exception as error:  # whatever a method meets, the client gets an answer
        log.exception("call of %s failed", call.name)
        return 500, str(error).encode("utf-8", "replace")
