"""Tests of the development identity server over real TLS, against a server process of their own.

Run from this directory with `/usr/bin/python3 -B -m unittest identity_server_test`, or by path with
`/usr/bin/python3 -B IdentityServer/identity_server_test.py`.
"""

from __future__ import annotations

import base64
import datetime
import hashlib
import http.client
import json
import plistlib
import ssl
import time
import unittest
import xmlrpc.client
from concurrent.futures import ThreadPoolExecutor
from pathlib import Path
from typing import Any

from control_client import ControlError, IdentityServer
from openssl_program import openssl
from server_case import (JANE, JANE_HASH, JOHN, PREFIX, SIGN_IN, TIMEOUT, ServerTest, call, exchange, fault_of,
                         server, setUpModule, signed_in)

# What the agent writes where implementations differ: one line, zone letter, wide integer, nil, broken base64.
AGENT_MEMBERS = (
    ("veltoConnect", f"<string>{JANE}</string>", JANE),
    ("pwdHash", f"<string>{JANE_HASH}</string>", JANE_HASH),
    ("When", "<dateTime.iso8601>20260117T01:58:42Z</dateTime.iso8601>", {"$date": "20260117T01:58:42Z"}),
    ("Wide", "<i4>5000000000</i4>", 5000000000),
    ("Nothing", "<nil/>", None),
    ("Blob", "<base64>" + "QUJD" * 16 + "\r\nQQ==</base64>", {"$base64": "QUJD" * 16 + "QQ=="}),
    ("Escaped &amp; &lt;", "<string>a&amp;lt;b &#x27;&quot;&gt; ü</string>", "a&lt;b '\"> ü"),
    ("Flag", "<boolean>1</boolean>", True),
    ("Lifetime", "<double>1209600</double>", 1209600.0),
)


def agent_document(*members: tuple[str, str, Any]) -> bytes:
    texts = "".join(f"<member><name>{name}</name><value>{value}</value></member>" for name, value, _ in members)
    return (f'<?xml version="1.0"?><methodCall><methodName>{PREFIX}authenticate</methodName><params><param>'
            f"<value><struct>{texts}</struct></value></param></params></methodCall>").encode()


class SignInTest(ServerTest):
    def test_sign_in_is_answered_by_account_password_and_state(self) -> None:
        password = "p\u00e4ss"
        server.accounts({"name": "New.User@Example.com", "password": password},
                        {"name": "off@example.com", "pwdHash": JANE_HASH, "disabled": True})
        new_hash = hashlib.sha256(password.encode()).hexdigest()
        for label, name, password_hash, expected in (
                ("right", JANE, JANE_HASH, None), ("name in another case", "Jane.ROE@example.com", JANE_HASH, None),
                ("added account", "new.user@example.com", new_hash, None), ("wrong password", JANE, "0" * 64, -20101),
                ("hash in upper case", JANE, JANE_HASH.upper(), -20101), ("hash not in ASCII", JANE, "ü", -20101),
                ("hash of another type", JANE, 5, -20101), ("unknown", "nobody@example.com", JANE_HASH, -20101),
                ("disabled", "off@example.com", JANE_HASH, -20209),
                ("disabled, wrong password", "off@example.com", "", -20101)):
            with self.subTest(label):
                parameters = {"veltoConnect": name, "pwdHash": password_hash}
                self.assertEqual(fault_of("authenticate", parameters), expected)

    def test_reply_follows_settings_and_account(self) -> None:
        reply = call("authenticate", SIGN_IN)
        self.assertEqual((reply["Version"], reply["dsSessionValidityDuration"]), (101, 300))
        self.assertTrue(reply["encDsId"])
        self.assertNotIn("CertificateIsValid", reply)
        self.assertNotEqual(reply["dsSession"], self.session["dsSession"])
        server.settings(Version=102, dsSessionValidityDuration=None)
        server.accounts({"name": JANE, "CertificateIsValid": False, "encDsId": "changed"})
        self.addCleanup(server.accounts, {"name": JANE, "CertificateIsValid": None, "encDsId": reply["encDsId"]})
        reply = call("authenticate", SIGN_IN)
        self.assertEqual((reply["Version"], reply["encDsId"]), (102, "changed"))
        self.assertIs(reply["CertificateIsValid"], False)
        self.assertNotIn("dsSessionValidityDuration", reply)

    def test_calls_that_no_method_can_serve_are_faults(self) -> None:
        server.accounts({"name": "leaver@example.com", "pwdHash": JANE_HASH, "disabled": False})
        leaver = signed_in("leaver@example.com")
        server.accounts({"name": "leaver@example.com", "disabled": True})
        self.assertIn(b"unknown method", exchange(agent_document().replace(PREFIX.encode(), b""))[1])
        for label, method, parameters, code in (
                ("no session", "getMyInfo", {}, -1), ("unknown session", "getMyInfo", {"dsSession": "x"}, -1),
                ("disabled meanwhile", "getMyInfo", {"dsSession": leaver["dsSession"]}, -20209),
                ("unknown method", "getYourInfo", self.session, -1),
                ("not a struct", "getMyInfo", "text", -1)):
            with self.subTest(label):
                self.assertEqual(fault_of(method, parameters), code)


