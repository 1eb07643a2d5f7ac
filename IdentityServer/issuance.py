"""The remote methods that issue and revoke client certificates.

A certificate comes with the answer to the request, or later: the request is then remembered under a token,
and the client asks for it by token until it is issued. How that goes is set by the test at any time; what is
set when a call arrives is what counts for it.
"""

from __future__ import annotations

import math
import secrets
import threading
from dataclasses import dataclass

from cryptography import x509
from cryptography.hazmat.primitives.asymmetric import rsa
from xmlrpc.client import Fault

from accounts import Account
from authority import Authority
from calls import FAULT_PENDING, Struct, needed_text, refusal, text
from certificate_requests import SMALLEST_KEY, read_request
from certificates import IssuedCertificate, IssuedCertificates, date_text
from recent import Recent
from settings import Settings

CERTIFICATE_TYPE = "ClientCertificate"
ISSUED, PENDING, FAILED = "CERT_ISSUED", "SIGNIN_PENDING", "FAILED"


@dataclass(frozen=True)
class Request:
    """A request that was found good. Delays told for it lie within `delay_bounds`, if the client gave any."""

    csr: x509.CertificateSigningRequest
    lifetime: float
    delay_bounds: tuple[float, float] | None


@dataclass
class Order:
    """A request under a token: how often its client asked in vain, and what it got in the end."""

    account: str
    request: Request
    polls: int = 0
    issued: IssuedCertificate | None = None


class Issuance:
    """Methods take the session's account and the call's parameters."""

    def __init__(self, authority: Authority, stranger: Authority, issued: IssuedCertificates,
                 settings: Settings) -> None:
        self._authority = authority
        self._stranger = stranger
        self._issued = issued
        self._settings = settings
        self._orders: Recent[str, Order] = Recent()
        # Held while an order is looked after, so that no two calls issue for the same one.
        self._busy = threading.Lock()
        self._other_key: rsa.RSAPublicKey | None = None

    def create(self, account: Account, parameters: Struct) -> Struct:
        request = _request(account, parameters)
        if self._settings.issuance == "at-once":
            return {"dsCert": self._described(self._issue(account, request))}
        if self._settings.issuance == "refuse":
            return {"dsCert": {"CertStatus": FAILED}}
        token = secrets.token_urlsafe(24)
        self._orders.put(token, Order(account.name, request))
        return {"CertificateToken": token} | self._delay(request)

    def fetch(self, account: Account, parameters: Struct) -> Struct:
        if "CertificateToken" in parameters:
            with self._busy:
                return self._fetched(account, self._order(account, parameters))
        issued = self._issued.find(needed_text(parameters, "certSerialNumber"))
        if issued is None:
            raise refusal("no certificate of this serial number")
        return {"Certificate": issued.pem}

    def complete(self, account: Account, parameters: Struct) -> Struct:
        self._order(account, parameters)
        self._orders.take(parameters["CertificateToken"])
        return {}

    def revoke(self, account: Account, parameters: Struct) -> Struct:
        issued = self._issued.find(needed_text(parameters, "SerialNumber"))
        if issued is None or issued.enc_ds_id != account.enc_ds_id:
            raise refusal("no certificate of this serial number and account")
        issued.revoked = True
        return {}

    def _order(self, account: Account, parameters: Struct) -> Order:
        _check_owner(account, parameters)
        order = self._orders.get(needed_text(parameters, "CertificateToken"))
        if order is None or order.account != account.name:
            raise refusal("unknown or used certificate token")
        return order

    def _fetched(self, account: Account, order: Order) -> Struct:
        mode = self._settings.issuance
        if order.issued is not None:
            return self._shaped(self._described(order.issued))
        if mode == "never" or order.polls < self._settings.pendingPolls:
            order.polls += 1
            return self._still_pending(order.request)
        if mode in ("refuse", "token-refuse"):
            return self._shaped({"CertStatus": FAILED})
        if mode == "unknown":
            return self._shaped({"CertStatus": self._settings.unknownCertStatus})
        order.issued = self._issue(account, order.request)
        return self._shaped(self._described(order.issued))

    def _still_pending(self, request: Request) -> Struct:
        if self._settings.pendingAnswer == "fault":
            raise Fault(FAULT_PENDING, "the certificate is not issued yet")
        return self._shaped({"CertStatus": PENDING}) | self._delay(request)

    def _shaped(self, certificate: Struct) -> Struct:
        return {"dsCert": [certificate] if self._settings.dsCertAsArray else certificate}

    def _delay(self, request: Request) -> Struct:
        delay = self._settings.issuanceDelay
        if delay is None:
            return {}
        if request.delay_bounds is not None:
            least, most = request.delay_bounds
            delay = min(max(delay, least), most)
        return {"Delay": delay}

    def _issue(self, account: Account, request: Request) -> IssuedCertificate:
        key = self._key_of_nobody() if self._settings.wrongKey else request.csr.public_key()
        lifetime = self._settings.certificateLifetime
        certificate = self._authority.issue_client(
            request.csr.subject, key, request.lifetime if lifetime is None else lifetime)
        return self._issued.add(certificate, account)

    def _key_of_nobody(self) -> rsa.RSAPublicKey:
        if self._other_key is None:
            self._other_key = rsa.generate_private_key(65537, SMALLEST_KEY).public_key()
        return self._other_key

    def _described(self, issued: IssuedCertificate) -> Struct:
        issuer = self._stranger if self._settings.wrongIntermediate else self._authority
        end = issued.certificate.not_valid_after
        return {
            "Certificate": issued.pem,
            "CertType": CERTIFICATE_TYPE,
            "SerialNumber": issued.serial,
            "CertStatus": ISSUED,
            "IntermediateCert": issuer.intermediate.certificate_pem().decode(),
            "Expires": date_text(end) if self._settings.expiresAsText else end,
        }


def _request(account: Account, parameters: Struct) -> Request:
    _check_owner(account, parameters)
    lifetime = parameters.get("RequestedCertificateLifetimeInSeconds")
    if type(lifetime) not in (int, float) or not 0 < lifetime < math.inf:
        raise refusal("the requested lifetime is no number of seconds")
    try:
        csr = read_request(needed_text(parameters, "CSR"), account.name)
    except Fault:
        raise
    except Exception as error:  # what the parser raises on foreign bytes is not confined to one kind
        raise refusal(f"the certificate request is refused: {error}") from error
    return Request(csr, lifetime, _delay_bounds(parameters))


def _check_owner(account: Account, parameters: Struct) -> None:
    if text(parameters, "encDsId") != account.enc_ds_id:
        raise refusal("the encDsId is not the one of the session's account")


def _delay_bounds(parameters: Struct) -> tuple[float, float] | None:
    try:
        least = float(text(parameters, "__CERT_FETCH_DELAY_MIN"))
        most = float(text(parameters, "__CERT_FETCH_DELAY_MAX"))
    except ValueError:
        return None
    return (least, most) if 0 <= least <= most < math.inf else None
