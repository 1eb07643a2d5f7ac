"""Clients that keep the agent busy, each in a process of its own, and what they find out about its replies."""

from __future__ import annotations

import contextlib
import random
import select
import struct
import time
from collections import Counter, defaultdict, deque
from dataclasses import dataclass, field

from jeepney import HeaderFields, MessageType

from harness.world import (ACCOUNT, ADD, CERTIFICATE, CHECK, DATABASE, FIND, FIND_CACHED, FORGET, GET_BREADCRUMB, INFO,
                           LIST, OTHER_ACCOUNT, OTHER_PASSWORD, PASSWORD, PASSWORD_SERVICE, PING, SERVICE,
                           SET_BREADCRUMB, SET_VALUE, SET_VALUE_QUIETLY, STATUS, UPDATE_LINKED_IDENTITY, VERIFY, Client,
                           hashed, plain)

UNKNOWN_COMMAND = 0x121
PASSWORDS = {ACCOUNT: PASSWORD, OTHER_ACCOUNT: OTHER_PASSWORD, "kim@example.com": "a third one"}
WAITING_ACCOUNT = "waiting@example.com"
PASSWORD_CLIENTS = 6

LONGEST_BATCH = 8
LONGEST_PAUSE = 0.4
LONGEST_WAIT = 30  # for the certificate

# Longer than anything takes: who waits so long for a reply has lost it.
PATIENCE = 120

# So far may the flood be ahead of the agent. The bus looks through all the calls without reply for each message: with
# many more of them it is the bus that everybody waits for.
MOST_UNANSWERED = 1_000
BURST = 20

# In a message.
SERIAL_AT = 8
REPLY_SERIAL_FIELD = b"\x05\x01u\0"


@dataclass(frozen=True)
class Timetable:
    """Moments of the monotonic clock, which all processes share."""
    begin: float
    calm: float
    rush: float
    end: float

    def phase(self, moment: float) -> str:
        return "rush" if moment >= self.rush else "calm" if moment >= self.calm else "start"


@dataclass
class Findings:
    """What a client tells of its run. Pings are in microseconds, by phase."""
    troubles: list[str] = field(default_factory=list)
    answered: Counter = field(default_factory=Counter)
    succeeded: Counter = field(default_factory=Counter)
    pings: dict[str, list[float]] = field(default_factory=lambda: defaultdict(list))
    stored: dict[str, int] = field(default_factory=dict)


def sleep_until(moment: float):
    time.sleep(max(moment - time.monotonic(), 0))


class Conversation(Client):
    """A client that asks ahead. Replies have to come in the order of the requests."""

    def __init__(self, address: str, service: str = SERVICE):
        super().__init__(address, service, starts_agent=False)
        self.awaited: deque = deque()
        self.findings = Findings()

    def serialised(self, command: int | None, **arguments) -> tuple[int, bytes]:
        serial = next(self.connection.outgoing_serial)
        return serial, self.request(command, **arguments).serialise(serial=serial)

    def ask(self, name: str, check, command: int | None, **arguments):
        serial, data = self.serialised(command, **arguments)
        self.awaited.append((serial, name, check))
        self.connection.sock.sendall(data)

    def take(self) -> int:
        """The next reply, which has to answer the oldest request and pass its check; the agent's number for it."""
        serial, name, check = self.awaited.popleft()
        message = self.receive(name)
        answers = message.header.fields[HeaderFields.reply_serial]
        later = [other for number, other, _ in self.awaited if number == answers]
        assert answers == serial, f"{name}: " + (f"overtaken by a later {later[0]}" if later else "a second reply came")
        failure = message.header.fields.get(HeaderFields.error_name)
        assert failure is None, f"{name}: {failure} {message.body}"
        reply = plain(("a{sv}", message.body[0]))
        self.findings.answered[name] += 1
        self.findings.succeeded[name] += reply["success"]
        assert check(reply), f"{name}: the reply is {reply}"
        return message.header.serial

    def receive(self, name: str):
        """The next message that is not one of the bus's own."""
        try:
            while (message := self.connection.receive(timeout=PATIENCE)).header.message_type == MessageType.signal:
                pass
        except TimeoutError:
            raise AssertionError(f"{name}: no reply") from None
        return message

    def take_all(self):
        while self.awaited:
            self.take()

    def time_ping(self) -> float:
        """Microseconds from the request to its reply, with nothing else under way."""
        start = time.perf_counter()
        self.ask("ping", is_success, PING)
        self.take()
        return (time.perf_counter() - start) * 1e6

    def finish(self):
        """Nothing may come that was not asked for."""
        self.take_all()
        self.time_ping()
        with contextlib.suppress(TimeoutError):
            raise AssertionError(f"nobody asked for {self.connection.receive(timeout=0)}")


# --- What a reply may be

def is_success(reply) -> bool:
    return reply == {"success": True}


def is_refusal(reply) -> bool:
    return reply == {"success": False}


