"""The whole agent from outside: a real bus, real TLS to the development identity server, real files."""

from __future__ import annotations

import contextlib
import functools
import os
import pathlib
import signal
import sqlite3
import subprocess
import unittest
from concurrent.futures import ThreadPoolExecutor

from jeepney.io.blocking import open_dbus_connection

from harness.world import (ACCOUNT, ADD, CERTIFICATE, CHECK, DATABASE, FORGET, INFO, LIST, OTHER_ACCOUNT,
                           OTHER_PASSWORD, PASSWORD, PASSWORD_SERVICE, PING, SET_VALUE, SET_VALUE_QUIETLY, STATUS,
                           TERMINATE, UPDATE_LINKED_IDENTITY, VERIFY, BusError, NameOwner, World, busctl_send, execute,
                           hashed, wait_until)

PROGRAM = os.environ["VELTOID_AGENT"]
ENGINE = "HWIdentityErrorDomain"
DONE, REFUSED = {"success": True}, {"success": False}


def outcome(reply: dict):
    """The code of a refusal that says why; any other reply as it is."""
    return reply["error"]["Code"] if not reply["success"] and "error" in reply else reply


class WholeJob(unittest.TestCase):
    def test_the_bus_tool_alone_can_do_the_whole_job(self):
        with World() as world:
            send = functools.partial(busctl_send, world.address)
            self.assertEqual(repr(send(command=PING)), repr(DONE), "a Boolean, and nothing else")
            added = send(command=ADD, VeltoID="Jane.Roe@Example.com", hashedpassword=hashed(PASSWORD))
            self.assertTrue(added["success"])
            self.assertEqual(added["accountinfo"]["encDsId"], added["encDsId"])
            info = send(command=INFO, VeltoID=ACCOUNT)["info"]
            self.assertEqual((info["FirstName"], info["LastName"], info["VeltoID"]), ("Jane", "Roe", ACCOUNT))
            self.assertEqual(info["AllEmails"], [ACCOUNT, "jane@roe.example"])
            self.assertEqual(send(command=LIST)["result"], [ACCOUNT])
            status = send(command=STATUS)["status"]
            self.assertEqual(status["AccountStatuses"][ACCOUNT]["AccountState"], "NoCertificate")
            self.assertLessEqual({"DirtyAccounts", "LaunchTime", "NextLaunchTime", "pid", "LastConnectAttempt",
                                  "LastSuccessfulConnect", "DeviceUnlockedSinceBoot"}, set(status))
            self.assertEqual(set(send(command=DATABASE)["result"]), {
                "Version", "CreationDate", "Accounts", "AuthCertificates", "MetaInfo", "AccessorVersions"})
            forgotten = send(command=FORGET, VeltoID=ACCOUNT)
            self.assertEqual((forgotten["VeltoID"], forgotten["encDSID"]), (ACCOUNT, added["encDsId"]))
            self.assertEqual(send(command=LIST)["result"], [])

    def test_a_restart_keeps_the_account_with_its_password_and_a_second_account_replaces_it(self):
        with World() as world:
            with world.running_agent() as client:
                first = client.add()
            with world.running_agent() as client:
                self.assertEqual(client.call(LIST)["result"], [ACCOUNT])
                refreshed = client.call(INFO, VeltoID=ACCOUNT, options={"ForceValidation": True})
                self.assertEqual(refreshed["info"]["encDsId"], first["encDsId"])
                # The add signs in; the second agent does with the stored password.
                self.assertEqual(world.server.counts()["authenticate"], 2)
                self.assertTrue(client.add(OTHER_ACCOUNT, OTHER_PASSWORD)["success"])
                self.assertEqual(client.call(LIST)["result"], [OTHER_ACCOUNT])

    def test_without_preferences_nothing_touches_the_disk(self):
        with World("--noprefsfile") as world, world.client() as client:
            self.assertTrue(client.add()["success"])
            self.assertEqual(set(client.call(DATABASE)["result"]), {"Accounts", "Certificates", "MetaInfo"})
            self.assertTrue(client.call(STATUS)["status"]["DeviceUnlockedSinceBoot"])
            self.assertFalse((world.folder / "state").exists())

    def test_the_password_service_verifies_and_nothing_else(self):
        with World() as world, world.client(PASSWORD_SERVICE) as client:
            for command, arguments, expected in [
                    (PING, {}, DONE), (VERIFY, {"VeltoID": ACCOUNT, "hashedpassword": hashed(PASSWORD)}, DONE),
                    (VERIFY, {"VeltoID": ACCOUNT}, REFUSED), (VERIFY, {"hashedpassword": "x"}, REFUSED),
                    (VERIFY, {"VeltoID": ACCOUNT, "hashedpassword": hashed("wrong")}, -101),
                    (UPDATE_LINKED_IDENTITY, {"identityReferenceData": b"reference"}, -114),
                    (ADD, {"VeltoID": ACCOUNT, "hashedpassword": "x"}, REFUSED)]:
                with self.subTest(command=command, arguments=arguments):
                    self.assertEqual(outcome(client.call(command, **arguments)), expected)


