"""The story that scripts/demo tells; the parts come from the end-to-end tests."""

from __future__ import annotations

import os
import pathlib
import select
import shlex
import signal
import subprocess
import sys
import textwrap

ROOT = pathlib.Path(__file__).resolve().parent.parent
BUILD = ROOT / "build" / "release"
os.environ.setdefault("VELTOID_AGENT", str(BUILD / "VeltoIDAuthentication" / "VeltoIDAuthd" / "veltoidauthd"))
sys.path.insert(0, str(ROOT / "Tests"))
from harness.world import ACCOUNT, INTERFACE, OBJECT, OTHER_ACCOUNT, PASSWORD, SERVICE, World  # noqa: E402


def say(text: str):
    print("\n" + textwrap.fill(text, 96), flush=True)


def serial_of(shown: str) -> str:
    return next(line.split()[1] for line in shown.splitlines() if line.strip().startswith("serial:"))


class Story:
    def __init__(self, world: World):
        self.world = world

    def run(self, *command: str, stdin: str | None = None, expected: int | None = 0,
            shown: str | None = None) -> str:
        """Runs a command as a person would, prints what it prints, and insists on its exit status (None: any but 0)."""
        print(f"\n    $ {shown or shlex.join(command)}", flush=True)
        program = str(BUILD / "veltoidctl" / "veltoidctl") if command[0] == "veltoidctl" else command[0]
        result = subprocess.run([program, *command[1:]], input=stdin, text=True, stdout=subprocess.PIPE,
                                stderr=subprocess.STDOUT, check=False,
                                env={**os.environ, **self.world.environment,
                                     "DBUS_SESSION_BUS_ADDRESS": self.world.address})
        print(textwrap.indent(result.stdout.rstrip(), "    "), flush=True)
        if result.returncode != expected and (expected is not None or result.returncode == 0):
            sys.exit(f"demo: expected exit status {expected}, got {result.returncode}")
        return result.stdout

    def insist(self, text: str, *parts: str):
        for part in parts:
            if part not in text:
                sys.exit(f"demo: expected to see {part!r}")

    @staticmethod
    def end(pid: int):
        """Ends a process that is not our child, and returns when it is gone."""
        process = os.pidfd_open(pid)
        os.kill(pid, signal.SIGTERM)
        select.select([process], [], [], 15)
        os.close(process)

    def with_password(self, *command: str, password: str = PASSWORD, expected: int = 0) -> str:
        return self.run(*command, "--password-stdin", stdin=password + "\n", expected=expected,
                        shown=f"echo {password!r} | {shlex.join(command)} --password-stdin")

    def tell(self):
        self.tell_of_the_account()
        self.tell_of_the_certificate()
        self.tell_of_people()
        self.tell_of_the_agents_own_doing()
        self.tell_of_the_end()

    def tell_of_the_account(self):
        world, url = self.world, self.world.server.url
        say(f"A message bus of our own is up, and beside it an identity server at {url}: a separate program in Python "
            "that answers XML-RPC over TLS with a certificate of its own test authority. The agent is not running: the "
            "bus starts it with the first message. Any D-Bus client will do, here the bus's own tool:")
        self.run("busctl", f"--address={world.address}", "call", SERVICE, OBJECT, INTERFACE, "Send", "a{sv}", "1",
                 "command", "x", "1", shown=f"busctl --user call {SERVICE} {OBJECT} {INTERFACE} Send 'a{{sv}}' 1 command x 1")

        say("That was a ping. Now an account. The password is hashed by the client, so the agent never sees it; the agent "
            "puts the hash into its keychain, signs in, and learns the account's directory identifier (encDsId).")
        self.insist(self.with_password("veltoidctl", "add", ACCOUNT), "signed in as")
        details = self.run("veltoidctl", "info", ACCOUNT)
        self.insist(details, "Jane", "Roe", ACCOUNT, "jane@roe.example", "encDsId")
        self.insist(self.run("veltoidctl", "status"), "next action")
        counts = world.server.counts()
        sent = world.server.received()[0]["parameters"]["pwdHash"]
        say(f"The server has seen {counts['authenticate']} sign-ins and {counts['getMyInfo']} requests for details. It was "
            f"sent the hash {sent[:12]}..., never the password.")

        say("The agent is now ended, as it would be at log-out, and started again by the next message. Account, details "
            "and password are still there: the refresh signs in with the stored hash.")
        before = world.agent_pid()
        self.end(before)
        self.insist(self.run("veltoidctl", "list"), ACCOUNT)
        self.insist(self.run("veltoidctl", "info", ACCOUNT, "--refresh"), "Jane", "Roe")
        after = world.agent_pid()
        if before == after:
            sys.exit("demo: the agent was not restarted")
        print(f"\n    (process {before} before, {after} now)")

    def tell_of_the_certificate(self):
        world = self.world
        say("Others need not take the account's word for anything: the agent makes a key, asks the server for a certificate "
            "of it, and keeps both. The key never leaves this machine.")
        self.insist(self.with_password("veltoidctl", "add", ACCOUNT, "--certificate"), "it has a certificate")
        self.insist(self.run("veltoidctl", "certificate", ACCOUNT), f"CN={ACCOUNT}", "CERT_ISSUED", "next renewal")
        self.insist(self.run("veltoidctl", "status"), "CertificateAssumedOK")
        certificate, identity = str(world.folder / "jane.pem"), str(world.folder / "jane-with-key.pem")
        pathlib.Path(certificate).write_text(self.run("veltoidctl", "certificate", ACCOUNT, "--pem"))
        verified = self.run("openssl", "verify", "-purpose", "sslclient", "-CAfile", world.server.authority, "-untrusted",
                            world.server.intermediate, certificate)
        self.insist(verified, f"{certificate}: OK")

        say("Any TLS client can prove with it whose it is. Here curl shows it to a page of the server that lets nobody in "
            "without one and tells what it has seen; without the certificate there is no connection.")
        self.run("veltoidctl", "certificate", "export", ACCOUNT, "--pem", identity)
        page = ("curl", "--silent", "--show-error", "--cacert", world.server.authority)
        self.insist(self.run(*page, "--cert", identity, world.server.client_certificate_url), f"CN={ACCOUNT}")
        self.run(*page, world.server.client_certificate_url, expected=None)

    def tell_of_people(self):
        world = self.world
        say("The server also knows other people. Who was found once is known without it; and small pieces of data can be "
            "left with it, such as what one device has to tell another.")
        self.insist(self.run("veltoidctl", "find", "VeltoID", OTHER_ACCOUNT), "John", "Doe")
        self.insist(self.run("veltoidctl", "find", "VeltoID", OTHER_ACCOUNT, "--cached"), "John", "Doe")
        note = world.folder / "note"
        note.write_text("to whom it may concern\n")
        self.with_password("veltoidctl", "breadcrumb", "set", ACCOUNT, "note", "--input", str(note))
        self.insist(self.with_password("veltoidctl", "breadcrumb", "get", ACCOUNT, "note"), note.read_text())

    def tell_of_the_agents_own_doing(self):
        server = self.world.server
        say("So far everything was asked for. Now the account is forgotten and added again, nobody asks for a certificate, "
            "and the server has started to issue them for two minutes only: the agent's account check gets one by itself, "
            "which the client waits for, and replaces it when three quarters of its time are over. This takes a minute and "
            "a half.")
        self.run("veltoidctl", "forget", ACCOUNT)
        server.settings(certificateLifetime=120)
        self.insist(self.with_password("veltoidctl", "add", ACCOUNT, "--wait", "60"), "it has a certificate")
        self.insist(self.run("veltoidctl", "status", "--check"), "CertificateOK")
        first = self.run("veltoidctl", "certificate", ACCOUNT)
        requests = server.counts()["createCert"]
        if not server.wait("createCert", requests + 1, 110):
            sys.exit("demo: the certificate was not renewed")
        # The next pass asks the server about the new certificate.
        server.wait("getMyInfo", server.counts()["getMyInfo"] + 1, 20)
        second = self.run("veltoidctl", "certificate", ACCOUNT)
        if serial_of(first) == serial_of(second):
            sys.exit("demo: the certificate is still the same")
        server.reset_settings()

    def tell_of_the_end(self):
        world = self.world
        say("A wrong password is refused by the server, and told apart from a server that cannot be reached. The server "
            "has spoken against the account, so the stored password goes too: the account needs its owner.")
        refused = self.with_password("veltoidctl", "verify", ACCOUNT, password="wrong horse", expected=1)
        self.insist(refused, "-101")
        self.insist(self.run("veltoidctl", "status"), "PasswordInvalid")

        say("Finally the account is forgotten, with its password, key and certificate and everything known of it.")
        self.run("veltoidctl", "forget", ACCOUNT)
        self.insist(self.run("veltoidctl", "list"), "no accounts")
        files = sorted(file.name for file in world.state_files().iterdir())
        say(f"All of it lived in a temporary folder ({', '.join(files)}), which is removed now together with the bus, the "
            "server and the agent.")


def main():
    with World() as world:
        Story(world).tell()
    print("\ndemo: done", flush=True)


if __name__ == "__main__":
    main()
