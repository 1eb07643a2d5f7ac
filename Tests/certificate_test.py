"""Client certificates and what comes with them, from outside: the agent against the identity server, over real TLS,
with the openssl command line as the judge."""

from __future__ import annotations

import base64
import concurrent.futures
import contextlib
import datetime
import plistlib
import unittest

from harness.world import (ACCOUNT, CERTIFICATE, CHECK, DATABASE, FIND, FIND_CACHED, FORGET, GET_BREADCRUMB, INFO,
                           OTHER_ACCOUNT, PASSWORD, PING, SET_BREADCRUMB, World, hashed, openssl, references)

KEYS, CERTIFICATES = 1, 2
LOOKS = 50  # at something that the agent may be about to change
DAY = 86_400


def seconds(moment: datetime.datetime | str) -> float:
    """A date without zone (UTC), or as texts give it, in seconds since 1970."""
    if isinstance(moment, str):
        moment = datetime.datetime.fromisoformat(moment)
    return moment.replace(tzinfo=datetime.timezone.utc).timestamp()


class AgentCase(unittest.TestCase):
    """One world for all tests of a class. The agent's own account check begins ten seconds after its start: a case that
    must not be interfered with has an agent of its own."""

    @classmethod
    def setUpClass(cls):
        cls.world = cls.enterClassContext(World())
        cls.server = cls.world.server

    @contextlib.contextmanager
    def case(self, name, account=ACCOUNT, **settings):
        """A fresh agent without accounts, a server with these settings. In the end the account is forgotten, and
        nothing of it may be left in the keychain."""
        with self.subTest(name), self.world.running_agent() as self.client:
            self.server.clear_received()
            self.server.settings(**settings)
            try:
                yield
            finally:
                self.server.clear_next()
                self.server.reset_settings()
                self.client.call(FORGET, VeltoID=account)
            self.assertEqual(self.world.keychain_items(), {})
            self.assertTrue(self.client.call(PING)["success"])

    def add_with_certificate(self, account=ACCOUNT, timeout=30, **options):
        """The account as the add answers it, None when the add did not come to its end."""
        return self.client.add(account, timeout=timeout, CreateCSRAsynchronously=False, **options).get("accountinfo")

    def database(self):
        return self.client.call(DATABASE)["result"]

    def record(self):
        return self.database()["Accounts"][ACCOUNT]

    def entry(self, account=ACCOUNT):
        database = self.database()
        return database["AuthCertificates"][database["Accounts"][account]["encDsId"]]

    def stored(self):
        """How many keys and certificates there are. Each item is referred to, and each reference leads to one."""
        for _ in range(LOOKS):
            items, known = self.world.keychain_items(), references(self.database())
            if items.keys() == known:
                return tuple(list(items.values()).count(kind) for kind in (KEYS, CERTIFICATES))
        self.fail(f"items {items}, references {known}")

    def verify(self, pem, *purpose):
        openssl("verify", *purpose, "-CAfile", self.server.authority, "-untrusted", self.server.intermediate, stdin=pem)


