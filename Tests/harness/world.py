"""A world of its own for demo, tests and benchmarks: a private bus, the development identity server, and the agent.

Everything lives in one temporary folder and is gone afterwards. The agent is started by the bus when it is first spoken
to, like in real life, or by hand.
"""

from __future__ import annotations

import contextlib
import hashlib
import json
import os
import pathlib
import re
import select
import shutil
import signal
import sqlite3
import subprocess
import sys
import tempfile
import time

from jeepney import DBusAddress, MatchRule, MessageFlag, new_method_call
from jeepney import DBusErrorResponse as BusError
from jeepney.io.blocking import open_dbus_connection
from jeepney.wrappers import unwrap_msg

from harness.protocol import *  # noqa: F403
from harness.protocol import ADD, INTERFACE, OBJECT, PASSWORD_SERVICE, SERVICE, STATUS, VERIFY

ROOT = pathlib.Path(__file__).resolve().parents[2]
sys.path.insert(0, str(ROOT / "IdentityServer"))
from control_client import IdentityServer  # noqa: E402
from openssl_program import openssl  # noqa: E402, F401

ACCOUNT = "jane.roe@example.com"
PASSWORD = "correct horse"
OTHER_ACCOUNT = "john.doe@example.com"
OTHER_PASSWORD = "battery staple"

# From accounts and certificate entries into the keychain.
REFERENCES = ("HashedPasswordRef", "CertificateReference", "CertificatePrivateKeyReference",
              "IntermediateCertificateReference")

BUS_CONFIGURATION = """<busconfig>
  <type>session</type>
  <listen>{listen}</listen>
  <auth>EXTERNAL</auth>
  <servicedir>{services}</servicedir>
  <policy context="default">
    <allow user="*"/>
    <allow send_destination="*" eavesdrop="true"/>
    <allow eavesdrop="true"/>
    <allow own="*"/>
  </policy>
  <limit name="max_message_size">134217728</limit>
  <limit name="max_replies_per_connection">50000</limit>
</busconfig>
"""


def hashed(password: str) -> str:
    return hashlib.sha256(password.encode()).hexdigest()


def variant(value):
    """A Python value as a (signature, value) pair in the wire form of the service."""
    match value:
        case tuple():
            return value
        case dict():
            return "a{sv}", {key: variant(entry) for key, entry in value.items()}
        case list():
            return "av", [variant(entry) for entry in value]
    return {bool: "b", int: "x", float: "d", str: "s", bytes: "ay"}[type(value)], value


def plain(typed):
    """The Python value of a (signature, value) pair, or of {"type": signature, "data": value}."""
    signature, value = typed.values() if isinstance(typed, dict) else typed
    match signature:
        case "(d)":
            return {"date": value[0]}
        case "a{sv}":
            return {key: plain(entry) for key, entry in value.items()}
        case "av":
            return [plain(entry) for entry in value]
    return value


def busctl_send(address: str, *, service: str = SERVICE, prefix: tuple[str, ...] = (), **request):
    """A request made with the bus's own tool; the reply as plain data. CalledProcessError when the tool fails."""
    entries = [str(part) for key, value in request.items() for part in (key, *variant(value))]
    run = subprocess.run([*prefix, "busctl", f"--address={address}", "--json=short", "call", service, OBJECT, INTERFACE,
                          "Send", "a{sv}", str(len(request)), *entries], capture_output=True, text=True, check=True)
    return plain(("a{sv}", json.loads(run.stdout)["data"][0]))


def wait_until(condition, seconds: float, what: str):
    deadline = time.monotonic() + seconds
    while not condition():
        assert time.monotonic() < deadline, what
        time.sleep(0.01)


def execute(file: pathlib.Path, statement: str) -> list[tuple]:
    """The rows that a statement finds in one of the agent's files."""
    with contextlib.closing(sqlite3.connect(file)) as database, database:
        return database.execute(statement).fetchall()


class Client(contextlib.AbstractContextManager):
    """One connection to the bus: one client of the agent."""

    def __init__(self, address: str, service: str = SERVICE, starts_agent: bool = True):
        self.connection = open_dbus_connection(bus=address)
        self.flags = MessageFlag(0) if starts_agent else MessageFlag.no_auto_start
        self.peer = DBusAddress(OBJECT, bus_name=service, interface=INTERFACE)

    def message(self, body: tuple, signature: str = "a{sv}"):
        message = new_method_call(self.peer, "Send", signature, body)
        message.header.flags |= self.flags
        return message

    def request(self, command: int | None, **arguments):
        return self.message((variant(arguments if command is None else {"command": command, **arguments})[1],))

    def reply_to(self, message, timeout: float = 30):
        return plain(("a{sv}", unwrap_msg(self.connection.send_and_get_reply(message, timeout=timeout))[0]))

    def call(self, command: int | None, timeout: float = 30, **arguments):
        return self.reply_to(self.request(command, **arguments), timeout)

    def add(self, account: str = ACCOUNT, password: str = PASSWORD, timeout: float = 30, **options):
        return self.call(ADD, timeout, VeltoID=account, hashedpassword=hashed(password), options=options)

    def verify(self, password: str = PASSWORD, **more):
        return self.call(VERIFY, VeltoID=ACCOUNT, hashedpassword=hashed(password), **more)

    def __exit__(self, *_):
        self.connection.close()


