"""The remote methods by name, sign-in and account information among them.

A method takes the call's parameter struct and returns the reply struct, or raises `xmlrpc.client.Fault`. To
add one, write its function and name it in `Methods.__init__`; one that is for signed-in clients only takes the
session's account as well.
"""

from __future__ import annotations

import hmac
import secrets
from typing import Any, Callable
from xmlrpc.client import Fault

from accounts import Account, Accounts
from calls import FAULT_DISABLED, FAULT_WRONG_PASSWORD, Struct, refusal, text
from certificates import IssuedCertificates
from issuance import Issuance
from people import Breadcrumbs, FindPerson
from recent import Recent
from settings import Settings
from validation_records import ValidationRecords

PREFIX = "com.velto.dir.idm.web.collaboration.PersonService."
ANY = "*"  # stands for every method where a method is named on the control endpoint


class Methods:
    """Everything that a remote call can reach."""

    def __init__(self, accounts: Accounts, records: ValidationRecords, issuance: Issuance,
                 issued: IssuedCertificates, settings: Settings) -> None:
        self._accounts = accounts
        self._records = records
        self._issued = issued
        self._settings = settings
        # Account name by token.
        self._sessions: Recent[str, str] = Recent()
        breadcrumbs = Breadcrumbs()
        signed_in: dict[str, Callable[[Account, Struct], Struct]] = {
            "getMyInfo": self._get_my_info,
            "findPerson": FindPerson(accounts, settings).find,
            "createCert": issuance.create,
            "fetchCert": issuance.fetch,
            "downloadCertComplete": issuance.complete,
            "revokeCert": issuance.revoke,
            "saveBreadcrumbEk": breadcrumbs.save,
            "fetchBreadcrumbEk": breadcrumbs.fetch,
        }
        self._table: dict[str, Callable[[Struct], Struct]] = {"authenticate": self._authenticate}
        self._table |= {name: self._for_session(method) for name, method in signed_in.items()}

    def names(self) -> list[str]:
        return list(self._table)

    def call(self, name: str, arguments: tuple[Any, ...]) -> Struct:
        """Runs the method with this full name."""
        short_name = name.removeprefix(PREFIX)
        if not name.startswith(PREFIX) or short_name not in self._table:
            raise refusal(f"unknown method {name}")
        if len(arguments) != 1 or not isinstance(arguments[0], dict):
            raise refusal("a call has one parameter, a struct")
        return self._table[short_name](arguments[0])

    def _for_session(self, method: Callable[[Account, Struct], Struct]) -> Callable[[Struct], Struct]:
        return lambda parameters: method(self._account_of_session(parameters), parameters)

    def _account_of_session(self, parameters: Struct) -> Account:
        name = self._sessions.get(text(parameters, "dsSession"))
        account = self._accounts.find(name) if name is not None else None
        if account is None:
            raise refusal("unknown session")
        _refuse_disabled(account)
        return account

    def _authenticate(self, parameters: Struct) -> Struct:
        account = self._accounts.find(text(parameters, "veltoConnect"))
        given = text(parameters, "pwdHash").encode()
        if account is None or not hmac.compare_digest(given, account.password_hash.encode()):
            raise Fault(FAULT_WRONG_PASSWORD, "wrong account name or password")
        _refuse_disabled(account)
        token = secrets.token_urlsafe(24)
        self._sessions.put(token, account.name)
        reply: Struct = {
            "Version": self._settings.Version,
            "encDsId": account.enc_ds_id,
            "dsSession": token,
            "VeltoIDRecordIdentifier": self._records.current(account).identifier,
        }
        if self._settings.dsSessionValidityDuration is not None:
            reply["dsSessionValidityDuration"] = self._settings.dsSessionValidityDuration
        return reply | self._certificate_state(account, parameters)

    def _get_my_info(self, account: Account, parameters: Struct) -> Struct:
        record = self._records.current(account)
        reply = dict(account.details) | {"encDsId": account.enc_ds_id}
        reply |= self._certificate_state(account, parameters)
        if parameters.get("ClientVIDVRecordIdentifier") == record.identifier:
            reply.pop("VIDVRecordNextCheckDate", None)
        else:
            reply |= {"VIDVRecord": record.text, "VIDVRecordIdentifier": record.identifier}
        return reply

    def _certificate_state(self, account: Account, parameters: Struct) -> Struct:
        """What is told about the certificate that the client named; what a test has set comes first."""
        if "CertificateIsValid" in account.details:
            return {"CertificateIsValid": account.details["CertificateIsValid"]}
        if "CertificateSerialNumber" not in parameters:
            return {}
        serial = text(parameters, "CertificateSerialNumber")
        return {"CertificateIsValid": self._issued.is_valid(serial, account)}


def _refuse_disabled(account: Account) -> None:
    if account.disabled:
        raise Fault(FAULT_DISABLED, "this account has been disabled for security reasons")