class MyInfoTest(ServerTest):
    def content(self, reply: dict[str, Any], *options: str) -> bytes:
        """The content of the reply's record; AssertionError with the reason when openssl does not accept it."""
        return openssl("cms", "-verify", "-binary", "-inform", "DER", "-CAfile", server.authority, *options,
                       stdin=base64.b64decode(reply["VIDVRecord"], validate=True))

    def verified(self, reply: dict[str, Any]) -> dict[str, Any]:
        return plistlib.loads(self.content(reply))

    def test_details_come_with_a_signed_record(self) -> None:
        reply = call("getMyInfo", self.session)
        self.assertEqual((reply["VeltoID"], reply["firstNm"], reply["lastNm"]), (JANE, "Jane", "Roe"))
        self.assertEqual((reply["PrimaryEmail"], reply["ValidatedEmail"]), (JANE, [JANE]))
        self.assertEqual((len(reply["AllEmails"]), len(reply["ValidatedPhones"])), (2, 1))
        statement = self.verified(reply)
        self.assertEqual(statement["SuggestValidDuration"], 2592000)
        self.assertLess(abs(datetime.datetime.utcnow() - statement["ValidAsOf"]), datetime.timedelta(minutes=10))
        for key in ("encDsId", "ValidatedEmail", "ValidatedPhones"):
            self.assertEqual(statement[key], reply[key])

    def test_record_is_sent_until_the_client_has_it(self) -> None:
        first = call("getMyInfo", self.session)
        known = self.session | {"ClientVIDVRecordIdentifier": first["VIDVRecordIdentifier"]}
        self.assertEqual(call("authenticate", SIGN_IN)["VeltoIDRecordIdentifier"], first["VIDVRecordIdentifier"])
        self.assertNotIn("VIDVRecord", call("getMyInfo", known))
        server.settings(SuggestValidDuration=0)
        aged = call("getMyInfo", known)
        self.assertEqual(self.verified(aged)["SuggestValidDuration"], 0)
        self.assertNotEqual(call("getMyInfo", known)["VIDVRecordIdentifier"], aged["VIDVRecordIdentifier"])
        server.settings(SuggestValidDuration=2592000)
        changes = {"ValidatedPhones": ["+15555550199"], "ValidForInterval": 60, "firstNm": None,
                   "VIDVRecordNextCheckDate": "2030-01-01T00:00:00Z"}
        server.accounts({"name": JANE, **changes})
        self.addCleanup(server.accounts, {
            "name": JANE, "ValidatedPhones": ["+15555550123"], "firstNm": "Jane", "ValidForInterval": None,
            "VIDVRecordNextCheckDate": None})
        changed = call("getMyInfo", known)
        self.assertEqual({key: changed.get(key) for key in changes}, changes)
        self.assertEqual(self.verified(changed)["ValidatedPhones"], ["+15555550199"])

    def test_records_take_the_form_that_is_set(self) -> None:
        known = call("getMyInfo", self.session)["VIDVRecordIdentifier"]
        for settings, start in (({"validationRecordFormat": "binary"}, b"bplist00"),
                                ({"validationRecordFormat": "xml", "validAsOfAsText": True}, b"<?xml")):
            with self.subTest(settings):
                server.settings(**settings)
                reply = call("getMyInfo", self.session | {"ClientVIDVRecordIdentifier": known})
                self.assertTrue(self.content(reply).startswith(start))
                self.assertEqual(self.verified(reply)["encDsId"], reply["encDsId"])
        self.assertRegex(self.verified(reply)["ValidAsOf"], r"^\d{4}-\d\d-\d\dT\d\d:\d\d:\d\dZ$")
        server.settings(validationRecordFormat="array")
        self.assertIsInstance(self.verified(call("getMyInfo", self.session)), list)
        server.settings(validationRecordFormat="text")
        self.assertRaises(plistlib.InvalidFileException, self.verified, call("getMyInfo", self.session))

    def test_records_are_tampered_with_as_set(self) -> None:
        for form in ("xml", "binary", "array", "text"):
            for tampering, reason in (("content", "SignerInfo_verify_content:verification failure"),
                                      ("signature", "SignerInfo_verify:verification failure"),
                                      ("detached", "no content")):
                with self.subTest(form=form, tampering=tampering):
                    server.settings(validationRecordFormat=form, validationRecordTampering=tampering)
                    with self.assertRaisesRegex(AssertionError, reason):
                        self.content(call("getMyInfo", self.session))
        server.settings(validationRecordFormat="xml", validationRecordTampering="content")
        made_out = plistlib.loads(self.content(call("getMyInfo", self.session), "-no_content_verify"))
        self.assertLess(datetime.datetime.utcnow() - made_out["ValidAsOf"], datetime.timedelta(minutes=10))


