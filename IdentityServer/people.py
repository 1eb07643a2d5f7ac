"""The remote methods about people and their machines: finding accounts, and keys kept for machines."""

from __future__ import annotations

import base64
from typing import Callable

from accounts import Account, Accounts
from calls import Struct, needed_text, refusal
from recent import Recent
from settings import Settings


def _email_addresses(account: Account) -> list[str]:
    return [account.details.get("PrimaryEmail", ""), *account.details.get("AllEmails", ())]


CRITERIA: dict[str, Callable[[Account], list[str]]] = {
    "email": _email_addresses,
    "phone": lambda account: account.details.get("ValidatedPhones", []),
    "VeltoID": lambda account: [account.name],
}
SHOWN_DETAILS = ("firstNm", "lastNm", "VeltoID")


class FindPerson:
    """Compares without regard to case; a value that several accounts share has several matches."""

    def __init__(self, accounts: Accounts, settings: Settings) -> None:
        self._accounts = accounts
        self._settings = settings

    def find(self, _: Account, parameters: Struct) -> Struct:
        accounts = self._accounts.all()
        return {"matches": [self._match(criterion, value, account)
                            for criterion, values in _searched(parameters).items()
                            for value in values
                            for account in accounts if _fits(account, criterion, value)]}

    def _match(self, criterion: str, value: str, account: Account) -> Struct:
        match = {"matched": criterion, "value": value, "encDsId": account.enc_ds_id}
        match |= {key: account.details[key] for key in SHOWN_DETAILS if key in account.details}
        if self._settings.findPersonValidInterval is not None:
            match["ValidInterval"] = self._settings.findPersonValidInterval
        return match


def _searched(parameters: Struct) -> dict[str, list[str]]:
    wanted = parameters.get("searchCriteria")
    if not isinstance(wanted, dict):
        raise refusal("searchCriteria is a struct")
    for criterion, values in wanted.items():
        if criterion not in CRITERIA:
            raise refusal(f"people are found by {', '.join(CRITERIA)}, not by {criterion}")
        if not isinstance(values, list) or not all(isinstance(value, str) for value in values):
            raise refusal(f"the values of {criterion} are an array of strings")
    return wanted


def _fits(account: Account, criterion: str, value: str) -> bool:
    return value != "" and value.lower() in (own.lower() for own in CRITERIA[criterion](account))


class Breadcrumbs:
    """One encrypted key (base64 text) per account, machine and name of the key."""

    def __init__(self) -> None:
        self._kept: Recent[tuple[str, str, str], str] = Recent()

    def save(self, account: Account, parameters: Struct) -> Struct:
        encrypted = needed_text(parameters, "ek")
        try:
            base64.b64decode("".join(encrypted.split()), validate=True)
        except ValueError as error:
            raise refusal("the ek is no base64 text") from error
        self._kept.put(_place(account, parameters), encrypted)
        return {}

    def fetch(self, account: Account, parameters: Struct) -> Struct:
        encrypted = self._kept.get(_place(account, parameters))
        return {} if encrypted is None else {"ek": encrypted}


def _place(account: Account, parameters: Struct) -> tuple[str, str, str]:
    return account.name, needed_text(parameters, "machineUUID"), needed_text(parameters, "breadcrumbKey")
