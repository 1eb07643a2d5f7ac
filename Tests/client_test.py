"""The command-line client against the real agent."""

from __future__ import annotations

import json
import os
import pty
import subprocess
import pathlib
import sys
import unittest

sys.path.insert(0, str(pathlib.Path(__file__).resolve().parent.parent / "scripts"))
from world import ACCOUNT, PASSWORD, World, hashed  # noqa: E402


def client_program() -> str:
    return os.environ["VELTOID_CLIENT"]


class CommandLine(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.world = World()

    @classmethod
    def tearDownClass(cls):
        cls.world.__exit__()

    def run_client(self, *arguments, stdin="", address=None):
        environment = {**os.environ, "DBUS_SESSION_BUS_ADDRESS": address or self.world.bus.address}
        return subprocess.run([client_program(), *arguments], input=stdin, text=True, capture_output=True,
                              env=environment, check=False, timeout=60)

    def test_an_account_s_life_ends_with_the_right_statuses(self):
        steps = [
            (["ping"], "", 0, "the agent answers"),
            (["list"], "", 0, "no accounts"),
            (["info", ACCOUNT], "", 1, "no such account on this device (HWIdentityErrorDomain -108)"),
            (["forget", ACCOUNT], "", 1, "-108"),
            (["add", ACCOUNT, "--password-stdin"], "wrong\n", 1, "could not be signed in"),
            (["add", ACCOUNT.upper(), "--password-stdin"], PASSWORD + "\r\n", 0, "signed in as"),
            (["verify", ACCOUNT, "--hashed-password-stdin"], hashed(PASSWORD), 0, "accepts the password"),
            (["list"], "", 0, ACCOUNT),
            (["info"], "", 0, "jane@roe.example"),
            (["status"], "", 0, "NoCertificate"),
            (["database"], "", 0, "AccessorVersions"),
            (["verify", ACCOUNT, "--password-stdin"], "wrong", 1, "The Velto ID account or password are incorrect."),
            (["status"], "", 0, "PasswordInvalid"),
            (["forget", ACCOUNT], "", 0, "is forgotten"),
        ]
        for arguments, stdin, status, text in steps:
            with self.subTest(arguments):
                run = self.run_client(*arguments, stdin=stdin)
                self.assertEqual(run.returncode, status, run.stderr)
                self.assertIn(text, run.stdout + run.stderr)

    def test_json_is_the_whole_reply_of_every_command(self):
        for command in (["ping"], ["list"], ["status"], ["database"], ["info", "nobody"], ["forget", "nobody"]):
            with self.subTest(command):
                self.assertIn("success", json.loads(self.run_client("--json", *command).stdout))
                self.assertIn("success", json.loads(self.run_client(*command, "--json").stdout))

    def test_wrong_use_is_explained(self):
        cases = [
            ([], "", 2, "A subcommand is required"),
            (["dance"], "", 2, "subcommand"),
            (["add"], "", 2, "NAME is required"),
            (["add", "x", "--password-stdin"], "", 1, "there is no password"),
            (["add", "x", "--password-stdin", "--hashed-password-stdin"], "", 2, "excludes"),
            (["--timeout", "0", "ping"], "", 2, "timeout"),
            (["--service", "no.such.agent", "ping"], "", 3, "not installed on this bus"),
        ]
        for arguments, stdin, status, text in cases:
            with self.subTest(arguments):
                run = self.run_client(*arguments, stdin=stdin)
                self.assertEqual(run.returncode, status)
                self.assertIn(text, run.stdout + run.stderr)
        self.assertEqual(self.run_client("ping", address="unix:path=/nowhere/bus").returncode, 3)

    def test_the_password_is_asked_for_without_echo(self):
        pid, terminal = pty.fork()
        if pid == 0:
            os.environ["DBUS_SESSION_BUS_ADDRESS"] = self.world.bus.address
            os.execl(client_program(), "veltoidctl", "verify", ACCOUNT)
        shown = b""
        while b"Password for" not in shown:
            shown += os.read(terminal, 1024)
        os.write(terminal, PASSWORD.encode() + b"\n")
        try:
            while chunk := os.read(terminal, 1024):
                shown += chunk
        except OSError:  # the terminal ends with its last user
            pass
        os.close(terminal)
        self.assertEqual(os.waitstatus_to_exitcode(os.waitpid(pid, 0)[1]), 0, shown)
        self.assertNotIn(PASSWORD.encode(), shown)


if __name__ == "__main__":
    unittest.main()