class PeopleTest(ServerTest):
    def test_people_are_found_by_what_was_validated_for_them(self) -> None:
        found = lambda **criteria: [
            (match["matched"], match["value"], match["VeltoID"], match.get("firstNm"))
            for match in call("findPerson", self.session | {"searchCriteria": criteria})["matches"]]
        namesake = {"name": "twin@example.com", "pwdHash": "0", "AllEmails": ["JANE@roe.example"],
                    "PrimaryEmail": "first@example.com"}
        server.accounts(namesake)
        self.addCleanup(server.accounts, namesake | {"AllEmails": None, "PrimaryEmail": None})
        for criteria, expected in (
                ({}, []), ({"email": ["nobody@example.com", ""]}, []), ({"phone": [JANE]}, []),
                ({"email": ["first@example.com"]}, [("email", "first@example.com", "twin@example.com", None)]),
                ({"phone": ["+15555550123"]}, [("phone", "+15555550123", JANE, "Jane")]),
                ({"VeltoID": ["John.DOE@example.com"]}, [("VeltoID", "John.DOE@example.com", JOHN, "John")]),
                ({"email": [JOHN, "jane@roe.example"], "VeltoID": [JOHN]},
                 [("email", JOHN, JOHN, "John"), ("email", "jane@roe.example", JANE, "Jane"),
                  ("email", "jane@roe.example", "twin@example.com", None), ("VeltoID", JOHN, JOHN, "John")])):
            with self.subTest(criteria):
                self.assertEqual(found(**criteria), expected)
        for bad in ("text", {"email": JANE}, {"email": [1]}, {"shoeSize": ["9"]}):
            with self.subTest(bad):
                self.assertEqual(fault_of("findPerson", self.session | {"searchCriteria": bad}), -1)
        by_phone = self.session | {"searchCriteria": {"phone": ["+15555550123"]}}
        self.assertNotIn("ValidInterval", call("findPerson", by_phone)["matches"][0])
        server.settings(findPersonValidInterval=3600)
        self.assertEqual(call("findPerson", by_phone)["matches"][0]["ValidInterval"], 3600)

    def test_breadcrumbs_are_kept_by_account_machine_and_key(self) -> None:
        place = self.session | {"machineUUID": "M", "breadcrumbKey": "K"}
        self.assertEqual(call("fetchBreadcrumbEk", place), {})
        for text in ("QUJD", "QUJD\nREVG"):
            self.assertEqual(call("saveBreadcrumbEk", place | {"ek": text}), {})
            self.assertEqual(call("fetchBreadcrumbEk", place), {"ek": text})
        server.accounts({"name": "neighbour@example.com", "pwdHash": JANE_HASH})
        neighbour = signed_in("neighbour@example.com")["dsSession"]
        for change in ({"machineUUID": "N"}, {"breadcrumbKey": "L"}, {"dsSession": neighbour}):
            with self.subTest(change):
                self.assertEqual(call("fetchBreadcrumbEk", place | change), {})
        for change in ({"ek": "?"}, {"ek": "QUJD", "machineUUID": ""}, {"ek": "QUJD", "breadcrumbKey": 1}):
            with self.subTest(change):
                self.assertEqual(fault_of("saveBreadcrumbEk", place | change), -1)