class Issuance(AgentCase):
    def test_what_is_asked_for_and_what_comes_of_it_satisfies_openssl(self):
        # The longer a name, the further the request's last line goes.
        for account in (ACCOUNT, f"{'x' * 30}@example.com"):
            with self.case(account, account):
                self.server.accounts({"name": account, "password": PASSWORD})
                self.assertIsNotNone(self.add_with_certificate(account))
                request = self.server.received("createCert")[-1]["parameters"]["CSR"]
                openssl("req", "-verify", "-noout", stdin=request)
                self.assertEqual(openssl("req", "-outform", "PEM", stdin=request), request)
                text = openssl("req", "-noout", "-text", stdin=request)
                for part in (f'Subject: CN = {account}, C = US, O = "Velto, Inc."\n', "Public-Key: (2048 bit)",
                             "X509v3 Key Usage: critical\n                    Digital Signature, Key Encipherment\n",
                             "Signature Algorithm: sha256WithRSAEncryption"):
                    self.assertIn(part, text)
                entry = self.entry(account)
                self.verify(entry["Certificate"], "-purpose", "sslclient")
                self.assertEqual(openssl("req", "-noout", "-pubkey", stdin=request),
                                 openssl("x509", "-noout", "-pubkey", stdin=entry["Certificate"]))
                self.assertEqual(self.stored(), (1, 2))

    def test_a_renewal_leaves_nothing_of_what_it_replaces(self):
        with self.case("renewal"):
            self.add_with_certificate()
            first, items = self.entry(), self.world.keychain_items()
            self.add_with_certificate()
            self.assertEqual(self.entry()["SerialNumber"], first["SerialNumber"], "there is one already")
            self.add_with_certificate(ForceCertificateCreation=True)
            self.assertNotEqual(self.entry()["SerialNumber"], first["SerialNumber"])
            self.assertEqual(self.stored(), (1, 2))
            renewed = self.world.keychain_items()
            self.assertNotIn(first["CertificateReference"], renewed)
            self.assertEqual(len(renewed), len(items))

    def test_the_agent_itself_fetches_what_is_not_there_at_once(self):
        with self.case("polls", issuance="token", pendingPolls=1, pendingAnswer="dsCert", issuanceDelay=1):
            self.assertIsNotNone(self.add_with_certificate(certwaitduration=60, timeout=90))
            self.assertEqual(self.entry()["CertStatus"], "CERT_ISSUED")
            self.verify(self.entry()["Certificate"])
            self.assertNotIn("CertificateToken", self.record())
            self.assertEqual(self.stored(), (1, 2))
            counts = self.server.counts()
            self.assertEqual((counts["createCert"], counts["fetchCert"], counts["downloadCertComplete"]), (1, 2, 1))
            state = self.client.call(CHECK, VeltoID=ACCOUNT, options={"CheckNetwork": True})["status"]
            self.assertIn(state, (1, 2), "evaluated under the authority, or not long ago")

    def test_a_fetch_that_fails_costs_no_certificate(self):
        for wrong in ({"status": 503}, {"fault": {"code": -1, "string": "busy"}}):
            with self.case(wrong, issuance="token", issuanceDelay=1):
                self.server.next("fetchCert", **wrong)
                self.assertIsNotNone(self.add_with_certificate(certwaitduration=60, timeout=90))
                self.assertEqual(self.entry()["CertStatus"], "CERT_ISSUED")
                counts = self.server.counts()
                self.assertEqual((counts["createCert"], counts["fetchCert"], counts["downloadCertComplete"]), (1, 2, 1))

    def test_forgetting_waits_for_nobody_and_what_comes_later_is_dropped(self):
        with self.case("at once"), self.world.client() as other, concurrent.futures.ThreadPoolExecutor() as pool:
            self.server.next("createCert", delay=4)
            add = pool.submit(other.add, CreateCSRAsynchronously=False)
            self.assertTrue(self.server.wait("createCert"))
            self.assertTrue(self.client.call(FORGET, VeltoID=ACCOUNT)["success"])
            self.assertFalse(add.done(), "the server has not answered yet")
            self.assertNotIn(ACCOUNT, self.database()["Accounts"])
            self.assertNotIn("accountinfo", add.result())
            self.assertNotIn(ACCOUNT, self.database()["Accounts"])
            self.assertEqual(self.stored(), (0, 0))

    def test_a_failed_attempt_is_said_to_have_failed_and_leaves_no_key(self):
        fault = {"code": -20101, "string": "no"}
        cases = [("refused", {"issuance": "refuse"}, {}),
                 ("for another key", {"wrongKey": True}, {}),
                 ("a token of 1 MB", {"issuance": "never"}, {"set": {"CertificateToken": "t" * 2**20}}),
                 ("a status that nobody knows", {}, {"set": {"dsCert": {"CertStatus": "PERHAPS"}}}),
                 ("no status", {}, {"set": {"dsCert": {"Certificate": "hello"}}}),
                 ("a fault", {}, {"fault": fault}), ("no answer", {}, {"close": "before"}),
                 ("half an answer", {}, {"close": "middle"}), ("an answer of 17 MB", {}, {"size": 17 << 20})]
        for name, settings, injection in cases:
            with self.case(name, **settings):
                if injection:
                    self.server.next("createCert", **injection)
                self.assertIsNone(self.add_with_certificate())
                self.assertEqual(self.server.counts()["createCert"], 1)
                self.assertFalse(self.client.call(CERTIFICATE, VeltoID=ACCOUNT)["success"])
                self.assertEqual(self.stored(), (0, 0))

    def test_certificates_are_taken_as_they_come(self):
        for settings in [{"wrongIntermediate": True}, {"expiresAsText": True}, {"certificateLifetime": -DAY},
                         {"certificateLifetime": -1e12}, {"certificateLifetime": 0}, {"certificateLifetime": 1e12}]:
            with self.case(str(settings), **settings):
                self.assertTrue(self.add_with_certificate())
                self.assertEqual(self.stored(), (1, 2))
                entry = self.entry()
                end = openssl("x509", "-noout", "-enddate", "-dateopt", "iso_8601", stdin=entry["Certificate"])
                expires, made = entry["Expires"]["date"], entry["CreationDate"]["date"]
                self.assertEqual(expires, seconds(end.strip().removeprefix("notAfter=")))
                renewal = entry.get("NextRenewalAttempt", {}).get("date")
                if expires > made:
                    self.assertAlmostEqual(renewal, made + 0.75 * (expires - made), delta=1)
                else:
                    self.assertIsNone(renewal)

    def test_entries_of_any_kind_do_no_harm(self):
        pem = "-----BEGIN CERTIFICATE-----\nAAAA\n-----END CERTIFICATE-----\n"
        issued = {"CertStatus": "CERT_ISSUED", "SerialNumber": "1"}
        cases = [("no PEM", {"Certificate": "hello"}), ("no DER", {"Certificate": pem}),
                 ("bytes", {"Certificate": {"$base64": "AAAA"}}), ("nothing", {}), ("not even that", None),
                 ("1 MB of PEM", {"Certificate": pem.replace("AAAA", "A" * 2**20)}),
                 ("the year 1", {"Certificate": pem, "Expires": {"$date": "00010101T00:00:00Z"}}),
                 ("the year 9999", {"Certificate": pem, "Expires": {"$date": "99991231T23:59:59Z"}}),
                 ("some day", {"Certificate": pem, "Expires": "some day"}),
                 ("a number for a date", {"Certificate": pem, "Expires": 1e300}),
                 ("a number for a serial", {"Certificate": pem, "SerialNumber": 7})]
        for name, certificate in cases:
            with self.case(name):
                told = None if certificate is None else {**issued, **certificate}
                self.server.next("createCert", set={"dsCert": told})
                self.add_with_certificate()
                self.assertEqual(self.stored()[1], 0)
                shown = self.client.call(CERTIFICATE, VeltoID=ACCOUNT).get("result", {})
                self.assertNotIn("CertificateReference", shown)

    def test_delays_are_believed_within_reason(self):
        for delay, expected in [(None, 60), (1, 15), (30.5, 30.5), (DAY, DAY), (DAY + 1, 15), (-5, 15), (1e300, 15),
                                (float("nan"), 60), ("30", 60)]:
            with self.case(str(delay), issuance="never"):
                self.server.next("createCert", set={"Delay": delay})
                self.assertTrue(self.add_with_certificate())
                record = self.record()
                wait = record["NextCertificateFetchDate"]["date"] - record["CSRCreationDate"]["date"]
                self.assertAlmostEqual(wait, expected, delta=10)
                self.assertAlmostEqual(record.get("NextCertificateFetchDelta", 0), expected)
                self.assertEqual(self.stored(), (1, 0))


