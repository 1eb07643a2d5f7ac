"""Validation records: signed statements of what has been validated for an account.

A record is kept while the account's details stay the same, so that its identifier can tell a client that
there is nothing new; at three quarters of its suggested life, when clients ask again, it is signed anew
under a new identifier.
"""

from __future__ import annotations

import base64
import datetime
import hashlib
import plistlib
import threading
import time
from dataclasses import dataclass

from accounts import Account
from authority import Credential, sign_message

REPLACED_AT = 0.75


@dataclass(frozen=True)
class ValidationRecord:
    identifier: str
    text: str
    signed_at: float
    renewals: int


class ValidationRecords:
    """Signs on demand and keeps the newest record of each account."""

    def __init__(self, signer: Credential) -> None:
        self._signer = signer
        self._lock = threading.Lock()
        self._newest: dict[str, tuple[bytes, ValidationRecord]] = {}

    def current(self, account: Account, duration: int) -> ValidationRecord:
        """The account's record, which suggests to be valid for `duration` seconds."""
        statement = {key: account.details[key] for key in ("VeltoID", "ValidatedEmail", "ValidatedPhones")
                     if key in account.details}
        statement |= {"encDsId": account.enc_ds_id, "SuggestValidDuration": duration}
        details = plistlib.dumps(statement)
        with self._lock:
            known, record = self._newest.get(account.name.lower(), (b"", None))
            same = record is not None and known == details
            if not same or time.time() >= record.signed_at + REPLACED_AT * duration:
                record = self._sign(statement, details, record.renewals + 1 if same else 0)
                self._newest[account.name.lower()] = (details, record)
            return record

    def _sign(self, statement: dict, details: bytes, renewals: int) -> ValidationRecord:
        now = time.time()
        content = plistlib.dumps(statement | {"ValidAsOf": datetime.datetime.utcfromtimestamp(int(now))})
        text = base64.b64encode(sign_message(content, self._signer)).decode()
        return ValidationRecord(f"{hashlib.sha256(details).hexdigest()[:32]}-{renewals}", text, now, renewals)