class WireTest(ServerTest):
    def test_every_form_that_the_agent_writes_is_understood_and_recorded(self) -> None:
        document = agent_document(*AGENT_MEMBERS)
        status, body = exchange(document, User_Agent="VeltoIDXMLRPC")
        self.assertEqual(status, 200)
        self.assertIn("dsSession", xmlrpc.client.loads(body)[0][0])
        (received,) = server.received("authenticate")
        self.assertEqual(received["raw"], document.decode())
        self.assertEqual(received["headers"]["User-Agent"], "VeltoIDXMLRPC")
        names = [name.replace("&amp;", "&").replace("&lt;", "<") for name, _, _ in AGENT_MEMBERS]
        self.assertEqual(received["parameters"], dict(zip(names, (value for _, _, value in AGENT_MEMBERS))))

    def test_documents_that_are_no_calls_are_refused_and_recorded(self) -> None:
        good = agent_document()
        deep = "<array><data><value>" * 20000 + "</value></data></array>" * 20000
        for label, body in (
                ("empty", b""), ("no XML", b"hello"), ("half a document", good[:-20]), ("wrong content type", good),
                ("a reply", xmlrpc.client.dumps(("x",), methodresponse=True).encode()), ("not UTF-8", b"\xff\xfe\xff"),
                ("bad date", agent_document(("d", "<dateTime.iso8601>26</dateTime.iso8601>", 0))),
                ("bad integer", agent_document(("i", "<i4>five</i4>", 0))),
                ("very deep", agent_document(("a", deep, 0)))):
            with self.subTest(label):
                server.clear_received()
                content_type = "application/json" if body == good else "text/xml"
                self.assertEqual(exchange(body, Content_Type=content_type)[0], 400)
                (received,) = server.received()
                self.assertEqual((received["method"], received["raw"]),
                                 ("(malformed)", body.decode("utf-8", "replace")))
                self.assertTrue(received["error"])
        self.assertEqual(call("authenticate", SIGN_IN)["Version"], 101)


