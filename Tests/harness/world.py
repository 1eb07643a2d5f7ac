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
import select
import shutil
import signal
import subprocess
import sys
import tempfile

from jeepney import DBusAddress, DBusErrorResponse, MatchRule, MessageFlag, MessageType, message_bus, new_method_call
from jeepney.io.blocking import Proxy, open_dbus_connection

ROOT = pathlib.Path(__file__).resolve().parents[2]
sys.path.insert(0, str(ROOT / "IdentityServer"))
from control_client import IdentityServer  # noqa: E402

from protocol import *  # noqa: E402, F403
from protocol import INTERFACE, OBJECT, PASSWORD_SERVICE, SERVICE, STATUS  # noqa: E402

ACCOUNT = "jane.roe@example.com"
PASSWORD = "correct horse"
OTHER_ACCOUNT = "john.doe@example.com"
OTHER_PASSWORD = "battery staple"

BUS_CONFIGURATION = """<!DOCTYPE busconfig PUBLIC "-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig>
  <type>session</type>
  <listen>unix:path={folder}/bus</listen>
  <auth>EXTERNAL</auth>
  <servicedir>{folder}/services</servicedir>
  <policy context="default">
    <allow user="*"/>
    <allow send_destination="*" eavesdrop="true"/>
    <allow eavesdrop="true"/>
    <allow own="*"/>
  </policy>
  <limit name="max_message_size">134217728</limit>
</busconfig>
"""


def hashed(password: str) -> str:
    return hashlib.sha256(password.encode()).hexdigest()


def agent_program() -> str:
    return os.environ["VELTOID_AGENT"]


def variant(value):
    """A Python value as a (signature, value) pair in the wire form of the service."""
    if isinstance(value, tuple):
        return value
    if isinstance(value, bool):
        return "b", value
    if isinstance(value, int):
        return "x", value
    if isinstance(value, float):
        return "d", value
    if isinstance(value, str):
        return "s", value
    if isinstance(value, bytes):
        return "ay", value
    if isinstance(value, dict):
        return "a{sv}", {key: variant(entry) for key, entry in value.items()}
    return "av", [variant(entry) for entry in value]


def plain(pair):
    """The Python value of a (signature, value) pair."""
    signature, value = pair
    if signature == "(d)":
        return {"date": value[0]}
    if signature == "a{sv}":
        return {key: plain(entry) for key, entry in value.items()}
    if signature == "av":
        return [plain(entry) for entry in value]
    return value


class BusError(Exception):
    def __init__(self, name: str, text: str):
        super().__init__(f"{name}: {text}")
        self.name = name


class Client:
    """One connection to the bus: one client of the agent."""

    def __init__(self, address: str, service: str = SERVICE, starts_agent: bool = True):
        self.connection = open_dbus_connection(bus=address)
        self.flags = MessageFlag(0) if starts_agent else MessageFlag.no_auto_start
        self.peer = DBusAddress(OBJECT, bus_name=service, interface=INTERFACE)

    def send(self, body: tuple, signature: str = "a{sv}", timeout: float = 30):
        message = new_method_call(self.peer, "Send", signature, body)
        message.header.flags |= self.flags
        reply = self.connection.send_and_get_reply(message, timeout=timeout)
        if reply.header.message_type == MessageType.error:
            raise BusError(reply.header.fields[4], str(reply.body))
        return plain(("a{sv}", reply.body[0]))

    def call(self, command: int | None, timeout: float = 30, **arguments):
        request = {} if command is None else {"command": command}
        request.update({key.replace("__", "-"): value for key, value in arguments.items()})
        return self.send((variant(request)[1],), timeout=timeout)

    def post(self, command: int, **arguments):
        """Sends without waiting for the reply."""
        message = new_method_call(self.peer, "Send", "a{sv}", (variant({"command": command, **arguments})[1],))
        self.connection.send(message)

    def close(self):
        self.connection.close()

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.close()


class NameOwner:
    """Follows who owns a name, without making the bus start anybody. Misses no change between two waits."""

    def __init__(self, address: str, name: str = SERVICE):
        self.connection = open_dbus_connection(bus=address)
        rule = MatchRule(type="signal", sender="org.freedesktop.DBus", member="NameOwnerChanged")
        rule.add_arg_condition(0, name)
        Proxy(message_bus, self.connection).AddMatch(rule)
        self.changes = self.connection.filter(rule, bufsize=10000)
        self.queue = self.changes.__enter__()
        self.owned = bool(Proxy(message_bus, self.connection).NameHasOwner(name)[0])
        self.owners_gone = 0

    def wait(self, owned: bool = True, timeout: float = 20):
        """Blocks until somebody, or nobody, owns the name; TimeoutError when that does not come."""
        while self.owned != owned:
            self.owned = self.connection.recv_until_filtered(self.queue, timeout=timeout).body[2] != ""
            self.owners_gone += not self.owned

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.changes.__exit__(None, None, None)
        self.connection.close()


def complaint_of_a_sanitizer(log: str) -> str | None:
    """The agent's process is not the test's: what a sanitizer has to say about it stands in its log."""
    for mark in ("ThreadSanitizer", "AddressSanitizer", "runtime error:"):
        if mark in log:
            return log[max(log.index(mark) - 100, 0):][:4000]
    return None