class ValidationRecords(AgentCase):
    @classmethod
    def setUpClass(cls):
        super().setUpClass()
        cls.key, cls.signer = cls.world.folder / "signer.key", cls.world.folder / "signer.pem"
        openssl("req", "-x509", "-newkey", "rsa:2048", "-nodes", "-subj", "/CN=Signer", "-keyout", cls.key, "-out",
                cls.signer)

    def signed(self, *options, form=plistlib.FMT_XML):
        """A record of the openssl command line, as the server sends it."""
        as_of = datetime.datetime.utcnow().replace(microsecond=0)
        payload = plistlib.dumps({"VeltoID": ACCOUNT, "ValidAsOf": as_of, "SuggestValidDuration": 4000}, fmt=form)
        file = self.world.folder / "payload"
        file.write_bytes(payload)
        message = openssl("cms", "-sign", "-binary", "-outform", "DER", "-signer", self.signer, "-inkey", self.key,
                          "-in", file, *options)
        return {"VIDVRecord": base64.b64encode(message).decode(), "VIDVRecordIdentifier": "openssl"}

    def ask(self, changes=None):
        """What is stored after the server was asked: the record's bytes and the date at which it is looked at again."""
        if changes:
            self.server.next("getMyInfo", times=100, set=changes)
        forced = {"ForceValidationRecordFetch": True}
        self.assertTrue(self.client.call(INFO, VeltoID=ACCOUNT, options=forced)["success"])
        data = self.client.call(CERTIFICATE, VeltoID=ACCOUNT,
                                CertificateType="VeltoIDValidatedItemsRecordDataCertificateType")["result"]
        next_check = self.record().get("VeltoIDAccountValidationRecordNextCheckDateKey", {}).get("date")
        self.server.clear_next()
        return data.get("VeltoIDAccountValidationRecordData"), next_check

    def test_records_that_verify_are_stored_with_their_next_check(self):
        attached = "-nodetach"
        for name, settings, changes in [
                ("XML", {}, {}), ("binary", {"validationRecordFormat": "binary"}, {}),
                ("date as text", {"validAsOfAsText": True}, {}),
                ("good for a year", {"SuggestValidDuration": 365 * DAY}, {}),
                ("of openssl", {}, self.signed(attached)),
                ("of openssl, binary", {}, self.signed(attached, form=plistlib.FMT_BINARY)),
                ("of openssl, streamed", {}, self.signed(attached, "-stream")),
                ("of openssl, PSS", {}, self.signed(attached, "-md", "sha512", "-keyopt", "rsa_padding_mode:pss"))]:
            with self.case(name, **settings):
                self.client.add()
                data, next_check = self.ask(changes)
                content = openssl("cms", "-verify", "-noverify", "-binary", "-inform", "DER", stdin=data)
                payload = plistlib.loads(content)
                self.assertEqual(payload["VeltoID"], ACCOUNT)
                self.assertEqual(next_check, seconds(payload["ValidAsOf"]) + 0.75 * payload["SuggestValidDuration"])
                if changes:
                    self.assertEqual(base64.b64encode(data).decode(), changes["VIDVRecord"])

    def test_others_are_stored_only_when_the_server_names_a_date(self):
        damaged = self.signed("-nodetach")
        damaged["VIDVRecord"] = damaged["VIDVRecord"][:-400]
        for name, settings, changes in [
                ("content", {"validationRecordTampering": "content"}, {}),
                ("signature", {"validationRecordTampering": "signature"}, {}),
                ("detached", {"validationRecordTampering": "detached"}, {}),
                ("array", {"validationRecordFormat": "array"}, {}), ("text", {"validationRecordFormat": "text"}, {}),
                ("of openssl, detached", {}, self.signed()),
                ("of openssl, without certificate", {}, self.signed("-nodetach", "-nocerts")),
                ("cut off", {}, damaged), ("no identifier", {}, {"VIDVRecordIdentifier": None})]:
            with self.case(name):
                self.client.add()
                self.assertIsNotNone(self.ask()[0])
                self.server.settings(**settings)
                self.assertEqual(self.ask(changes), (None, None))
                if name != "no identifier":
                    data, next_check = self.ask({**changes, "VIDVRecordNextCheckDate": "2031-02-03T04:05:06Z"})
                    self.assertIsNotNone(data)
                    self.assertEqual(next_check, seconds("2031-02-03T04:05:06Z"))


