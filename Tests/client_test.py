"""The command-line client against the real agent."""

from __future__ import annotations

import contextlib
import ctypes
import json
import os
import platform
import pty
import resource
import shutil
import ssl
import stat
import subprocess
import time
import unittest
import urllib.request
from unittest import mock

from harness.world import ACCOUNT, PASSWORD, STATUS, World, hashed, openssl, wait_until

PROGRAM = os.environ["VELTOID_CLIENT"]


def keyring_is_permitted() -> bool:
    """Asks the kernel itself: add_key(2) to the user keyring, which is number -4."""
    number = {"x86_64": 248, "aarch64": 217}.get(platform.machine())
    return number is not None and ctypes.CDLL(None).syscall(number, b"user", b"veltoid test", b"x", 1, -4) >= 0


class CommandLine(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.world = cls.enterClassContext(World())

    def run_client(self, *arguments, stdin="", **more):
        """What the client prints is a text if it is given one."""
        return subprocess.run([PROGRAM, *arguments], input=stdin, text=isinstance(stdin, str), capture_output=True,
                              env=self.world.environment, check=False, timeout=60, **more)

    def run_table(self, cases):
        """Runs (arguments, standard input, status, text that is printed)."""
        for arguments, stdin, status, text in cases:
            with self.subTest(arguments):
                run = self.run_client(*arguments, stdin=stdin)
                self.assertEqual(run.returncode, status, run.stderr)
                self.assertIn(text, run.stdout + run.stderr)

    def at_terminal(self, *arguments, dialogue=()):
        """Runs the client at a terminal of its own, answering (prompt, answer); returns status and what was shown."""
        pid, terminal = pty.fork()
        if pid == 0:
            os.execve(PROGRAM, ["veltoidctl", *arguments], self.world.environment)
        shown = b""
        for prompt, answer in dialogue:
            seen = len(shown)
            while prompt not in shown[seen:]:
                shown += os.read(terminal, 1024)
            os.write(terminal, answer.encode() + b"\n")
        with contextlib.suppress(OSError):  # the terminal ends with its last user
            while chunk := os.read(terminal, 1024):
                shown += chunk
        os.close(terminal)
        return os.waitstatus_to_exitcode(os.waitpid(pid, 0)[1]), shown

    def add_account(self, *more, issuance="at-once"):
        """Adds the account until the test ends."""
        self.world.server.settings(issuance=issuance)
        self.addCleanup(self.world.server.reset_settings)
        self.addCleanup(self.run_client, "forget", ACCOUNT)
        return self.run_client("add", ACCOUNT, "--password-stdin", *more, stdin=PASSWORD)

    def new_folder(self):
        folder = self.world.folder / self.id()
        folder.mkdir()
        self.addCleanup(shutil.rmtree, folder)
        return folder

    def test_an_account_s_life_ends_with_the_right_statuses(self):
        self.run_table([
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
            (["status"], "", 0, "NoCertificate"),
            (["forget", ACCOUNT], "", 0, "is forgotten")])

    def test_a_keychain_that_is_not_the_accounts_is_shown_until_it_is_back(self):
        self.add_account("--certificate")
        file, kept = (self.world.state_files() / name for name in ("keychain.db", "kept.db"))
        file.rename(kept)
        strange, forget = (["status"], "", 0, "not the one of the stored accounts"), ["forget", ACCOUNT]
        self.run_table([strange, (["info", ACCOUNT], "", 0, "jane@roe.example"),
                        (["status", "--check"], "", 0, "PasswordInaccessibleInKeychain")])
        kept.rename(file)
        self.run_table([(["status"], "", 0, "CertificateAssumedOK"),
                        (["verify", ACCOUNT, "--password-stdin"], PASSWORD, 0, "accepts")])
        file.unlink()
        self.run_table([strange, (forget, "", 0, "is forgotten")])
        self.assertNotIn("keychain", self.run_client("status").stdout)

    def test_what_went_wrong_with_the_server_is_said(self):
        for wrong, said in [
                (dict(fault={"code": -7, "string": "not today"}), "The server answered with the fault -7: not today"),
                (dict(status=503), "The server did not answer, or not with success"),
                (dict(close="before"), "The server closed the connection without an answer"),
                (dict(body="<html>Welcome!</html>"), "The server's answer cannot be understood"),
                (dict(set={"encDsId": None}), "can not talk with the Velto ID server")]:
            with self.subTest(wrong):
                self.world.server.next("authenticate", **wrong)
                self.run_table([(["verify", ACCOUNT, "--password-stdin"], PASSWORD, 1, said)])
        self.run_table([(["verify", ACCOUNT, "--hashed-password-stdin"], hashed("wrong"), 1, "are incorrect"),
                        (["info", "nobody"], "", 1, "There is no such account on this device")])

    def test_json_is_the_whole_reply_of_every_command(self):
        for command in (["ping"], ["list"], ["status"], ["database"], ["info", "nobody"], ["forget", "nobody"]):
            for arguments in (["--json", *command], [*command, "--json"]):
                with self.subTest(arguments):
                    self.assertIn("success", json.loads(self.run_client(*arguments).stdout))

    def test_wrong_use_is_explained(self):
        for command, status, said in [
                ("", 2, "A subcommand is required"), ("dance", 2, "subcommand"), ("--timeout 0 ping", 2, "timeout"),
                ("--service no.such.agent ping", 3, "not installed on this bus"), ("add", 2, "NAME is required"),
                ("add x --password-stdin", 1, "there is no password"), ("certificate", 2, "NAME is required"),
                ("add x --password-stdin --hashed-password-stdin", 2, "excludes"),
                ("add x --no-sign-in --certificate", 2, "excludes"),
                ("certificate x --pem --validation-record", 2, "excludes"),
                ("certificate export x", 2, "--pem,--pkcs12"),
                ("certificate export x --pem f --pkcs12 f", 2, "--pem,--pkcs12"),
                ("certificate export x y --pem f", 2, "excludes"),
                ("certificate export x --pem f --no-password", 2, "requires --pkcs12"),
                ("certificate export x --pkcs12 f --no-password --password-stdin", 2, "excludes"),
                ("certificate export x --pem - --json", 2, "room for one"),
                ("find email", 2, "VALUE is required"), ("breadcrumb get x", 2, "KEY is required")]:
            self.run_table([(command.split(), "", status, said)])
        keep = ["breadcrumb", "set", "x", "k", "--password-stdin"]
        self.run_table([(keep, PASSWORD, 2, "cannot both be standard input"),
                        ([*keep, "--input", "/dev/null"], PASSWORD, 1, "is empty")])
        with mock.patch.dict(self.world.environment, DBUS_SESSION_BUS_ADDRESS="unix:path=/nowhere/bus"):
            self.run_table([(["ping"], "", 3, "")])

    def test_the_password_is_asked_for_without_echo(self):
        status, shown = self.at_terminal("verify", ACCOUNT, dialogue=[(b"Password for", PASSWORD)])
        self.assertEqual(status, 0, shown)
        self.assertNotIn(PASSWORD.encode(), shown)

    def set_passphrase(self, passphrase: str):
        """Until the test ends."""
        if not keyring_is_permitted():
            self.skipTest("the kernel's keyring is not permitted here")
        self.run_table([(["keychain", "set-passphrase", "--password-stdin"], passphrase, 0, "has this passphrase")])
        self.addCleanup(self.run_client, "keychain", "remove-passphrase")
        self.addCleanup(self.run_client, "keychain", "unlock", "--password-stdin", stdin=passphrase)

    def test_a_passphrase_keeps_the_secrets_until_it_is_given(self):
        self.add_account()
        self.run_table([(["keychain", "status"], "", 0, "no passphrase"),
                        (["keychain", "lock"], "", 1, "no passphrase"),
                        (["keychain", "unlock"], "", 0, "no passphrase")])
        self.set_passphrase("open")
        readable = (["status"], "", 0, "NoCertificate")
        self.run_table([
            (["keychain", "status"], "", 0, "unlocked"), readable,
            (["keychain", "lock"], "", 0, "is locked"),
            (["keychain", "status", "--json"], "", 0, '"locked"'),
            (["status"], "", 0, "PasswordInaccessibleInKeychain"),
            (["status"], "", 0, "unlocked since boot:  no"),
            (["add", "kim@example.com", "--no-sign-in", "--password-stdin"], "x", 1, "is locked"),
            (["add", ACCOUNT, "--no-sign-in", "--password-stdin"], "x", 1, "is locked"),
            (["list"], "", 0, ACCOUNT),
            (["keychain", "set-passphrase", "--password-stdin"], "mine", 1, "is locked"),
            (["keychain", "remove-passphrase"], "", 1, "is locked"),
            (["keychain", "unlock", "--password-stdin"], "opem", 1, "not the passphrase"),
            (["keychain", "unlock", "--password-stdin"], "", 1, "there is no password"),
            (["keychain", "unlock", "--password-stdin"], "open\n", 0, "is unlocked"), readable])
        secret = "at the terminal"
        status, shown = self.at_terminal("keychain", "set-passphrase",
                                         dialogue=[(b"keychain:", secret), (b"more:", secret)])
        self.assertEqual(status, 0, shown)
        self.assertNotIn(secret.encode(), shown)
        self.run_table([(["keychain", "lock"], "", 0, ""),
                        (["keychain", "unlock", "--password-stdin"], "open", 1, "not the passphrase")])
        self.assertEqual(self.at_terminal("keychain", "unlock", dialogue=[(b"keychain:", secret)])[0], 0)
        self.run_table([(["keychain", "remove-passphrase"], "", 0, "no passphrase"), readable])

    def test_an_agent_that_waits_for_the_passphrase_is_told(self):
        # Locked at once after it was added, the account has no certificate yet.
        self.set_passphrase("open")
        self.add_account()
        self.run_table([(["keychain", "lock"], "", 0, "")])
        self.world.end_agent_of_the_bus()
        with self.world.client() as client:
            # It begins ten seconds after its start, and then waits for a day at a time.
            wait_until(lambda: client.call(STATUS)["status"]["NextLaunchTime"]["date"] > time.time() + 80_000, 60,
                       "not waiting")
        self.world.server.clear_received()
        self.run_table([(["keychain", "unlock", "--password-stdin"], "open", 0, "is unlocked")])
        self.assertTrue(self.world.server.wait("createCert", timeout=60))

    def test_adding_says_what_became_of_the_certificate(self):
        for issuance, status, said, then, later in [
                ("at-once", 0, "it has a certificate", 0, "CERT_ISSUED"),
                ("never", 0, "still pending; the agent asks again at", 1, "still pending"),
                ("refuse", 1, "got no certificate", 1, "the account has no certificate")]:
            with self.subTest(issuance):
                added = self.add_account("--certificate", issuance=issuance)
                self.assertEqual(added.returncode, status, added.stderr)
                self.assertIn(said, added.stdout + added.stderr)
                self.run_table([(["certificate", ACCOUNT], "", then, later), (["forget", ACCOUNT], "", 0, "")])
        self.run_table([(["certificate", ACCOUNT], "", 1, "no such account"),
                        (["certificate", ACCOUNT, "--validation-record"], "", 1, "no such account")])

    def test_a_certificate_is_shown(self):
        added = json.loads(self.add_account("--certificate", "--json").stdout)
        serial = self.world.server.certificates(ACCOUNT)[-1]["serial"]
        self.assertEqual(added["certificate"]["SerialNumber"], serial)
        for arguments in (["certificate", ACCOUNT.upper()], ["certificate", "show", ACCOUNT]):
            lines = dict(line.split(":", 1) for line in self.run_client(*arguments).stdout.splitlines())
            self.assertEqual(lines["serial"].strip(), serial)
            self.assertIn(f"CN={ACCOUNT}", lines["certificate of"])
            self.assertEqual(list(lines), ["certificate of", "status", "valid until", "serial", "issuer",
                                           "next renewal"])

        pem, chain = (self.run_client("certificate", ACCOUNT, form).stdout for form in ("--pem", "--chain"))
        self.assertIn(serial, openssl("x509", "-noout", "-serial", stdin=pem))
        file = self.new_folder() / "chain.pem"
        file.write_text(chain)
        openssl("verify", "-CAfile", self.world.server.authority, "-untrusted", file, stdin=pem)
        self.assertEqual(json.loads(self.run_client("certificate", ACCOUNT, "--chain", "--json").stdout)
                         ["certificate"]["PEM"], chain)

        record = self.run_client("certificate", ACCOUNT, "--validation-record", stdin=b"").stdout
        file.write_bytes(record)
        self.assertIn(ACCOUNT.encode(), openssl("cms", "-verify", "-inform", "DER", "-in", file, "-purpose", "any",
                                                "-CAfile", self.world.server.authority))
        self.assertEqual(self.at_terminal("certificate", ACCOUNT, "--validation-record")[0], 1)

    def test_an_exported_identity_serves_other_programs(self):
        self.add_account("--certificate")
        folder = self.new_folder()
        secret = "grüße 密码"
        pem, pkcs12, unprotected = (folder / name for name in ("pem", "pkcs12", "unprotected"))
        export = ["certificate", "export", ACCOUNT]
        for arguments, stdin in [(["--pem", pem], ""), (["--pkcs12", pkcs12, "--password-stdin"], secret + "\n"),
                                 (["--pkcs12", unprotected, "--no-password"], "")]:
            run = self.run_client(*export, *arguments, stdin=stdin, umask=0)
            self.assertEqual(run.returncode, 0, run.stderr)
            self.assertEqual(stat.S_IMODE(arguments[1].stat().st_mode), 0o600)
        self.assertEqual(self.run_client(*export, "--pem", "-").stdout, pem.read_text())
        self.assertEqual(pem.read_text().count("BEGIN"), 3)
        self.run_table([([*export, "--pkcs12", folder / "f", "--password-stdin"], "\n", 1, "there is no password")])

        for file, password in ((pkcs12, secret), (unprotected, "")):
            text = openssl("pkcs12", "-in", file, "-passin", "stdin", "-nodes", stdin=password + "\n")
            self.assertEqual(text.count("BEGIN"), 3)
            file.write_text(text)
        for file in (pem, pkcs12, unprotected):
            with self.subTest(file.name):
                # The server lets nobody in who does not prove to have the certificate's key.
                context = ssl.create_default_context(cafile=self.world.server.authority)
                context.load_cert_chain(file)
                with urllib.request.urlopen(self.world.server.client_certificate_url, context=context) as page:
                    self.assertIn(self.world.server.certificates(ACCOUNT)[-1]["serial"], page.read().decode())

    def test_an_export_spares_what_is_there_and_asks_at_a_terminal(self):
        self.add_account("--certificate")
        folder = self.new_folder()
        file, link, dangling = folder / "file", folder / "link", folder / "dangling"
        file.write_text("mine")
        file.chmod(0o644)
        (folder / "other").hardlink_to(file)
        link.symlink_to(file)
        dangling.symlink_to(folder / "target")
        export = ["certificate", "export", ACCOUNT, "--pem"]
        self.run_table([([*export, file], "", 1, "exists already"),
                        ([*export, link], "", 1, "in the way"), ([*export, link, "--force"], "", 1, "in the way"),
                        ([*export, dangling], "", 1, "in the way"),
                        ([*export, folder, "--force"], "", 1, "in the way"),
                        ([*export, folder / "none" / "f"], "", 1, "No such file")])
        for options in ([], ["--force"]):
            target = file if options else folder / "new"
            full = self.run_client(*export, target, *options, restore_signals=False, preexec_fn=lambda:
                                   resource.setrlimit(resource.RLIMIT_FSIZE, (1024, 1024)))
            self.assertIn("File too large", full.stderr)
        self.assertEqual({path.name for path in folder.iterdir()}, {"file", "link", "dangling", "other"})
        self.assertEqual(file.read_text(), "mine")
        self.assertEqual(self.run_client(*export, file, "--force").returncode, 0)
        self.assertIn("PRIVATE KEY", file.read_text())
        self.assertEqual(stat.S_IMODE(file.stat().st_mode), 0o600)
        self.assertEqual((folder / "other").read_text(), "mine")
        mistyped, typed = str(folder / "mistyped"), str(folder / "typed")
        for arguments, dialogue, status in [
                (["--pem", "-"], [], 1),
                (["--pem", "-", "--force"], [], 0),
                (["--pkcs12", mistyped], [(b"New password", "secret"), (b"Once more", "sceret")], 1),
                (["--pkcs12", typed], [(b"New password", "secret"), (b"Once more", "secret")], 0)]:
            with self.subTest(arguments):
                ended, shown = self.at_terminal("certificate", "export", ACCOUNT, *arguments, dialogue=dialogue)
                self.assertEqual(ended, status, shown)
                self.assertEqual(b"PRIVATE KEY" in shown, "--force" in arguments)
                self.assertNotIn(b"secret", shown)
        self.assertEqual({path.name for path in folder.iterdir()}, {"file", "link", "dangling", "other", "typed"})

    def test_people_are_found_and_remembered(self):
        self.run_table([(["find", "email", "jane@roe.example"], "", 1, "HWIdentityErrorDomain")])
        self.add_account()
        self.world.server.accounts({"name": ACCOUNT, "lastNm": "Roe\u009b2J"})
        self.addCleanup(self.world.server.accounts, {"name": ACCOUNT, "lastNm": "Roe"})
        self.run_table([
            (["find", "email", "jane@roe.example", "--cached"], "", 1, "remembers nobody"),
            (["find", "email", "nobody@roe.example", "JANE@roe.example"], "", 0, ACCOUNT),
            (["find", "email", "jane@roe.example", "--account", ACCOUNT], "", 0, "Roe?2J"),
            (["find", "email", "jane@roe.example", "--cached"], "", 0, ACCOUNT),
            (["find", "phone", "jane@roe.example", "--cached"], "", 1, "remembers nobody"),
            (["find", "email", "nobody@roe.example"], "", 0, "nobody was found"),
            (["find", "shoe", "44"], "", 1, "not by shoe")])
        found = json.loads(self.run_client("find", "email", "jane@roe.example", "--json").stdout)["result"]
        self.assertEqual([match["value"] for match in found], ["jane@roe.example"])

    def test_breadcrumbs_come_back_as_they_were(self):
        self.add_account()
        folder = self.new_folder()
        given, fetched, data = folder / "given", folder / "fetched", bytes(range(256)) + b"\n"
        given.write_bytes(data)
        own = [ACCOUNT, "key", "--password-stdin"]
        self.run_table([
            (["breadcrumb", "get", *own], PASSWORD, 1, "nothing is kept under key"),
            (["breadcrumb", "set", *own, "--input", given], PASSWORD, 0, "keeps 257 bytes"),
            (["breadcrumb", "get", *own, "--output", fetched], PASSWORD, 0, ""),
            (["breadcrumb", "get", *own, "--output", fetched], PASSWORD, 1, "exists already"),
            (["breadcrumb", "get", *own, "--output", fetched], "wrong", 1, "exists already"),
            (["breadcrumb", "get", *own], "wrong", 1, "password are incorrect"),
            (["breadcrumb", "set", *own, "--input", folder / "none"], PASSWORD, 1, "No such file")])
        self.assertEqual(fetched.read_bytes(), data)
        piped = self.run_client("breadcrumb", "get", *own, stdin=PASSWORD.encode())
        self.assertEqual(piped.stdout, data)
        status, shown = self.at_terminal("breadcrumb", "get", ACCOUNT, "key", dialogue=[(b"Password", PASSWORD)])
        self.assertEqual((status, data.hex().encode() in shown), (0, True), shown)


if __name__ == "__main__":
    unittest.main()