class Bus:
    """A private message bus that can start the agent."""

    def __init__(self, folder: pathlib.Path, agent_environment: dict[str, str], agent_arguments: list[str]):
        self.folder = folder
        services = folder / "services"
        services.mkdir()
        command = " ".join([agent_program(), *agent_arguments])
        for name in (SERVICE, PASSWORD_SERVICE):
            (services / f"{name}.service").write_text(f"[D-BUS Service]\nName={name}\nExec={command}\n")
        (folder / "bus.conf").write_text(BUS_CONFIGURATION.format(folder=folder))
        self.address = f"unix:path={folder}/bus"
        self.log = open(folder / "agent.log", "ab")
        self.process = subprocess.Popen(
            ["dbus-daemon", f"--config-file={folder}/bus.conf", "--nofork", "--print-address"],
            env={**os.environ, **agent_environment, "DBUS_SESSION_BUS_ADDRESS": self.address},
            stdout=subprocess.PIPE, stderr=self.log)
        assert self.process.stdout.readline(), "the bus did not start"

    def stop(self):
        self.process.terminate()
        self.process.wait()
        self.process.stdout.close()
        self.log.close()


class World:
    """Bus, identity server and agent; a context manager."""

    def __init__(self, *agent_arguments: str, server: bool = True, environment: dict[str, str] | None = None):
        self.folder = pathlib.Path(tempfile.mkdtemp(prefix="veltoid-"))
        self.server = IdentityServer(self.folder / "server").start() if server else None
        self.environment = {"XDG_STATE_HOME": str(self.folder / "state"), "XDG_RUNTIME_DIR": str(self.folder),
                            "XDG_CONFIG_HOME": str(self.folder / "config"), **(environment or {})}
        arguments = ["--authentication", "--checkpassword", *agent_arguments]
        if self.server:
            self.environment["SSL_CERT_FILE"] = str(self.server.authority)
            self.trust_identity_authority()
            arguments.append(f"ServerURL={self.server.url}")
        self.arguments = arguments
        self.bus = Bus(self.folder, self.environment, arguments)
        self.agent: subprocess.Popen | None = None

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.stop_agent()
        self.end_agent_of_the_bus()
        self.bus.stop()
        if self.server:
            self.server.stop()
        complaint = complaint_of_a_sanitizer(self.log_text())
        shutil.rmtree(self.folder, ignore_errors=True)
        if complaint:
            raise AssertionError(complaint)

    def trust_identity_authority(self):
        """Makes the server's authority the one that client certificates are evaluated against."""
        file = self.folder / "config" / "harbwell" / "identity-authority.pem"
        file.parent.mkdir(parents=True)
        shutil.copy(self.server.authority, file)

    def client(self, service: str = SERVICE, starts_agent: bool = True) -> Client:
        return Client(self.bus.address, service, starts_agent)

    def start_agent(self, *more: str, environment: dict[str, str] | None = None) -> subprocess.Popen:
        """Starts the agent by hand and returns when it answers. The bus may need a moment to see that the last is gone."""
        self.wait_for_name(owned=False)
        self.agent = subprocess.Popen(
            [agent_program(), *self.arguments, *more], stdout=subprocess.PIPE, stderr=self.bus.log,
            env={**os.environ, **self.environment, "DBUS_SESSION_BUS_ADDRESS": self.bus.address,
                 **(environment or {})})
        self.wait_for_name()
        return self.agent

    def wait_for_name(self, owned: bool = True):
        """Blocks until somebody, or nobody, owns the service's name, without making the bus start anybody."""
        with NameOwner(self.bus.address) as owner:
            owner.wait(owned)

    def agent_pid(self) -> int:
        with self.client() as client:
            return client.call(STATUS)["status"]["pid"]

    def stop_agent(self, how: int = signal.SIGTERM) -> int | None:
        if self.agent is None:
            return None
        if self.agent.poll() is None:
            self.agent.send_signal(how)
        status = self.agent.wait()
        self.agent.stdout.close()
        self.agent = None
        return status

    def end_agent_of_the_bus(self):
        """Ends the agent that the bus has started, if any, and returns when it is gone: it writes files on its way."""
        with contextlib.closing(open_dbus_connection(bus=self.bus.address)) as connection:
            try:
                process = os.pidfd_open(Proxy(message_bus, connection).GetConnectionUnixProcessID(SERVICE)[0])
            except (DBusErrorResponse, ProcessLookupError):
                return  # there is none, or it has just left
        with contextlib.suppress(ProcessLookupError):
            signal.pidfd_send_signal(process, signal.SIGTERM)
        select.select([process], [], [], 15)
        os.close(process)

    def log_text(self) -> str:
        return (self.folder / "agent.log").read_text(errors="replace")

    def state_files(self) -> pathlib.Path:
        return next((self.folder / "state" / "harbwell").iterdir())

    def busctl(self, *arguments: str) -> str:
        run = subprocess.run(
            ["busctl", f"--address={self.bus.address}", *arguments], capture_output=True, text=True, check=True)
        return run.stdout.strip()

    def busctl_send(self, *arguments: str):
        """A request made with the bus's own tool; the reply as plain data."""
        text = self.busctl("--json=short", "call", SERVICE, OBJECT, INTERFACE, "Send", "a{sv}", *arguments)
        return {key: plain_json(value) for key, value in json.loads(text)["data"][0].items()}


def plain_json(entry):
    """The plain value of busctl's {"type": ..., "data": ...}."""
    kind, value = entry["type"], entry["data"]
    if kind == "a{sv}":
        return {key: plain_json(inner) for key, inner in value.items()}
    if kind == "av":
        return [plain_json(inner) for inner in value]
    return value


__all__ = [name for name in dir() if not name.startswith("_")]
