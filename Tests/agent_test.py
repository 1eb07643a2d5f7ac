"""The whole agent from outside: a real bus, real TLS to the development identity server, real files."""

from __future__ import annotations

import contextlib
import os
import pathlib
import signal
import sqlite3
import subprocess
import sys
import unittest

sys.path.insert(0, str(pathlib.Path(__file__).resolve().parent / "harness"))
from world import (ACCOUNT, ADD, DATABASE, FORGET, INFO, LIST, OTHER_ACCOUNT, OTHER_PASSWORD, PASSWORD,  # noqa: E402
                   PASSWORD_SERVICE, PING, SERVICE, SET_VALUE, SET_VALUE_QUIETLY, STATUS, TERMINATE, VERIFY, BusError,
                   NameOwner, World, agent_program, hashed)
from jeepney import message_bus  # noqa: E402
from jeepney.io.blocking import Proxy  # noqa: E402

ENGINE = "HWIdentityErrorDomain"


def add(client, account=ACCOUNT, password=PASSWORD, **options):
    return client.call(ADD, VeltoID=account, hashedpassword=hashed(password), options=options)


class WholeJob(unittest.TestCase):
    def test_the_bus_tool_alone_can_do_the_whole_job(self):
        with World() as world:
            self.assertEqual(world.busctl("call", SERVICE, "/com/velto/harbwell/veltoid",
                                          "com.velto.harbwell.veltoid.MessageService", "Send", "a{sv}", "1", "command",
                                          "x", "1"), 'a{sv} 1 "success" b true')
            added = world.busctl_send("3", "command", "x", str(ADD), "VeltoID", "s", "Jane.Roe@Example.com",
                                      "hashedpassword", "s", hashed(PASSWORD))
            self.assertTrue(added["success"])
            self.assertEqual(added["accountinfo"]["encDsId"], added["encDsId"])
            info = world.busctl_send("2", "command", "x", str(INFO), "VeltoID", "s", ACCOUNT)["info"]
            self.assertEqual((info["FirstName"], info["LastName"], info["VeltoID"]), ("Jane", "Roe", ACCOUNT))
            self.assertEqual(info["AllEmails"], [ACCOUNT, "jane@roe.example"])
            self.assertEqual(world.busctl_send("1", "command", "x", str(LIST))["result"], [ACCOUNT])
            status = world.busctl_send("1", "command", "x", str(STATUS))["status"]
            self.assertEqual(status["AccountStatuses"][ACCOUNT]["AccountState"], "NoCertificate")
            self.assertLessEqual({"DirtyAccounts", "LaunchTime", "NextLaunchTime", "pid", "LastConnectAttempt",
                                  "LastSuccessfulConnect", "DeviceUnlockedSinceBoot"}, set(status))
            database = world.busctl_send("1", "command", "x", str(DATABASE))["result"]
            self.assertEqual(set(database), {"Version", "CreationDate", "Accounts", "AuthCertificates", "MetaInfo",
                                             "AccessorVersions"})
            forgotten = world.busctl_send("2", "command", "x", str(FORGET), "VeltoID", "s", ACCOUNT)
            self.assertEqual((forgotten["VeltoID"], forgotten["encDSID"]), (ACCOUNT, added["encDsId"]))
            self.assertEqual(world.busctl_send("1", "command", "x", str(LIST))["result"], [])

    def test_a_restart_keeps_the_account_and_its_password(self):
        with World() as world:
            world.start_agent()
            with world.client() as client:
                first = add(client)
            self.assertEqual(world.stop_agent(), 0)
            world.start_agent()
            with world.client() as client:
                self.assertEqual(client.call(LIST)["result"], [ACCOUNT])
                refreshed = client.call(INFO, VeltoID=ACCOUNT, options={"ForceValidation": True})
                self.assertEqual(refreshed["info"]["encDsId"], first["encDsId"])
            # The add signs in for itself and for the information; the second agent signs in with the stored password.
            self.assertEqual(world.server.counts()["authenticate"], 3)

    def test_adding_a_second_account_forgets_the_first(self):
        with World() as world, world.client() as client:
            add(client)
            self.assertTrue(add(client, OTHER_ACCOUNT, OTHER_PASSWORD)["success"])
            self.assertEqual(client.call(LIST)["result"], [OTHER_ACCOUNT])

    def test_without_preferences_nothing_touches_the_disk(self):
        with World("--noprefsfile") as world, world.client() as client:
            self.assertTrue(add(client)["success"])
            self.assertEqual(set(client.call(DATABASE)["result"]), {"Accounts", "Certificates", "MetaInfo"})
            self.assertTrue(client.call(STATUS)["status"]["DeviceUnlockedSinceBoot"])
            self.assertFalse((world.folder / "state").exists())

    def test_the_password_service_verifies_and_nothing_else(self):
        with World() as world, world.client(PASSWORD_SERVICE) as client:
            self.assertEqual(client.call(PING), {"success": True})
            cases = [("right", dict(VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD)), True),
                     ("no password", dict(VeltoID=ACCOUNT), False), ("no account", dict(hashedpassword="x"), False)]
            for name, arguments, expected in cases:
                with self.subTest(name):
                    self.assertEqual(client.call(VERIFY, **arguments), {"success": expected})
            wrong = client.call(VERIFY, VeltoID=ACCOUNT, hashedpassword=hashed("wrong"))
            self.assertEqual(wrong["error"]["Code"], -101)
            self.assertEqual(client.call(400, identityReferenceData=b"reference")["error"]["Code"], -114)
            self.assertEqual(client.call(ADD, VeltoID=ACCOUNT, hashedpassword="x"), {"success": False})


