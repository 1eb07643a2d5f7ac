"""What several clients asked and were answered about accounts, and whether the answers fit together.

Each request takes effect at some moment between its begin and its end; an add that does not wait takes effect as its
reply leaves, and the agent numbers its replies. Whatever may have been so counts as right: there is no false alarm.
"""

from __future__ import annotations

from dataclasses import dataclass, field
from math import inf

WRONG_PASSWORD, DISABLED, UNKNOWN_ACCOUNT = -101, -102, -108


@dataclass
class Request:
    """A request, and its reply once that is there. `right`: it carries the right password."""
    kind: str
    name: str = ""
    right: bool = True
    arguments: dict = field(default_factory=dict)
    begin: float = 0
    end: float = inf
    serial: float = inf
    reply: dict | None = None

    def succeeded(self) -> bool:
        return self.reply is not None and self.reply["success"]

    def failed(self) -> bool:
        return self.reply is not None and not self.reply["success"]

    def code(self) -> int | None:
        return self.reply["error"].get("Code") if self.reply and "error" in self.reply else None

    def waits(self) -> bool:
        return "certwaitduration" in self.arguments.get("options", {})

    def takes(self) -> bool:
        """Has made its account the only one. A failure without an error says that there will be no certificate."""
        return self.kind == "add" and self.reply is not None and "error" not in self.reply

    def may_take(self) -> bool:
        return self.kind == "add" and (self.takes() or self.waits() or self.reply is None)

    def may_remove(self, name: str) -> bool:
        return self.may_take() if self.name != name else self.kind == "forget" and not self.failed()

    def overlaps(self, other: Request) -> bool:
        return self is not other and self.begin < other.end and other.begin < self.end

    def __str__(self):
        answer = {key: value for key, value in (self.reply or {}).items() if key in ("success", "result", "status")}
        if "AccountStatuses" in str(answer):
            answer["status"] = {name: status["AccountState"] for name, status in names_in(self).items()}
        reason = self.reply and self.reply.get("error", {}).get("UserInfo", {}).get("HWLocalizedFailureReason")
        return (f"{self.begin:.3f} to {self.end:.3f} #{self.serial}: {self.kind} {self.name} "
                f"{'' if self.right else 'wrong '}{self.arguments.get('options', '')} -> {answer} {self.code() or ''} "
                f"{reason or ''}")


def names_in(request: Request):
    return request.reply["result"] if request.kind == "list" else request.reply["status"]["AccountStatuses"]


class History:
    """From one quiet moment to the next. `refusals`: by account, the errors that the server gave for no reason."""

    def __init__(self, names: list[str], *begin: Request):
        self.names, self.requests = names, [*begin]
        self.refusals: dict[str, set[int]] = {name: set() for name in names}

    def add_of(self, name: str, moment: Request) -> Request | None:
        """The last that is known to have left the account stored, before the moment."""
        adds = [one for one in self.requests if one.takes() and one.name == name and one.end < moment.begin]
        return max(adds, key=lambda one: one.serial, default=None)

    def is_there(self, name: str, moment: Request) -> bool:
        """From begin to end, for sure."""
        add = self.add_of(name, moment)
        return add is not None and not any(
            one.may_remove(name) and one.serial > add.serial and one.begin < moment.end
            for one in self.requests if one is not moment)

    def may_be_there(self, name: str, moment: Request) -> bool:
        """At some time between begin and end."""
        return any(one.kind == "add" and one.name == name and one.begin < moment.end
                   and not any(self.removes(other, one, moment) for other in self.requests)
                   for one in self.requests)

    @staticmethod
    def removes(one: Request, add: Request, moment: Request) -> bool:
        """Whether it has, for sure, undone what the add did before it was answered."""
        if one is moment or one.end >= moment.begin:
            return False
        if one.name == add.name:
            return one.kind == "forget" and one.succeeded() and one.begin > add.end
        return one.takes() and (one.begin > add.end if one.waits() else one.serial > add.serial)

    def is_password_stored(self, name: str, moment: Request) -> bool:
        """For sure: the right one was added, and what is wrong was neither added nor said since."""
        add = self.add_of(name, moment)
        return add is not None and add.right and not self.refusals[name] and not any(
            one.kind == "add" and one.name == name and not one.right and one.end > add.begin for one in self.requests)

    def troubles(self) -> list[str]:
        answered = [one for one in self.requests if one.reply is not None]
        return [f"{complaint}: {one}" for one in answered for complaint in self.complaints(one)]

    def __str__(self):
        return "\n".join([*map(str, sorted(self.requests, key=lambda one: one.begin)), f"refusals: {self.refusals}"])

    def complaints(self, one: Request):
        match one.kind:
            case "list" | "status" if one.succeeded():
                for name in self.names:
                    if name in names_in(one) and not self.may_be_there(name, one):
                        yield f"{name} cannot be there"
                    if name not in names_in(one) and self.is_there(name, one):
                        yield f"{name} has to be there"
            case "list" | "status":
                yield "this cannot fail"
            case "forget":
                if one.succeeded() and not self.may_be_there(one.name, one):
                    yield "there was nothing to forget"
                if one.failed() and self.is_there(one.name, one):
                    yield "it was there"
            case "add":
                yield from self.complaints_about_add(one)
            case "verify" if not one.right and one.succeeded():
                yield "the password is wrong"
            case "verify" if one.code() in (WRONG_PASSWORD, DISABLED) and one.right:
                if one.code() not in self.refusals[one.name]:
                    yield "the password is right, and the server never said otherwise"
            case "info" if one.succeeded() and one.reply["info"]["VeltoID"] != one.name:
                yield "another account's information"

    def complaints_about_add(self, add: Request):
        if add.takes():
            return
        if add.code() != UNKNOWN_ACCOUNT:
            yield "an add cannot fail so"
        replaced = "replaced by another account" in str(add.reply)
        if not any(one.overlaps(add) and one.may_remove(add.name) and (one.name != add.name) == replaced
                   for one in self.requests):
            yield "nobody has removed it so meanwhile"