def is_error(reply) -> bool:
    return not reply["success"] and set(reply) == {"success", "error"} and "Code" in reply["error"]


def success_with(test):
    """A success that passes the test, or an error: others use the same accounts, and the server has much to do."""
    return lambda reply: test(reply) if reply["success"] else is_error(reply)


def anything(reply) -> bool:
    return isinstance(reply["success"], bool)


# --- Clients

class Mixer:
    """Asks for one thing and another. Where a command allows it, the reply tells which request it belongs to."""

    def __init__(self, conversation: Conversation, number: int, agent: int):
        self.conversation, self.number, self.agent = conversation, number, agent
        self.ask = conversation.ask
        self.rng = random.Random(number)
        self.key = f"client {number}"
        self.value: int | None = None

    def run(self, timetable: Timetable):
        findings = self.conversation.findings
        kinds, weights = zip(*self.KINDS)
        # All together begin with everything.
        batch = [kinds[self.number % len(kinds)]]
        while True:
            time.sleep(self.rng.random() * LONGEST_PAUSE)
            now = time.monotonic()
            if now >= timetable.end:
                break
            for kind in batch:
                kind(self)
            self.conversation.take_all()
            findings.pings[timetable.phase(now)].append(self.conversation.time_ping())
            batch = self.rng.choices(kinds, weights, k=self.rng.randint(1, LONGEST_BATCH))
        if self.value is not None:
            findings.stored[self.key] = self.value

    def someone(self) -> str:
        return self.rng.choice(list(PASSWORDS))

    def signed_in(self) -> dict:
        account = self.someone()
        return {"VeltoID": account, "hashedpassword": hashed(PASSWORDS[account])}

    def ping(self):
        self.ask("ping", is_success, PING)

    def unknown(self):
        self.ask("unknown", is_refusal, self.rng.choice((UNKNOWN_COMMAND, 0, 2**40, None)))

    def set_value(self):
        name, command = self.rng.choices((("set", SET_VALUE), ("set quietly", SET_VALUE_QUIETLY)), (3, 2))[0]
        self.value = (self.value or 0) + 1
        self.ask(name, is_success, command, domain="MetaInfo", key=self.key, value=self.value)

    def set_nothing(self):
        self.ask("set nothing", is_refusal, SET_VALUE, domain="Nowhere", key=self.key, value=1)

    def contents(self):
        value = self.value
        self.ask("contents", lambda reply: reply["result"]["MetaInfo"].get(self.key) == value, DATABASE)

    def names(self):
        self.ask("list", success_with(lambda reply: set(reply["result"]) <= {*PASSWORDS, WAITING_ACCOUNT}), LIST)

    def status(self):
        self.ask("status", lambda reply: reply["status"]["pid"] == self.agent, STATUS)

    def check(self):
        self.ask("check", lambda reply: isinstance(reply["status"], int), CHECK, VeltoID=self.someone())

    def certificate(self):
        self.ask("certificate", success_with(lambda reply: "CertStatus" in reply["result"]), CERTIFICATE,
                 VeltoID=self.someone())

    def record(self):
        self.ask("validation record", lambda reply: is_refusal(reply) or isinstance(reply["result"], dict), CERTIFICATE,
                 VeltoID=self.someone(), CertificateType="VeltoIDValidatedItemsRecordDataCertificateType")

    def info(self):
        account = self.someone()
        self.ask("info", success_with(lambda reply: reply["info"]["VeltoID"] == account), INFO, VeltoID=account)

    def add(self):
        # Seldom with a certificate at once: to make a key takes longer than all the rest.
        how = self.rng.choices(("DoNotCheckPassword", "DoNotCreateCSR", "CreateCSRAsynchronously"), (6, 2, 1))[0]
        self.ask("add", anything, ADD, **self.signed_in(), options={how: how != "CreateCSRAsynchronously"})

    def forget(self):
        account = self.someone()
        self.ask("forget", success_with(lambda reply: reply["VeltoID"] == account), FORGET, VeltoID=account)

    def verify(self):
        self.ask("verify", success_with(is_success), VERIFY, **self.signed_in())

    def verify_wrong(self):
        self.ask("verify wrong", is_error, VERIFY, VeltoID=self.someone(), hashedpassword=hashed("wrong"))

    def find(self):
        person = self.someone()
        self.ask("find", success_with(lambda reply: [found["VeltoID"] for found in reply["result"]] == [person]), FIND,
                 **self.signed_in(), criteria={"VeltoID": [person]})

    def find_cached(self):
        person = self.someone()
        self.ask("find cached", lambda reply: is_refusal(reply) or reply["result"][0]["VeltoID"] == person, FIND_CACHED,
                 criteria={"VeltoID": [person]})

    def breadcrumb(self):
        signed_in, breadcrumb = self.signed_in(), self.rng.randbytes(20)
        is_stored = []
        self.ask("set breadcrumb", success_with(lambda reply: is_stored.append(True) or is_success(reply)),
                 SET_BREADCRUMB, **signed_in, identifier=self.key, breadcrumb=breadcrumb)
        self.ask("get breadcrumb", success_with(lambda reply: not is_stored or reply["breadcrumb"] == breadcrumb),
                 GET_BREADCRUMB, **signed_in, identifier=self.key)

    # The server is written in Python: it can be asked for less than the agent.
    KINDS = ((ping, 20), (unknown, 10), (set_value, 20), (set_nothing, 6), (contents, 6), (names, 8),
             (status, 6), (check, 8), (certificate, 4), (record, 4), (info, 4), (find_cached, 8), (add, 2), (forget, 2),
             (verify, 1), (find, 1), (breadcrumb, 1))


