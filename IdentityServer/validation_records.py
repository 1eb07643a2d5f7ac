"""Validation records: signed statements of what has been validated for an account.

A record is kept while the account's details and the form of records stay the same, so that its identifier can
tell a client that there is nothing new; at three quarters of its suggested life, when clients ask again, it is
signed anew under a new identifier.
"""

from __future__ import annotations

import base64
import datetime
import hashlib
import plistlib
import threading
import time
from dataclasses import dataclass
from typing import Any

from accounts import Account
from authority import Credential, sign_message
from certificates import date_text
from settings import Settings

REPLACED_AT = 0.75
PREDATED = datetime.timedelta(days=1)


@dataclass(frozen=True)
class ValidationRecord:
    identifier: str
    text: str
    signed_at: float
    renewals: int


@dataclass(frozen=True)
class Form:
    """How records are written, and what is wrong with them."""

    format: str
    tampering: str | None
    date_as_text: bool

    @classmethod
    def of(cls, settings: Settings) -> Form:
        return cls(settings.validationRecordFormat, settings.validationRecordTampering, settings.validAsOfAsText)

    def payload(self, statement: dict[str, Any], valid_as_of: datetime.datetime) -> bytes:
        """As long for one date as for another."""
        statement = statement | {"ValidAsOf": date_text(valid_as_of) if self.date_as_text else valid_as_of}
        if self.format == "text":
            return "".join(f"{key}: {value}\n" for key, value in statement.items()).encode()
        if self.format == "array":
            return plistlib.dumps([statement])
        return plistlib.dumps(statement, fmt=plistlib.FMT_BINARY if self.format == "binary" else plistlib.FMT_XML)

    def message(self, statement: dict[str, Any], valid_as_of: datetime.datetime, signer: Credential) -> bytes:
        payload = self.payload(statement, valid_as_of)
        if self.tampering == "content":
            # An old record that somebody made out to be fresh.
            signed = self.payload(statement, valid_as_of - PREDATED)
            return sign_message(signed, signer).replace(signed, payload)
        message = sign_message(payload, signer, detached=self.tampering == "detached")
        if self.tampering == "signature":
            # The signature stands at the end.
            return message[:-1] + bytes((message[-1] ^ 1,))
        return message


class ValidationRecords:
    """Signs on demand and keeps the newest record of each account."""

    def __init__(self, signer: Credential, settings: Settings) -> None:
        self._signer = signer
        self._settings = settings
        self._lock = threading.Lock()
        self._newest: dict[str, tuple[bytes, ValidationRecord]] = {}

    def current(self, account: Account) -> ValidationRecord:
        """The account's record."""
        duration = self._settings.SuggestValidDuration
        statement = {key: account.details[key] for key in ("VeltoID", "ValidatedEmail", "ValidatedPhones")
                     if key in account.details}
        statement |= {"encDsId": account.enc_ds_id, "SuggestValidDuration": duration}
        form = Form.of(self._settings)
        details = plistlib.dumps(statement) + repr(form).encode()
        with self._lock:
            known, record = self._newest.get(account.name.lower(), (b"", None))
            same = record is not None and known == details
            if not same or time.time() >= record.signed_at + REPLACED_AT * duration:
                record = self._sign(statement, form, details, record.renewals + 1 if same else 0)
                self._newest[account.name.lower()] = (details, record)
            return record

    def _sign(self, statement: dict[str, Any], form: Form, details: bytes, renewals: int) -> ValidationRecord:
        now = time.time()
        message = form.message(statement, datetime.datetime.utcfromtimestamp(int(now)), self._signer)
        identifier = f"{hashlib.sha256(details).hexdigest()[:32]}-{renewals}"
        return ValidationRecord(identifier, base64.b64encode(message).decode(), now, renewals)
