"""The accounts that this server knows, kept in memory.

An account is immutable and replaced as a whole, so that a call that is being answered never sees half of a
change. Account texts (JSON) use the key names that also go over the wire; "password" may stand for
"pwdHash".
"""

from __future__ import annotations

import hashlib
import threading
from dataclasses import dataclass, field, replace
from typing import Any, Mapping


def _is_text(value: Any) -> bool:
    return isinstance(value, str)


def _is_flag(value: Any) -> bool:
    return isinstance(value, bool)


def _is_number(value: Any) -> bool:
    return isinstance(value, (int, float)) and not _is_flag(value)


def _is_list_of_texts(value: Any) -> bool:
    return isinstance(value, list) and all(_is_text(entry) for entry in value)


OWN_KEYS = {
    "name": _is_text, "password": _is_text, "pwdHash": _is_text, "encDsId": _is_text, "disabled": _is_flag,
}
DETAIL_KEYS = {
    "VeltoID": _is_text, "firstNm": _is_text, "lastNm": _is_text, "PrimaryEmail": _is_text,
    "AllEmails": _is_list_of_texts, "ValidatedEmail": _is_list_of_texts, "ValidatedPhones": _is_list_of_texts,
    "CertificateIsValid": _is_flag, "ValidForInterval": _is_number, "VIDVRecordNextCheckDate": _is_text,
}


def hash_password(password: str) -> str:
    """The form in which clients send a password: lower-case hexadecimal SHA-256 of its UTF-8 bytes."""
    return hashlib.sha256(password.encode()).hexdigest()


@dataclass(frozen=True)
class Account:
    """`details` holds, under their wire names, the entries that getMyInfo answers from the account."""

    name: str
    password_hash: str
    enc_ds_id: str
    disabled: bool = False
    details: Mapping[str, Any] = field(default_factory=dict)


BUILT_IN = (
    {"name": "jane.roe@example.com", "password": "correct horse", "encDsId": "000123-08-4f1c2a9e5b7d",
     "firstNm": "Jane", "lastNm": "Roe", "PrimaryEmail": "jane.roe@example.com",
     "AllEmails": ["jane.roe@example.com", "jane@roe.example"],
     "ValidatedEmail": ["jane.roe@example.com"], "ValidatedPhones": ["+15555550123"]},
    {"name": "john.doe@example.com", "password": "battery staple", "firstNm": "John", "lastNm": "Doe",
     "PrimaryEmail": "john.doe@example.com", "AllEmails": ["john.doe@example.com"],
     "ValidatedEmail": ["john.doe@example.com"], "ValidatedPhones": []},
)


class Accounts:
    """A table from lower-cased name to account."""

    def __init__(self) -> None:
        self._lock = threading.Lock()
        self._by_name: dict[str, Account] = {}

    def find(self, name: str) -> Account | None:
        with self._lock:
            return self._by_name.get(name.lower())

    def all(self) -> list[Account]:
        with self._lock:
            return list(self._by_name.values())

    def apply(self, texts: Any) -> list[str]:
        """Adds or changes accounts from one JSON object or a list of them: all, or (ValueError) none.

        Only the keys that are given change; null takes a detail away. Returns the names.
        """
        texts = texts if isinstance(texts, list) else [texts]
        with self._lock:
            table = dict(self._by_name)
            for text in texts:
                name = _name_of(text)
                table[name.lower()] = _changed(table.get(name.lower()), name, text)
            self._by_name = table
        return [text["name"] for text in texts]


def _name_of(text: Any) -> str:
    if not isinstance(text, dict) or not isinstance(text.get("name"), str) or not text["name"]:
        raise ValueError('an account is an object with a "name"')
    return text["name"]


def _changed(account: Account | None, name: str, text: dict[str, Any]) -> Account:
    for key, value in text.items():
        _check(key, value)
    password_hash = hash_password(text["password"]) if "password" in text else text.get("pwdHash")
    if account is None:
        if password_hash is None:
            raise ValueError(f'new account {name} needs a "password" or a "pwdHash"')
        enc_ds_id = "000100-05-" + hashlib.sha256(name.lower().encode()).hexdigest()[:12]
        account = Account(name, password_hash, enc_ds_id, details={"VeltoID": name})
    details = dict(account.details)
    details.update({key: value for key, value in text.items() if key not in OWN_KEYS})
    return replace(account, password_hash=password_hash or account.password_hash,
                   enc_ds_id=text.get("encDsId", account.enc_ds_id),
                   disabled=text.get("disabled", account.disabled),
                   details={key: value for key, value in details.items() if value is not None})


def _check(key: str, value: Any) -> None:
    if key in OWN_KEYS:
        good = OWN_KEYS[key](value)
    else:
        good = key in DETAIL_KEYS and (value is None or DETAIL_KEYS[key](value))
    if not good:
        raise ValueError(f'account entry "{key}" is unknown or has a value of the wrong type')