class PasswordMixer(Mixer):
    """The same at the password-check service."""

    def linked_identity(self):
        self.ask("linked identity", is_error, UPDATE_LINKED_IDENTITY, identityReferenceData=b"reference")

    def foreign(self):
        self.ask("unknown", is_refusal, self.rng.choice((ADD, LIST, SET_VALUE)))

    KINDS = ((Mixer.verify, 1), (Mixer.verify_wrong, 1), (linked_identity, 10), (foreign, 10), (Mixer.ping, 20))


class Flood:
    """Pings on the bare connection. All requests, and all replies, are the same but for their serials: they are
    compared as bytes, since reading a reply properly takes longer than the agent needs for giving it."""

    def __init__(self, conversation: Conversation):
        self.socket = conversation.connection.sock
        self.serials = conversation.connection.outgoing_serial
        self.findings = conversation.findings
        self.awaited: deque[int] = deque()
        self.received = b""
        conversation.time_ping()  # whatever else the bus has to say comes before its reply
        serial, request = conversation.serialised(PING)
        self.request = request[:SERIAL_AT], request[SERIAL_AT + 4:]
        self.socket.sendall(request)
        reply = self.socket.recv(4096)
        answers = reply.index(REPLY_SERIAL_FIELD + struct.pack("<I", serial)) + len(REPLY_SERIAL_FIELD)
        self.reply = struct.Struct(f"<{SERIAL_AT}s4x{answers - SERIAL_AT - 4}sI{len(reply) - answers - 4}s")
        self.head, self.middle, _, self.tail = self.reply.unpack(reply)

    def run(self, end: float):
        while time.monotonic() < end:
            serials = [next(self.serials) for _ in range(BURST)]
            self.awaited.extend(serials)
            self.socket.sendall(b"".join(struct.pack("<I", serial).join(self.request) for serial in serials))
            self.take(0)
            while len(self.awaited) > MOST_UNANSWERED - BURST:
                self.take(PATIENCE)
        while self.awaited:
            self.take(PATIENCE)

    def take(self, patience: float):
        """The replies that are there."""
        if not select.select([self.socket], [], [], patience)[0]:
            assert not patience, f"{len(self.awaited)} pings without reply"
            return
        self.received += self.socket.recv(1 << 16)
        whole = len(self.received) // self.reply.size * self.reply.size
        for head, middle, serial, tail in self.reply.iter_unpack(self.received[:whole]):
            is_next = (head, middle, serial, tail) == (self.head, self.middle, self.awaited.popleft(), self.tail)
            assert is_next, f"not the reply to the oldest ping: {self.received[:whole]}"[:1000]
            self.findings.answered["flood"] += 1
        self.received = self.received[whole:]


# --- Their processes

def converse(address: str, service: str, begin: float, what) -> Findings:
    """What goes wrong in a client's process is for the test to tell."""
    with Conversation(address, service) as conversation:
        try:
            sleep_until(begin)
            what(conversation)
            conversation.finish()
        except Exception as error:
            conversation.findings.troubles.append(f"{what.__name__} at {service}: {type(error).__name__}: {error}")
    return conversation.findings


def mix(number: int, address: str, agent: int, timetable: Timetable) -> Findings:
    def mixer(conversation: Conversation):
        kind(conversation, number, agent).run(timetable)

    kind, service = (PasswordMixer, PASSWORD_SERVICE) if number < PASSWORD_CLIENTS else (Mixer, SERVICE)
    return converse(address, service, timetable.begin, mixer)


def wait_for_certificate(address: str, timetable: Timetable) -> Findings:
    """Adds an account and waits for its certificate, again and again, with a ping behind that waits its turn."""
    def waiting(conversation: Conversation):
        while (left := timetable.end - time.monotonic()) > 0:
            # Others that add accounts put an end to this one.
            conversation.ask("waiting add", anything, ADD, VeltoID=WAITING_ACCOUNT, hashedpassword=hashed(PASSWORD),
                             options={"certwaitduration": min(left, LONGEST_WAIT)})
            conversation.ask("ping", is_success, PING)
            conversation.take_all()

    return converse(address, SERVICE, timetable.rush, waiting)


def flood(address: str, timetable: Timetable) -> Findings:
    def flooding(conversation: Conversation):
        Flood(conversation).run(timetable.end)

    return converse(address, SERVICE, timetable.rush, flooding)