class NameOwner(contextlib.AbstractContextManager):
    """Follows who owns a name, without making the bus start anybody. Misses no change between two waits."""

    def __init__(self, address: str, name: str = SERVICE):
        self.connection = open_dbus_connection(bus=address)
        rule = MatchRule(type="signal", sender="org.freedesktop.DBus", member="NameOwnerChanged")
        rule.add_arg_condition(0, name)
        self.connection.bus_proxy.AddMatch(rule)
        self.changes = self.connection.filter(rule, bufsize=10000).queue
        self.owned = bool(self.connection.bus_proxy.NameHasOwner(name)[0])
        self.owners_gone = 0

    def wait(self, owned: bool = True, timeout: float = 20):
        """Blocks until somebody, or nobody, owns the name; TimeoutError when that does not come."""
        while self.owned != owned:
            self.owned = self.connection.recv_until_filtered(self.changes, timeout=timeout).body[2] != ""
            self.owners_gone += not self.owned

    def __exit__(self, *_):
        self.connection.close()


def complaint_of_a_sanitizer(log: str) -> str | None:
    """The agent's process is not the test's: what a sanitizer has to say about it stands in its log."""
    mark = re.search("ThreadSanitizer|AddressSanitizer|runtime error:", log)
    return mark and log[max(mark.start() - 100, 0):][:4000]


class World(contextlib.AbstractContextManager):
    """Bus, identity server and agent."""

    def __init__(self, *agent_arguments: str, server: bool = True, environment: dict[str, str] | None = None):
        self.folder = pathlib.Path(tempfile.mkdtemp(prefix="veltoid-"))
        self.server = IdentityServer(self.folder / "server").start() if server else None
        self.address = f"unix:path={self.folder}/bus"
        self.environment = {**os.environ, "XDG_STATE_HOME": str(self.folder / "state"),
                            "XDG_RUNTIME_DIR": str(self.folder), "XDG_CONFIG_HOME": str(self.folder / "config"),
                            "DBUS_SESSION_BUS_ADDRESS": self.address, **(environment or {})}
        self.command = [os.environ["VELTOID_AGENT"], "--authentication", "--checkpassword", *agent_arguments]
        if self.server:
            self.environment["SSL_CERT_FILE"] = self.server.authority
            # It is also the authority that client certificates are evaluated against.
            configuration = self.folder / "config" / "harbwell"
            configuration.mkdir(parents=True)
            shutil.copy(self.server.authority, configuration / "identity-authority.pem")
            self.command.append(f"ServerURL={self.server.url}")
        self.log = open(self.folder / "agent.log", "ab")
        self.start_bus()
        self.agent: subprocess.Popen | None = None

    def start_bus(self):
        """A bus that can start the agent."""
        services = self.folder / "services"
        services.mkdir()
        for name in (SERVICE, PASSWORD_SERVICE):
            (services / f"{name}.service").write_text(f"[D-BUS Service]\nName={name}\nExec={' '.join(self.command)}\n")
        (self.folder / "bus.conf").write_text(BUS_CONFIGURATION.format(listen=self.address, services=services))
        self.bus = subprocess.Popen(
            ["dbus-daemon", f"--config-file={self.folder}/bus.conf", "--nofork", "--print-address"],
            env=self.environment, stdout=subprocess.PIPE, stderr=self.log)
        assert self.bus.stdout.readline(), "the bus did not start"

    def __exit__(self, *_):
        self.stop_agent()
        self.end_agent_of_the_bus()
        with self.bus, self.log:
            self.bus.terminate()
        if self.server:
            self.server.stop()
        complaint = complaint_of_a_sanitizer(self.log_text())
        shutil.rmtree(self.folder, ignore_errors=True)
        assert not complaint, complaint

    def client(self, service: str = SERVICE, starts_agent: bool = True) -> Client:
        return Client(self.address, service, starts_agent)

    def start_agent(self) -> subprocess.Popen:
        """By hand; returns when it answers. The bus may need a moment to see that the one before is gone."""
        with NameOwner(self.address) as owner:
            owner.wait(False)
            self.agent = subprocess.Popen(self.command, stdout=subprocess.DEVNULL, stderr=self.log,
                                          env=self.environment)
            owner.wait(True)
        return self.agent

    @contextlib.contextmanager
    def running_agent(self):
        """A client of an agent that is started by hand and, unless it has left by then, asked to end."""
        self.start_agent()
        try:
            with self.client(starts_agent=False) as client:
                yield client
        finally:
            status = self.stop_agent()
        assert status == 0, status

    def agent_pid(self) -> int:
        with self.client() as client:
            return client.call(STATUS)["status"]["pid"]

    def stop_agent(self, how: int = signal.SIGTERM) -> int | None:
        agent, self.agent = self.agent, None
        if agent is None:
            return None
        agent.send_signal(how)
        return agent.wait()

    def end_agent_of_the_bus(self):
        """Ends the agent that the bus has started, if any, and returns when it is gone: it writes files on its way."""
        with open_dbus_connection(bus=self.address) as connection:
            try:
                process = os.pidfd_open(connection.bus_proxy.GetConnectionUnixProcessID(SERVICE)[0])
            except (BusError, ProcessLookupError):
                return  # there is none, or it has just left
        with contextlib.suppress(ProcessLookupError):
            signal.pidfd_send_signal(process, signal.SIGTERM)
        select.select([process], [], [], 15)
        os.close(process)

    def log_text(self) -> str:
        return (self.folder / "agent.log").read_text(errors="replace")

    def state_files(self) -> pathlib.Path:
        return next((self.folder / "state" / "harbwell").iterdir())

    def keychain_items(self) -> dict:
        """Class by reference."""
        return dict(execute(self.state_files() / "keychain.db", "SELECT id, class FROM items"))

    def loose_ends(self, contents: dict) -> set:
        """Items of the keychain that are not referred to, and references that lead to none."""
        return references(contents) ^ self.keychain_items().keys()


def references(contents: dict) -> set:
    """The items of the keychain that a database refers to."""
    holders = [*contents["Accounts"].values(), *contents["AuthCertificates"].values()]
    return {holder[key] for holder in holders for key in REFERENCES if key in holder}
