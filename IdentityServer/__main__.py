"""Starts the development identity server; see README.md."""

from __future__ import annotations

import argparse
import ipaddress
import json
import logging
import os
import signal
import sys
from pathlib import Path

from accounts import BUILT_IN, Accounts
from authority import Authority, export_certificate, server_context
from certificates import IssuedCertificates
from client_certificate_page import PAGE, ClientCertificateHandler
from control import Control, ControlHandler
from faults import Injections
from issuance import Issuance
from loopback_http import LoopbackServer
from methods import Methods
from record import Record
from rpc import PATH, RpcHandler, Service
from settings import Settings
from validation_records import ValidationRecords

ENDING_SIGNALS = {signal.SIGTERM, signal.SIGINT}


def main() -> int:
    options = _options()
    # Blocked before the first thread exists, so that only the wait at the end ever receives them.
    signal.pthread_sigmask(signal.SIG_BLOCK, ENDING_SIGNALS)
    logging.basicConfig(stream=sys.stderr, level=logging.DEBUG if options.verbose else logging.CRITICAL)
    try:
        ready = _start(options)
    except (OSError, ValueError) as error:
        print(f"identity server: {error}", file=sys.stderr)
        return 1
    print(json.dumps(ready), flush=True)
    signal.sigwait(ENDING_SIGNALS)
    return 0


def _options() -> argparse.Namespace:
    parser = argparse.ArgumentParser(prog="IdentityServer", description="Development identity server")
    parser.add_argument("--state-dir", type=Path, required=True, help="where the test authority is kept")
    parser.add_argument("--host", type=_loopback, default="127.0.0.1", help="IPv4 loopback (%(default)s)")
    parser.add_argument("--port", type=int, default=0, help="HTTPS port, 0 = any free one")
    parser.add_argument("--control-port", type=int, default=0, help="control port, 0 = any free one")
    parser.add_argument("--accounts", type=Path, help="JSON file with accounts, instead of the built-in ones")
    parser.add_argument("--verbose", action="store_true", help="log to standard error")
    return parser.parse_args()


def _loopback(text: str) -> str:
    if not ipaddress.IPv4Address(text).is_loopback:
        raise argparse.ArgumentTypeError("not a loopback address")
    return text


def _start(options: argparse.Namespace) -> dict[str, object]:
    """Brings every port up and returns the ready line."""
    options.state_dir.mkdir(mode=0o700, parents=True, exist_ok=True)
    authority = Authority.load_or_create(options.state_dir)
    anchor, intermediate = options.state_dir / "authority.pem", options.state_dir / "intermediate.pem"
    export_certificate(authority.root, anchor)
    export_certificate(authority.intermediate, intermediate)

    accounts = Accounts()
    accounts.apply(json.loads(options.accounts.read_text()) if options.accounts else list(BUILT_IN))
    settings = Settings()
    stranger = Authority.create("Unknown authority")
    issued = IssuedCertificates()
    methods = Methods(accounts, ValidationRecords(authority.issue_signer(), settings),
                      Issuance(authority, stranger, issued, settings), issued, settings)
    service = Service(methods, Injections(methods.names()), Record(), settings)

    own_names = ("localhost", "127.0.0.1")
    doors = {
        "url": (options.port, authority.issue_server(*own_names)),
        "wrongNameUrl": (0, authority.issue_server("another-host.invalid")),
        "unknownAuthorityUrl": (0, stranger.issue_server(*own_names)),
    }
    ready: dict[str, object] = {}
    for name, (port, credential) in doors.items():
        context = server_context(credential, options.state_dir)
        door = LoopbackServer(options.host, port, RpcHandler, service, context)
        door.start()
        ready[name] = f"https://localhost:{door.port}{PATH}"
    page_context = server_context(doors["url"][1], options.state_dir, clients_of=authority)
    page = LoopbackServer(options.host, 0, ClientCertificateHandler, issued, page_context)
    page.start()
    control = LoopbackServer(options.host, options.control_port, ControlHandler, Control(service, accounts, issued))
    control.start()
    return ready | {"clientCertificateUrl": f"https://localhost:{page.port}{PAGE}",
                    "control": f"http://{options.host}:{control.port}", "authority": str(anchor.resolve()),
                    "intermediate": str(intermediate.resolve()), "pid": os.getpid()}


if __name__ == "__main__":
    sys.exit(main())