class People(AgentCase):
    def find(self, command, criterion, *values):
        reply = self.client.call(command, criteria={criterion: list(values)})
        return [person["VeltoID"] for person in reply.get("result", [])]

    def test_people_and_breadcrumbs_outlive_the_agent(self):
        jane, john = ("email", "jane@roe.example"), ("VeltoID", OTHER_ACCOUNT)
        mine = {"VeltoID": ACCOUNT, "hashedpassword": hashed(PASSWORD)}
        with self.case("people"):
            self.client.add()
            self.assertEqual(self.find(FIND_CACHED, *jane), [])
            self.assertEqual(self.find(FIND, *jane, "nobody@roe.example"), [ACCOUNT])
            self.server.settings(findPersonValidInterval=-1)
            self.assertEqual(self.find(FIND, *john), [OTHER_ACCOUNT])
            for identifier, data in [("a", b"\0"), ("b", bytes(range(256)) * 200), ("a", b"later"), ("ü/ \n", b"x")]:
                stored = self.client.call(SET_BREADCRUMB, **mine, identifier=identifier, breadcrumb=data)
                self.assertTrue(stored["success"], stored)
                fetched = self.client.call(GET_BREADCRUMB, **mine, identifier=identifier)
                self.assertEqual(fetched.get("breadcrumb"), data)
            self.world.stop_agent()
            self.world.start_agent()
            self.assertEqual(self.find(FIND_CACHED, *jane), [ACCOUNT])
            self.assertEqual(self.find(FIND_CACHED, *john), [], "the server said that he is not to be remembered")
            self.assertEqual(self.find(FIND_CACHED, "phone", jane[1]), [])
            self.assertEqual(self.server.counts()["findPerson"], 2)
            self.assertEqual(self.client.call(GET_BREADCRUMB, **mine, identifier="a")["breadcrumb"], b"later")
            self.assertFalse(self.client.call(GET_BREADCRUMB, **mine, identifier="none")["success"])
            refused = self.client.call(GET_BREADCRUMB, **{**mine, "hashedpassword": hashed("wrong")}, identifier="a")
            self.assertEqual((refused["success"], refused["error"]["Code"]), (False, -101))
            self.assertTrue(self.client.verify()["success"])


if __name__ == "__main__":
    unittest.main()