class SigningIn(unittest.TestCase):
    def setUp(self):
        self.world = self.enterContext(World())

    def test_inside_the_validity_window_there_is_no_second_sign_in(self):
        with self.world.client() as client:
            add(client)
            self.world.server.clear_received()
            add(client)
            self.assertEqual(self.world.server.counts().get("authenticate", 0), 0)
            counters = client.call(DATABASE)["result"]["MetaInfo"][ACCOUNT]
            self.assertGreaterEqual(counters["VeltoIDXMLSessionReusedCount"], 1)
            add(client, DoNotUseCachedSession=True)
            self.assertEqual(self.world.server.counts()["authenticate"], 1 + 1)  # the add, and its information

    def test_an_embargo_or_too_old_a_client_is_refused_before_any_traffic(self):
        for name, change, code in [("embargo", {"DoNotConnectForX": 600}, -103), ("too old", {"ClientTooOld": True}, -104)]:
            with self.subTest(name), World() as world, world.client() as client:
                world.server.next("authenticate", set={**change, "dsSessionValidityDuration": None})
                self.assertTrue(add(client)["encDsId"])
                world.server.clear_received()
                refused = client.call(VERIFY, VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD))
                self.assertEqual((refused["success"], refused["error"]["Code"]), (False, code))
                self.assertEqual(world.server.counts(), {})

    def test_faults_against_the_password_remove_it(self):
        reasons = {-101: "The Velto ID account or password are incorrect.",
                   -102: "This Velto ID has been disabled for security reasons."}
        for fault, code in [(-20101, -101), (-20283, -101), (-20209, -102)]:
            with self.subTest(fault), World() as world, world.client() as client:
                add(client)
                world.server.next("authenticate", fault={"code": fault, "string": "no"})
                error = client.call(VERIFY, VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD))["error"]
                self.assertEqual((error["Domain"], error["Code"]), (ENGINE, code))
                self.assertIn(reasons[code], error["UserInfo"].values())
                self.assertEqual(error["UserInfo"]["XMLFaultCode"], fault)
                record = client.call(DATABASE)["result"]["Accounts"][ACCOUNT]
                self.assertNotIn("HashedPasswordRef", record)
                state = client.call(STATUS)["status"]["AccountStatuses"][ACCOUNT]
                self.assertEqual((state["AccountState"], state["AccountRequiresUserAction"]), ("PasswordInvalid", True))

    def test_what_a_server_does_wrong_is_no_answer_and_changes_nothing(self):
        wrongs = [("closes early", dict(close="before")), ("closes inside", dict(close="middle")),
                  ("answers 500", dict(status=500)), ("answers HTML", dict(status=502, body="<html>no</html>")),
                  ("sends 17 MB", dict(size=17 << 20)), ("says nothing for six seconds", dict(delay=6))]
        with self.world.client() as client:
            before = add(client)["accountinfo"]
            for name, injection in wrongs:
                with self.subTest(name):
                    self.world.server.next("authenticate", **injection)
                    error = client.call(VERIFY, VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD))["error"]
                    self.assertEqual((error["Domain"], error["Code"]), (ENGINE, -100))
                    self.assertIn("NULL response from server", str(error))
            for name, body in [("half a document", "<?xml version='1.0'?><methodResponse><params>"),
                               ("HTML as an answer", "<html><body>Welcome!</body></html>")]:
                with self.subTest(name):
                    self.world.server.next("authenticate", body=body)
                    self.assertFalse(client.call(VERIFY, VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD))["success"])
            after = client.call(DATABASE)["result"]["Accounts"][ACCOUNT]
            self.assertEqual(after["HashedPasswordRef"], before["HashedPasswordRef"])
            self.assertTrue(client.call(VERIFY, VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD))["success"])

    def test_servers_that_cannot_prove_themselves_get_no_password(self):
        server = self.world.server
        plain = server.url.replace("https", "http")
        for url in (server.wrong_name_url, server.unknown_authority_url, plain, "https://localhost:1/x", "", "no url"):
            with self.subTest(url), self.world.client() as client:
                server.clear_received()
                refused = client.call(VERIFY, VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD), options={"ServerURL": url})
                self.assertFalse(refused["success"])
                self.assertEqual(server.counts(), {})

    def test_commands_in_a_reply_are_carried_out(self):
        with self.world.client() as client:
            self.world.server.next("authenticate", set={"MetaInformation": {"X": "1", "Gone": "NULL"},
                                                        "NextLaunchTimeInterval": 3600,
                                                        "LogString": "hello there", "LogStringLevel": 4})
            add(client)
            self.assertEqual(client.call(DATABASE)["result"]["MetaInfo"]["X"], "1")
            self.assertIn('VeltoIDAuthentication: Message from server ""hello there""', self.world.log_text())
            self.assertIn("Received 'NextLaunchTimeInterval' == 3600 from server", self.world.log_text())

    def test_flush_and_exit_ends_the_agent_with_everything_written(self):
        agent = self.world.start_agent()
        with self.world.client() as client:
            self.world.server.next("getMyInfo", set={"FlushAndExit": True})
            client.post(ADD, VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD))
            self.assertEqual(agent.wait(timeout=20), 0)
        with self.world.client() as client:
            self.assertEqual(client.call(LIST)["result"], [ACCOUNT])