class SigningIn(unittest.TestCase):
    def setUp(self):
        self.world = self.enterContext(World())

    def test_inside_the_validity_window_there_is_no_second_sign_in(self):
        with self.world.client() as client:
            client.add()
            self.world.server.clear_received()
            client.add()
            self.assertEqual(self.world.server.counts().get("authenticate", 0), 0)
            counters = client.call(DATABASE)["result"]["MetaInfo"][ACCOUNT]
            self.assertGreaterEqual(counters["VeltoIDXMLSessionReusedCount"], 1)
            client.add(DoNotUseCachedSession=True)
            self.assertEqual(self.world.server.counts()["authenticate"], 1 + 1)  # the add, and its information

    def test_an_embargo_or_too_old_a_client_is_refused_before_any_traffic(self):
        for change, code in [({"DoNotConnectForX": 600}, -103), ({"ClientTooOld": True}, -104)]:
            with self.subTest(change), World() as world, world.client() as client:
                world.server.next("authenticate", set={**change, "dsSessionValidityDuration": None})
                self.assertTrue(client.add()["encDsId"])
                world.server.clear_received()
                self.assertEqual(outcome(client.verify()), code)
                self.assertEqual(world.server.counts(), {})

    def test_faults_against_the_password_remove_it(self):
        reasons = {-101: "The Velto ID account or password are incorrect.",
                   -102: "This Velto ID has been disabled for security reasons."}
        for fault, code in [(-20101, -101), (-20283, -101), (-20209, -102)]:
            with self.subTest(fault), World() as world, world.client() as client:
                client.add()
                world.server.next("authenticate", fault={"code": fault, "string": "no"})
                error = client.verify()["error"]
                self.assertEqual((error["Domain"], error["Code"]), (ENGINE, code))
                self.assertIn(reasons[code], error["UserInfo"].values())
                self.assertEqual(error["UserInfo"]["XMLFaultCode"], fault)
                self.assertNotIn("HashedPasswordRef", client.call(DATABASE)["result"]["Accounts"][ACCOUNT])
                state = client.call(STATUS)["status"]["AccountStatuses"][ACCOUNT]
                self.assertEqual((state["AccountState"], state["AccountRequiresUserAction"]), ("PasswordInvalid", True))

    def test_what_a_server_does_wrong_is_no_answer_and_changes_nothing(self):
        with self.world.client() as client:
            before = client.add()["accountinfo"]
            for wrong, code in [(dict(close="before"), -100), (dict(close="middle"), -100), (dict(status=500), -100),
                                (dict(status=502, body="<html>no</html>"), -100), (dict(size=17 << 20), -100),
                                (dict(delay=6), -100), (dict(body="<html><body>Welcome!</body></html>"), 1),
                                (dict(body="<?xml version='1.0'?><methodResponse><params>"), 1)]:
                with self.subTest(wrong):
                    self.world.server.next("authenticate", **wrong)
                    error = client.verify()["error"]
                    self.assertEqual((error["Domain"], error["Code"], "NULL response from server" in str(error)),
                                     (ENGINE, code, code == -100))
            after = client.call(DATABASE)["result"]["Accounts"][ACCOUNT]
            self.assertEqual(after["HashedPasswordRef"], before["HashedPasswordRef"])
            self.assertTrue(client.verify()["success"])

    def test_servers_that_cannot_prove_themselves_get_no_password(self):
        server = self.world.server
        plain = server.url.replace("https", "http")
        for url in (server.wrong_name_url, server.unknown_authority_url, plain, "https://localhost:1/x", "", "no url"):
            with self.subTest(url), self.world.client() as client:
                server.clear_received()
                self.assertFalse(client.verify(options={"ServerURL": url})["success"])
                self.assertEqual(server.counts(), {})

    def test_commands_in_a_reply_are_carried_out_down_to_an_end_with_everything_written(self):
        with self.world.running_agent() as client, self.world.client() as other, ThreadPoolExecutor() as pool:
            self.world.server.next("authenticate", delay=2)
            in_work = pool.submit(other.call, VERIFY, VeltoID=OTHER_ACCOUNT, hashedpassword=hashed(OTHER_PASSWORD))
            self.assertTrue(self.world.server.wait("authenticate"))
            self.world.server.next("authenticate", set={"MetaInformation": {"X": "1", "Gone": "NULL"},
                                                        "NextLaunchTimeInterval": 3600,
                                                        "LogString": "hello there", "LogStringLevel": 4})
            self.world.server.next("getMyInfo", set={"FlushAndExit": True})
            self.assertTrue(client.add()["encDsId"], "the answer that carried it counts, too")
            self.assertEqual(in_work.result(), DONE, "what others have asked for is done before")
            self.assertEqual(self.world.agent.wait(timeout=20), 0)
        self.assertIn('VeltoIDAuthentication: Message from server ""hello there""', self.world.log_text())
        self.assertIn("Received 'NextLaunchTimeInterval' == 3600 from server", self.world.log_text())
        with self.world.client() as client:
            self.assertEqual(client.call(DATABASE)["result"]["MetaInfo"]["X"], "1")
            self.assertEqual(client.call(LIST)["result"], [ACCOUNT])