class InjectionTest(ServerTest):
    def observe(self) -> Any:
        """What a getMyInfo call meets: a status and text, a fault, a reply or a broken connection."""
        try:
            status, body = exchange(xmlrpc.client.dumps((self.session,), PREFIX + "getMyInfo").encode())
            if status != 200 or b"<methodResponse>" not in body:
                return status, body.decode("latin-1")
            return xmlrpc.client.loads(body, use_builtin_types=True)[0][0]
        except xmlrpc.client.Fault as fault:
            return fault.faultCode, fault.faultString
        except (http.client.HTTPException, ConnectionError, ssl.SSLError) as error:
            return "cut", len(getattr(error, "partial", b"")), isinstance(error, http.client.IncompleteRead)

    def test_outcomes_that_replace_the_reply(self) -> None:
        for injection, expected in (
                ({"fault": {"code": -20283, "string": "no <&> ü"}}, (-20283, "no <&> ü")),
                ({"status": 500}, (500, "")), ({"status": 503, "body": "<html>busy"}, (503, "<html>busy")),
                ({"body": "<?xml version='1.0'?><half"}, (200, "<?xml version='1.0'?><half")),
                ({"bodyBase64": "/wA="}, (200, "\xff\x00")), ({"close": "before"}, ("cut", 0, False)),
                ({"close": "headers"}, ("cut", 0, True))):
            with self.subTest(injection):
                server.next("getMyInfo", **injection)
                self.assertEqual(self.observe(), expected)
                self.assertEqual(self.observe()["lastNm"], "Roe")
        whole = len(exchange(xmlrpc.client.dumps((self.session,), PREFIX + "getMyInfo").encode())[1])
        server.next(close="middle")
        self.assertEqual(self.observe(), ("cut", whole // 2, True))

    def test_set_changes_fields_of_the_reply(self) -> None:
        changes = {"FlushAndExit": True, "NextLaunchTimeInterval": 3600, "lastNm": "Other", "firstNm": None,
                   "MetaInformation": {"X": "NULL", "list": [1, 0.5]}, "Blob": {"$base64": "QUJD"},
                   "When": {"$date": "20260117T01:58:42Z"}}
        server.next("getMyInfo", set=changes)
        reply = self.observe()
        self.assertEqual({key: reply.get(key) for key in changes},
                         changes | {"Blob": b"ABC", "When": datetime.datetime(2026, 1, 17, 1, 58, 42)})

    def test_delay_comes_after_the_call_is_recorded(self) -> None:
        server.next("getMyInfo", delay=0.3, status=500)
        began = time.monotonic()
        with ThreadPoolExecutor() as pool:
            seen = pool.submit(self.observe)
            self.assertTrue(server.wait("getMyInfo"))
            self.assertEqual(call("authenticate", SIGN_IN)["Version"], 101)
            self.assertEqual(seen.result(TIMEOUT), (500, ""))
        self.assertGreaterEqual(time.monotonic() - began, 0.3)

    def test_injections_wait_for_their_method_in_order_and_as_often_as_told(self) -> None:
        server.next("authenticate", status=501)
        server.next("getMyInfo", times=2, status=502)
        server.next(status=503)
        self.assertEqual([self.observe() for _ in range(3)], [(502, ""), (502, ""), (503, "")])
        self.assertEqual(self.observe()["lastNm"], "Roe")
        met = [call["injection"] for call in server.received("getMyInfo")][-4:]
        self.assertEqual([injection and injection["status"] for injection in met], [502, 502, 503, None])
        self.assertEqual(server.pending(), [{"method": "authenticate", "times": 1}])
        server.clear_next()
        self.assertIsNone(fault_of("authenticate", SIGN_IN))


class ControlTest(ServerTest):
    def refusal(self, verb: str, path: str, value: Any = None) -> int:
        with self.assertRaises(ControlError) as caught:
            server.command(verb, path, value)
        return caught.exception.status

    def test_mistakes_are_explained_and_change_nothing(self) -> None:
        mistakes = {
            "/next": [5, [{"status": 500}, {"method": "*"}], {"method": "typo", "status": 500}, {"tatus": 500},
                      {"status": 500, "close": "before"}, {"status": 99}, {"status": 500, "times": 0}, {"delay": True},
                      {"fault": {"string": "no code"}}, {"fault": {"code": 2**40}}, {"bodyBase64": "?"},
                      {"body": "\ud800"}, {"size": 2**40}, {"close": "late"}, {"set": {"Wide": 2**40}},
                      {"set": {"a": [None]}}, {"set": {"When": {"$date": "soon"}}}, {"set": {"Blob": {"$base64": 5}}}],
            "/accounts": [["x"], [{"name": JANE, "pwdHash": "0"}, {"name": "x"}], {"name": JANE, "disabled": "yes"},
                          {"name": JANE, "AllEmails": [1]}],
            "/settings": [{"Version": 102, "record": 1}, {"x": 1}, {"Version": 102, "issuance": "later"},
                          {"pendingPolls": -1}, {"issuanceDelay": "5"}, {"issuanceDelay": float("nan")},
                          {"validationRecordTampering": "none"}],
            "/revoke": ["00", {}],
            "/wait": [{"count": "many"}, {"timeout": 1e9}]}
        for path, value in ((path, value) for path, values in mistakes.items() for value in values):
            with self.subTest(path=path, value=value):
                self.assertEqual(self.refusal("POST", path, value), 400)
        self.assertEqual((self.refusal("GET", "/nowhere"), self.refusal("DELETE", "/health")), (404, 405))
        self.assertEqual(server.pending(), [])
        self.assertEqual(call("authenticate", SIGN_IN)["Version"], 101)

    def test_calls_are_counted_awaited_and_forgotten(self) -> None:
        self.assertFalse(server.wait("getMyInfo", timeout=0))
        with ThreadPoolExecutor() as pool:
            reached = pool.submit(server.wait, "getMyInfo", count=3, timeout=TIMEOUT)
            for _ in range(2):
                call("getMyInfo", self.session)
            server.settings(record=False)
            call("getMyInfo", self.session)
            fault_of("createCert", {})
            self.assertTrue(reached.result())
        self.assertEqual(server.counts(), {"getMyInfo": 3, "createCert": 1, "*": 4})
        self.assertEqual(len(server.received()), 2)
        server.clear_received()
        self.assertEqual((server.received(), server.counts()), ([], {}))


class TrustTest(ServerTest):
    def test_only_the_right_name_under_the_right_authority_is_trusted(self) -> None:
        self.assertIsNone(fault_of("authenticate", SIGN_IN))
        by_address = server.url.replace("localhost", "127.0.0.1")
        self.assertEqual(call("authenticate", SIGN_IN, by_address)["Version"], 101)
        for url, reason in ((server.wrong_name_url, "Hostname mismatch"),
                            (server.unknown_authority_url, "unable to get local issuer certificate")):
            with self.subTest(url=url), self.assertRaisesRegex(ssl.SSLCertVerificationError, reason):
                call("authenticate", SIGN_IN, url)

    def test_a_restart_keeps_the_authority_and_takes_accounts_from_a_file(self) -> None:
        state = Path(server.authority).parent
        files = server.authority, server.intermediate
        before = [Path(file).read_bytes() for file in files]
        accounts = state / "accounts.json"
        accounts.write_text(json.dumps([{"name": "only@example.com", "pwdHash": JANE_HASH}]))
        with IdentityServer(state, "--accounts", str(accounts)) as second:
            self.assertEqual((second.authority, second.intermediate), files)
            self.assertEqual([Path(file).read_bytes() for file in files], before)
            only = SIGN_IN | {"veltoConnect": "only@example.com"}
            self.assertEqual(call("authenticate", only, second.url)["Version"], 101)
            self.assertRaises(xmlrpc.client.Fault, call, "authenticate", SIGN_IN, second.url)
            self.assertEqual(second.stop(), 0)
        self.assertEqual({path.name: path.stat().st_mode & 0o777 for path in state.glob("*author*")},
                         {"authority.pem": 0o644, "authority-key.pem": 0o600})
        self.assertEqual(list(state.glob(".new-*")), [])


if __name__ == "__main__":
    unittest.main()