class BadRequests(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.world = World(server=False)

    @classmethod
    def tearDownClass(cls):
        cls.world.__exit__()

    def test_requests_of_the_wrong_shape_are_refused_and_nothing_is_lost(self):
        unknown = {"success": False}
        nested: object = "deep"
        for _ in range(19):
            nested = [nested]
        cases = [
            ("no command", None, {}, unknown),
            ("an unknown command", 0x121, {}, unknown),
            ("a set without key", SET_VALUE, {"domain": "MetaInfo"}, unknown),
            ("a set in an unknown domain", SET_VALUE, {"domain": "Nowhere", "key": "k", "value": 1}, unknown),
            ("the same, said to be all right", SET_VALUE_QUIETLY, {"domain": "Nowhere", "key": "k"}, {"success": True}),
            ("a set for an unknown account", SET_VALUE, {"domain": "Accounts", "item": "nobody", "key": "k", "value": 1},
             unknown),
            ("a deep value", SET_VALUE, {"domain": "MetaInfo", "key": "deep", "value": nested}, {"success": True}),
            ("a big value", SET_VALUE, {"domain": "MetaInfo", "key": "big", "value": "x" * (16 << 20)}, {"success": True}),
            ("bytes for text", SET_VALUE, {"domain": b"MetaInfo", "key": "k", "value": 1}, unknown),
            ("a dictionary for an account", VERIFY, {"VeltoID": {}, "hashedpassword": "x"}, unknown),
        ]
        with self.world.client() as client:
            for name, command, arguments, expected in cases:
                with self.subTest(name):
                    self.assertEqual(client.call(command, **arguments), expected)
            self.assertEqual(len(client.call(DATABASE)["result"]["MetaInfo"]["big"]), 16 << 20)
            errors = [
                ("adding nobody", ADD, {"hashedpassword": "x"}, -100),
                ("a number for an account", ADD, {"VeltoID": 5, "hashedpassword": "x"}, -100),
                ("forgetting a stranger", FORGET, {"VeltoID": "nobody"}, -108),
                ("forgetting nobody", FORGET, {}, -99),
                ("asking about a stranger", INFO, {"VeltoID": "nobody"}, -108),
            ]
            for name, command, arguments, code in errors:
                with self.subTest(name):
                    refused = client.call(command, **arguments)
                    self.assertEqual((refused["success"], refused["error"]["Code"]), (False, code))
            self.assertTrue(client.call(PING)["success"])

    def test_messages_of_another_type_get_the_bus_error(self):
        with self.world.client() as client:
            for signature, body in [("s", ("hello",)), ("a{ss}", ({"command": "1"},)), ("", ())]:
                with self.subTest(signature), self.assertRaises(BusError):
                    client.send(body, signature)
            self.assertTrue(client.call(PING)["success"])

    def test_every_kind_of_value_survives_the_way_in_and_out(self):
        values = {"text": "Zoë ✓", "number": -(2**63), "unsigned": ("t", 2**64 - 1), "real": 0.1, "yes": True,
                  "bytes": bytes(range(256)), "list": ["a", 1, [2.5, False]], "dictionary": {"inner": {"most": "x"}},
                  "date": ("(d)", (1234567890.5,))}
        with self.world.client() as client:
            for key, value in values.items():
                self.assertTrue(client.call(SET_VALUE, domain="MetaInfo", key=key, value=value)["success"])
            stored = client.call(DATABASE)["result"]["MetaInfo"]
            expected = {**values, "unsigned": 2**64 - 1, "date": {"date": 1234567890.5}}
            self.assertEqual({key: stored[key] for key in values}, expected)

    @unittest.skipUnless(os.geteuid() == 0, "only root can speak as another user")
    def test_other_users_are_refused(self):
        with World(server=False) as world:
            for path in (world.folder, world.folder / "bus"):
                path.chmod(0o777)
            world.start_agent()
            # The agent serves its own user and root; here it runs as root, so another user is a stranger.
            run = subprocess.run(["setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", "busctl",
                                  f"--address={world.bus.address}", "call", SERVICE, "/com/velto/harbwell/veltoid",
                                  "com.velto.harbwell.veltoid.MessageService", "Send", "a{sv}", "1", "command", "x", "1"],
                                 capture_output=True, text=True, check=False)
            self.assertNotEqual(run.returncode, 0)
            self.assertIn("Access denied", run.stderr)


class Files(unittest.TestCase):
    """Damaged and hostile state folders."""

    def prepared(self, world) -> pathlib.Path:
        world.start_agent()
        with world.client() as client:
            add(client)
        world.stop_agent()
        return world.state_files()

    def test_a_file_that_is_no_database_is_moved_aside_and_named_in_the_log(self):
        for name in ("preferences.db", "keychain.db"):
            with self.subTest(name), World() as world:
                folder = self.prepared(world)
                for sidecar in folder.glob(f"{name}-*"):
                    sidecar.unlink()
                (folder / name).write_bytes(b"this is no database " * 400)
                world.start_agent()
                with world.client() as client:
                    self.assertTrue(add(client)["success"])
                    self.assertEqual(client.call(LIST)["result"], [ACCOUNT])
                aside = list(folder.glob(f"{name}.corrupt-*"))
                self.assertEqual(len(aside), 1)
                self.assertTrue(aside[0].read_bytes().startswith(b"this is no database"))
                self.assertIn(aside[0].name, world.log_text())

    def edit(self, folder: pathlib.Path, statement: str):
        with contextlib.closing(sqlite3.connect(folder / "preferences.db")) as database, database:
            database.execute(statement)

    def test_a_file_of_a_newer_version_is_left_alone_and_nothing_is_claimed(self):
        with World() as world:
            folder = self.prepared(world)
            self.edit(folder, "PRAGMA user_version = 99")
            world.start_agent()
            with world.client() as client:
                self.assertFalse(client.call(LIST)["success"])
                self.assertFalse(add(client, OTHER_ACCOUNT, OTHER_PASSWORD)["success"])
                self.assertFalse(client.call(SET_VALUE, domain="MetaInfo", key="k", value="v")["success"])
            world.stop_agent()
            self.edit(folder, "PRAGMA user_version = 1")
            world.start_agent()
            with world.client() as client:
                self.assertEqual(client.call(LIST)["result"], [ACCOUNT])

    def test_a_damaged_value_takes_no_other_down_and_is_kept(self):
        for key, accounts in [("Version", [ACCOUNT]), ("MetaInfo", [ACCOUNT]), ("Accounts", [])]:
            with self.subTest(key), World() as world:
                folder = self.prepared(world)
                self.edit(folder, f"UPDATE preferences SET value = x'00' WHERE key = '{key}'")
                world.start_agent()
                with world.client() as client:
                    self.assertEqual(client.call(LIST)["result"], accounts)
                    self.assertTrue(add(client)["success"])
                self.assertIn(f'"{key}" is damaged', world.log_text())
                world.stop_agent()
                with contextlib.closing(sqlite3.connect(folder / "preferences.db")) as database:
                    kept = database.execute(
                        "SELECT value FROM preferences WHERE domain LIKE '%.damaged' AND key LIKE ?", (key + "-%",))
                    self.assertEqual(kept.fetchall(), [] if key == "Version" else [(b"\0",)])

    def test_a_change_that_cannot_be_stored_fails_and_spoils_nothing(self):
        half = bytes(36 << 20)
        steps = [("before", "b", True), ("half", half, True), ("other half", half, False), ("half", 0, True),
                 ("after", "a", True)]
        with World(server=False) as world:
            world.start_agent()
            with world.client() as client:
                for key, value, expected in steps:
                    self.assertEqual(client.call(SET_VALUE, domain="MetaInfo", key=key, value=value),
                                     {"success": expected}, key)
            world.stop_agent(signal.SIGKILL)
            world.start_agent()
            with world.client() as client:
                self.assertEqual(client.call(DATABASE)["result"]["MetaInfo"], {"before": "b", "half": 0, "after": "a"})

    def test_a_state_folder_that_cannot_be_had_leaves_the_agent_up(self):
        with World() as world:
            (world.folder / "state").write_text("a file where the folder should be")
            world.start_agent()
            with world.client() as client:
                self.assertTrue(client.call(PING)["success"])
                self.assertFalse(add(client)["success"])
            self.assertEqual((world.folder / "state").read_text(), "a file where the folder should be")

    def test_no_secret_is_on_disk_or_in_the_log(self):
        with World() as world:
            folder = self.prepared(world)
            secret = hashed(PASSWORD).encode()
            for file in [*folder.iterdir(), world.folder / "agent.log"]:
                self.assertNotIn(secret, file.read_bytes(), file.name)
            for file in folder.iterdir():
                self.assertEqual(file.stat().st_mode & 0o077, 0, file.name)


class Process(unittest.TestCase):
    def test_the_terminate_commands_end_the_agent(self):
        with World(server=False) as world:
            agent = world.start_agent()
            with world.client() as client:
                reply = client.call(STATUS, options={"VeltoIDAuthenticationStatusTerminateServer": True})
                self.assertEqual(reply["status"], {"DeviceUnlockedSinceBoot": True})
                self.assertEqual(agent.wait(timeout=20), 0)
            world.stop_agent()
            agent = world.start_agent()
            with world.client() as client, self.assertRaises(BusError):
                client.call(TERMINATE)
            self.assertEqual(agent.wait(timeout=20), 0)

    def test_an_interrupt_flushes_and_stays(self):
        with World(server=False) as world:
            agent = world.start_agent()
            with world.client() as client:
                client.call(SET_VALUE, domain="MetaInfo", key="k", value="v")
                agent.send_signal(signal.SIGINT)
                self.assertTrue(client.call(PING)["success"])
            self.assertIsNone(agent.poll())
            self.assertEqual(world.stop_agent(), 0)

    def test_without_the_authentication_service_leaks_mode_answers_under_no_name(self):
        with World(server=False) as world:
            environment = {**os.environ, **world.environment, "DBUS_SESSION_BUS_ADDRESS": world.bus.address}
            with NameOwner(world.bus.address, PASSWORD_SERVICE) as owner, \
                    subprocess.Popen([agent_program(), "--leaks", "--checkpassword"], env=environment) as agent:
                self.addCleanup(agent.kill)
                owner.wait(True)
                with world.client(PASSWORD_SERVICE) as named:
                    name = Proxy(message_bus, named.connection).GetNameOwner(PASSWORD_SERVICE)[0]
                    self.assertFalse(named.call(LIST)["success"])
                with world.client(name) as nameless:
                    self.assertTrue(nameless.call(SET_VALUE, domain="MetaInfo", key="k", value=1)["success"])
                agent.terminate()
                self.assertEqual(agent.wait(timeout=20), 0)

    def test_an_unknown_option_prints_the_usage(self):
        run = subprocess.run([agent_program(), "-x"], capture_output=True, text=True, check=False)
        self.assertEqual(run.returncode, 255)
        self.assertEqual(run.stdout, f"{agent_program()} : [ --checkpassword ] [ --authentication ]\n")
        self.assertIn("Got an unexpected argument; ch = 63 index=2", run.stderr)


if __name__ == "__main__":
    unittest.main()
