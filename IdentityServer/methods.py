"""The remote methods, one function each.

A method takes the call's parameter struct and returns the reply struct, or raises `xmlrpc.client.Fault`. To
add one, write its function and name it in `Methods.__init__`.
"""

from __future__ import annotations

import hmac
import secrets
import threading
from collections import OrderedDict
from typing import Any, Callable
from xmlrpc.client import Fault

from accounts import Account, Accounts
from settings import Settings
from validation_records import ValidationRecords

PREFIX = "com.velto.dir.idm.web.collaboration.PersonService."
ANY = "*"  # stands for every method where a method is named on the control endpoint
NOT_YET = ("findPerson", "createCert", "fetchCert", "downloadCertComplete", "revokeCert", "fetchBreadcrumbEk",
           "saveBreadcrumbEk")

FAULT_OTHER = -1
FAULT_WRONG_PASSWORD = -20101
FAULT_DISABLED = -20209

KEPT_SESSIONS = 10_000

Struct = dict[str, Any]


class Sessions:
    """The session tokens given out, newest last. A server under load for days must forget the oldest."""

    def __init__(self) -> None:
        self._lock = threading.Lock()
        self._names: OrderedDict[str, str] = OrderedDict()

    def open(self, name: str) -> str:
        token = secrets.token_urlsafe(24)
        with self._lock:
            self._names[token] = name
            if len(self._names) > KEPT_SESSIONS:
                self._names.popitem(last=False)
        return token

    def name_of(self, token: str) -> str | None:
        with self._lock:
            return self._names.get(token)


class Methods:
    """Everything that a remote call can reach."""

    def __init__(self, accounts: Accounts, records: ValidationRecords, settings: Settings) -> None:
        self._accounts = accounts
        self._records = records
        self._settings = settings
        self._sessions = Sessions()
        self._table: dict[str, Callable[[Struct], Struct]] = {
            "authenticate": self._authenticate,
            "getMyInfo": self._get_my_info,
        }
        self._table |= dict.fromkeys(NOT_YET, _not_available)

    def names(self) -> list[str]:
        return list(self._table)

    def call(self, name: str, arguments: tuple[Any, ...]) -> Struct:
        """Runs the method with this full name."""
        short_name = name.removeprefix(PREFIX)
        if not name.startswith(PREFIX) or short_name not in self._table:
            raise Fault(FAULT_OTHER, f"unknown method {name}")
        if len(arguments) != 1 or not isinstance(arguments[0], dict):
            raise Fault(FAULT_OTHER, "a call has one parameter, a struct")
        return self._table[short_name](arguments[0])

    def _authenticate(self, parameters: Struct) -> Struct:
        account = self._accounts.find(_text(parameters, "veltoConnect"))
        given = _text(parameters, "pwdHash").encode()
        if account is None or not hmac.compare_digest(given, account.password_hash.encode()):
            raise Fault(FAULT_WRONG_PASSWORD, "wrong account name or password")
        _refuse_disabled(account)
        record = self._records.current(account, self._settings.SuggestValidDuration)
        reply: Struct = {
            "Version": self._settings.Version,
            "encDsId": account.enc_ds_id,
            "dsSession": self._sessions.open(account.name),
            "VeltoIDRecordIdentifier": record.identifier,
        }
        if self._settings.dsSessionValidityDuration is not None:
            reply["dsSessionValidityDuration"] = self._settings.dsSessionValidityDuration
        if "CertificateIsValid" in account.details:
            reply["CertificateIsValid"] = account.details["CertificateIsValid"]
        return reply

    def _get_my_info(self, parameters: Struct) -> Struct:
        account = self._account_of_session(parameters)
        record = self._records.current(account, self._settings.SuggestValidDuration)
        reply = dict(account.details) | {"encDsId": account.enc_ds_id}
        if parameters.get("ClientVIDVRecordIdentifier") == record.identifier:
            reply.pop("VIDVRecordNextCheckDate", None)
        else:
            reply |= {"VIDVRecord": record.text, "VIDVRecordIdentifier": record.identifier}
        return reply

    def _account_of_session(self, parameters: Struct) -> Account:
        name = self._sessions.name_of(_text(parameters, "dsSession"))
        account = self._accounts.find(name) if name is not None else None
        if account is None:
            raise Fault(FAULT_OTHER, "unknown session")
        _refuse_disabled(account)
        return account


def _refuse_disabled(account: Account) -> None:
    if account.disabled:
        raise Fault(FAULT_DISABLED, "this account has been disabled for security reasons")


def _not_available(_: Struct) -> Struct:
    raise Fault(FAULT_OTHER, "not available on this server yet")


def _text(parameters: Struct, key: str) -> str:
    value = parameters.get(key)
    return value if isinstance(value, str) else ""