class BadRequests(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.world = cls.enterClassContext(World(server=False))

    def test_requests_of_the_wrong_shape_are_refused_and_nothing_is_lost(self):
        nested: object = "deep"
        for _ in range(19):
            nested = [nested]
        big = "x" * (16 << 20)
        cases = [
            ("no command", None, {}, REFUSED),
            ("an unknown command", 0x121, {}, REFUSED),
            ("a set without key", SET_VALUE, {"domain": "MetaInfo"}, REFUSED),
            ("a set in an unknown domain", SET_VALUE, {"domain": "Nowhere", "key": "k", "value": 1}, REFUSED),
            ("the same, said to be all right", SET_VALUE_QUIETLY, {"domain": "Nowhere", "key": "k"}, DONE),
            ("a set for nobody", SET_VALUE, {"domain": "Accounts", "item": "none", "key": "k", "value": 1}, REFUSED),
            ("a deep value", SET_VALUE, {"domain": "MetaInfo", "key": "deep", "value": nested}, DONE),
            ("a big value", SET_VALUE, {"domain": "MetaInfo", "key": "big", "value": big}, DONE),
            ("bytes for text", SET_VALUE, {"domain": b"MetaInfo", "key": "k", "value": 1}, REFUSED),
            ("a dictionary for an account", VERIFY, {"VeltoID": {}, "hashedpassword": "x"}, REFUSED),
            ("adding nobody", ADD, {"hashedpassword": "x"}, -100),
            ("a number for an account", ADD, {"VeltoID": 5, "hashedpassword": "x"}, -100),
            ("forgetting a stranger", FORGET, {"VeltoID": "nobody"}, -108),
            ("forgetting nobody", FORGET, {}, -99),
            ("asking about a stranger", INFO, {"VeltoID": "nobody"}, -108),
        ]
        with self.world.client() as client:
            for name, command, arguments, expected in cases:
                with self.subTest(name):
                    self.assertEqual(outcome(client.call(command, **arguments)), expected)
            for signature, body in [("s", ("hello",)), ("a{ss}", ({"command": "1"},)), ("", ())]:
                with self.subTest("of another type", signature=signature), self.assertRaises(BusError):
                    client.reply_to(client.message(body, signature))
            self.assertEqual(client.call(DATABASE)["result"]["MetaInfo"]["big"], big)
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

    def test_what_nobody_can_reckon_with_or_store_is_refused_and_leaves_what_is_there(self):
        nan, endless = float("nan"), float("inf")
        with self.world.client() as client:
            client.connection.close()
            client.connection = open_dbus_connection(bus=self.world.address, enable_fds=True)
            kept = dict(domain="MetaInfo", key="kept", value="x")
            self.assertEqual(client.call(SET_VALUE, **kept), DONE)
            for wrong in (nan, -endless, ("(d)", (endless,)), [{"deep": ("(d)", (nan,))}], ("h", 1), [("h", 1)]):
                for command in (SET_VALUE, SET_VALUE_QUIETLY):
                    with self.subTest(wrong, command=command):
                        self.assertEqual(outcome(client.call(command, **{**kept, "value": wrong})), -99)
            for command in (PING, LIST, VERIFY, STATUS, INFO):
                self.assertEqual(outcome(client.call(command, options={"x": nan})), -99, command)
            self.assertEqual(client.call(DATABASE)["result"]["MetaInfo"]["kept"], "x")

    @unittest.skipUnless(os.geteuid() == 0, "only root can speak as another user")
    def test_other_users_are_refused(self):
        with World(server=False) as world:
            for path in (world.folder, world.folder / "bus"):
                path.chmod(0o777)
            # The agent serves its own user and root; here it runs as root, so another user is a stranger.
            stranger = "setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"
            with world.running_agent(), self.assertRaises(subprocess.CalledProcessError) as refused:
                busctl_send(world.address, command=PING, prefix=stranger)
            self.assertIn("Access denied", refused.exception.stderr)


class Files(unittest.TestCase):
    """Damaged and hostile state folders."""

    def prepared(self, world) -> pathlib.Path:
        with world.running_agent() as client:
            client.add()
        return world.state_files()

    def test_a_file_that_is_no_database_is_moved_aside_and_named_in_the_log(self):
        for name in ("preferences.db", "keychain.db"):
            with self.subTest(name), World() as world:
                folder = self.prepared(world)
                for sidecar in folder.glob(f"{name}-*"):
                    sidecar.unlink()
                (folder / name).write_bytes(b"this is no database " * 400)
                with world.running_agent() as client:
                    self.assertTrue(client.add()["success"])
                    self.assertEqual(client.call(LIST)["result"], [ACCOUNT])
                (aside,) = folder.glob(f"{name}.corrupt-*")
                self.assertTrue(aside.read_bytes().startswith(b"this is no database"))
                self.assertIn(aside.name, world.log_text())

    def test_accounts_that_cannot_be_read_now_are_not_said_to_be_none(self):
        everything = (STATUS, DATABASE, CHECK, LIST, INFO, FORGET, CERTIFICATE)

        @contextlib.contextmanager
        def newer(file):
            execute(file, "PRAGMA user_version = 99")
            yield
            execute(file, "PRAGMA user_version = 1")

        @contextlib.contextmanager
        def in_the_way(file):
            file.rename(file.with_name("elsewhere"))
            file.mkdir()
            yield
            file.rmdir()
            file.with_name("elsewhere").rename(file)

        @contextlib.contextmanager
        def held(file):
            with contextlib.closing(sqlite3.connect(file, isolation_level=None)) as other:
                other.executescript("PRAGMA locking_mode = EXCLUSIVE; BEGIN EXCLUSIVE;")
                yield

        with World() as world:
            file = self.prepared(world) / "preferences.db"
            for obstacle, commands in [(newer, everything), (in_the_way, everything), (held, (LIST,))]:
                with self.subTest(obstacle.__name__), obstacle(file):
                    world.start_agent()
                    with world.client(starts_agent=False) as client:
                        for command in commands:
                            error = client.call(command, VeltoID=ACCOUNT)["error"]
                            self.assertEqual((error["Domain"], error["Code"]), (ENGINE, -1), command)
                            self.assertIn("cannot be read now", error["UserInfo"]["HWLocalizedFailureReason"])
                            self.assertLessEqual({"function", "file", "line"}, set(error["UserInfo"]))
                        if obstacle is not held:
                            self.assertFalse(client.add(OTHER_ACCOUNT, OTHER_PASSWORD)["success"])
                with world.client(starts_agent=False) as client:
                    self.assertEqual(client.call(LIST)["result"], [ACCOUNT], "as soon as it can be read")
                    self.assertIn(ACCOUNT, client.call(STATUS)["status"]["AccountStatuses"])
                self.assertEqual(world.stop_agent(), 0)

    def test_a_damaged_value_takes_no_other_down_and_is_kept(self):
        for key, accounts in [("Version", [ACCOUNT]), ("MetaInfo", [ACCOUNT]), ("Accounts", [])]:
            with self.subTest(key), World() as world:
                file = self.prepared(world) / "preferences.db"
                execute(file, f"UPDATE preferences SET value = x'00' WHERE key = '{key}'")
                with world.running_agent() as client:
                    self.assertEqual(client.call(LIST)["result"], accounts)
                    self.assertTrue(client.add()["success"])
                self.assertIn(f'"{key}" is damaged', world.log_text())
                kept = execute(file, "SELECT value FROM preferences "
                                     f"WHERE domain LIKE '%.damaged' AND key LIKE '{key}-%'")
                self.assertEqual(kept, [] if key == "Version" else [(b"\0",)])

    def test_a_change_that_cannot_be_stored_fails_and_spoils_nothing(self):
        half = bytes(36 << 20)
        with World(server=False) as world:
            world.start_agent()
            with world.client() as client:
                for key, value, expected in [("before", "b", True), ("half", half, True), ("other half", half, False),
                                             ("half", 0, True), ("after", "a", True)]:
                    self.assertEqual(client.call(SET_VALUE, domain="MetaInfo", key=key, value=value),
                                     {"success": expected}, key)
            world.stop_agent(signal.SIGKILL)
            with world.running_agent() as client:
                self.assertEqual(client.call(DATABASE)["result"]["MetaInfo"], {"before": "b", "half": 0, "after": "a"})

    def test_a_state_folder_that_cannot_be_had_leaves_the_agent_up(self):
        with World() as world:
            (world.folder / "state").write_text("a file where the folder should be")
            with world.running_agent() as client:
                self.assertTrue(client.call(PING)["success"])
                self.assertFalse(client.add()["success"])
            self.assertEqual((world.folder / "state").read_text(), "a file where the folder should be")

    def test_no_secret_is_on_disk_or_in_the_log(self):
        with World() as world:
            files = list(self.prepared(world).iterdir())
            for file in [*files, world.folder / "agent.log"]:
                self.assertNotIn(hashed(PASSWORD).encode(), file.read_bytes(), file.name)
            for file in files:
                self.assertEqual(file.stat().st_mode & 0o077, 0, file.name)


class Process(unittest.TestCase):
    def test_commands_end_the_agent_and_an_interrupt_does_not(self):
        with World(server=False) as world:
            with world.running_agent() as client:
                world.agent.send_signal(signal.SIGINT)
                self.assertTrue(client.call(PING)["success"])
                self.assertIsNone(world.agent.poll())
                reply = client.call(STATUS, options={"VeltoIDAuthenticationStatusTerminateServer": True})
                self.assertEqual(reply["status"], {"DeviceUnlockedSinceBoot": True})
                self.assertEqual(world.agent.wait(timeout=20), 0)
            with world.running_agent() as client:
                self.assertRaises(BusError, client.call, TERMINATE)
                self.assertEqual(world.agent.wait(timeout=20), 0)

    def test_without_the_authentication_service_leaks_mode_answers_under_no_name(self):
        with World(server=False) as world:
            with NameOwner(world.address, PASSWORD_SERVICE) as owner, \
                    subprocess.Popen([PROGRAM, "--leaks", "--checkpassword"], env=world.environment) as agent:
                self.addCleanup(agent.kill)
                owner.wait(True)
                with world.client(PASSWORD_SERVICE) as named:
                    name = named.connection.bus_proxy.GetNameOwner(PASSWORD_SERVICE)[0]
                    self.assertFalse(named.call(LIST)["success"])
                with world.client(name) as nameless:
                    self.assertTrue(nameless.call(SET_VALUE, domain="MetaInfo", key="k", value=1)["success"])
                agent.terminate()
                self.assertEqual(agent.wait(timeout=20), 0)

    def test_numbers_on_the_command_line_count_as_such_unless_they_are_not_finite(self):
        with World("DefaultRelaunchInterval=3600", "Other=-inf", "More=nan", server=False) as world, \
                world.running_agent() as client:
            def interval():
                status = client.call(STATUS)["status"]
                return status["NextLaunchTime"]["date"] - status["LaunchTime"]["date"]
            wait_until(lambda: interval() > 60, 20, "the first pass")
            self.assertLess(abs(interval() - 3600), 60)
            self.assertEqual(set(client.call(DATABASE)["result"]["MetaInfo"]), {"DefaultRelaunchInterval"})
            self.assertEqual(world.log_text().count("is not stored: its value is not finite"), 2)

    def test_an_unknown_option_prints_the_usage(self):
        run = subprocess.run([PROGRAM, "-x"], capture_output=True, text=True, check=False)
        self.assertEqual((run.returncode, run.stdout),
                         (255, f"{PROGRAM} : [ --checkpassword ] [ --authentication ]\n"))
        self.assertIn("Got an unexpected argument; ch = 63 index=2", run.stderr)


if __name__ == "__main__":
    unittest.main()
