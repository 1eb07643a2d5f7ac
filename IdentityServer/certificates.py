"""The client certificates that this server issued since it was started."""

from __future__ import annotations

import datetime
from dataclasses import dataclass
from typing import Any

from cryptography import x509
from cryptography.hazmat.primitives import serialization

from accounts import Account
from recent import Recent


@dataclass
class IssuedCertificate:
    """One certificate and whose it is; `enc_ds_id` is the account's at the time."""

    certificate: x509.Certificate
    account: str
    enc_ds_id: str
    revoked: bool = False

    @property
    def serial(self) -> str:
        return serial_text(self.certificate)

    @property
    def pem(self) -> str:
        return self.certificate.public_bytes(serialization.Encoding.PEM).decode()

    @property
    def counts(self) -> bool:
        """Whether it is neither revoked nor expired."""
        return not self.revoked and datetime.datetime.utcnow() < self.certificate.not_valid_after

    def json(self) -> dict[str, Any]:
        return {"serial": self.serial, "account": self.account, "encDsId": self.enc_ds_id, "revoked": self.revoked,
                "notAfter": date_text(self.certificate.not_valid_after)}


class IssuedCertificates:
    """By serial number; without regard to how the rest of the server came to issue them."""

    def __init__(self) -> None:
        self._by_serial: Recent[str, IssuedCertificate] = Recent()

    def add(self, certificate: x509.Certificate, account: Account) -> IssuedCertificate:
        issued = IssuedCertificate(certificate, account.name, account.enc_ds_id)
        self._by_serial.put(issued.serial, issued)
        return issued

    def find(self, serial: str) -> IssuedCertificate | None:
        return self._by_serial.get(serial)

    def all(self) -> list[IssuedCertificate]:
        return self._by_serial.all()

    def is_valid(self, serial: str, account: Account) -> bool:
        """Whether the account may use the certificate of this number."""
        issued = self.find(serial)
        return issued is not None and issued.enc_ds_id == account.enc_ds_id and issued.counts


def serial_text(certificate: x509.Certificate) -> str:
    """The serial number as `openssl x509 -serial` prints it: whole bytes in upper-case hexadecimal."""
    number = certificate.serial_number
    return number.to_bytes((number.bit_length() + 7) // 8, "big").hex().upper()


def date_text(moment: datetime.datetime) -> str:
    return moment.strftime("%Y-%m-%dT%H:%M:%SZ")
