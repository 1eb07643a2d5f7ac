"""Tests of everything about client certificates, with the openssl program as judge.

Run like `identity_server_test.py`.
"""

from __future__ import annotations

import ssl
import unittest
import xmlrpc.client
from datetime import datetime, timedelta
from pathlib import Path
from typing import Any

from cryptography import x509
from cryptography.hazmat.primitives import hashes, serialization
from cryptography.hazmat.primitives.asymmetric import ec, rsa
from cryptography.x509.name import _ASN1Type as StringType
from cryptography.x509.oid import NameOID

from control_client import IdentityServer
from openssl_program import openssl
from server_case import (JANE, JOHN, JOHN_HASH, SIGN_IN, ServerTest, call, directory, exchange, fault_of, server,
                         setUpModule, signed_in)

KEY = rsa.generate_private_key(65537, 2048)
KEY_TEXT = KEY.private_bytes(serialization.Encoding.PEM, serialization.PrivateFormat.PKCS8,
                             serialization.NoEncryption()).decode()
WEEK = 604800.0
PLAIN_NAME = "plain name"
PENDING = -4164
NAME, COUNTRY, COMPANY = NameOID.COMMON_NAME, NameOID.COUNTRY_NAME, NameOID.ORGANIZATION_NAME
GOOD_SUBJECT = ((NAME, JANE), (COUNTRY, "US"), (COMPANY, "Velto, Inc."))


def csr(subject: Any = GOOD_SUBJECT, key: Any = KEY, kind: StringType = StringType.PrintableString) -> str:
    # The library's own check knows that a PrintableString has no "@".
    name = x509.Name([x509.NameAttribute(oid, value, kind, _validate=False) for oid, value in subject])
    request = x509.CertificateSigningRequestBuilder().subject_name(name).sign(key, hashes.SHA256())
    return request.public_bytes(serialization.Encoding.PEM).decode()


def verify(certificate: str, intermediate: str = "") -> None:
    openssl("verify", "-purpose", "sslclient", "-x509_strict", "-CAfile", server.authority,
            "-untrusted", intermediate or server.intermediate, stdin=certificate)


class CertificateTest(ServerTest):
    def setUp(self) -> None:
        super().setUp()
        self.order = self.owner | {"CSR": csr(), "RequestedCertificateLifetimeInSeconds": WEEK}

    def issued(self, **settings: Any) -> dict[str, Any]:
        server.settings(issuance="at-once", **settings)
        return call("createCert", self.order)["dsCert"]


class RequestTest(CertificateTest):
    def test_a_certificate_is_what_was_asked_for(self) -> None:
        began = datetime.utcnow().replace(microsecond=0)
        reply = self.issued()
        certificate = reply["Certificate"]
        verify(certificate)
        read = openssl("x509", "-noout", "-serial", "-text", stdin=certificate)
        self.assertIn(f"serial={reply['SerialNumber']}\n", read)
        self.assertRegex(read, r"Key Usage: critical\s+Digital Signature, Key Encipherment\n")
        self.assertRegex(read, r"Extended Key Usage: \s+TLS Web Client Authentication\n")
        self.assertRegex(read, r"Basic Constraints: critical\s+CA:FALSE\n")
        parsed, asked = x509.load_pem_x509_certificate(certificate.encode()), x509.load_pem_x509_csr(csr().encode())
        self.assertEqual(parsed.subject.public_bytes(), asked.subject.public_bytes())
        self.assertEqual(parsed.public_key().public_numbers(), KEY.public_key().public_numbers())
        self.assertEqual(parsed.not_valid_after - parsed.not_valid_before, timedelta(seconds=WEEK))
        self.assertTrue(began <= parsed.not_valid_before <= datetime.utcnow())
        self.assertEqual((reply["CertStatus"], reply["CertType"]), ("CERT_ISSUED", "ClientCertificate"))
        self.assertEqual(reply["Expires"], parsed.not_valid_after)
        self.assertEqual(reply["IntermediateCert"], Path(server.intermediate).read_text())
        by_number = self.owner | {"certSerialNumber": reply["SerialNumber"]}
        self.assertEqual(call("fetchCert", by_number), {"Certificate": certificate})
        self.assertEqual(fault_of("fetchCert", self.owner | {"certSerialNumber": "00"}), -1)

    def test_a_request_of_another_program_is_understood(self) -> None:
        server.accounts({"name": PLAIN_NAME, "pwdHash": SIGN_IN["pwdHash"]})
        owner = signed_in(PLAIN_NAME)
        made = openssl("req", "-new", "-newkey", "rsa:3072", "-nodes", "-keyout", "/dev/null", "-config", "/dev/stdin",
                       stdin="[req]\nprompt=no\ndistinguished_name=n\nstring_mask=default\n"
                             f"[n]\nCN={PLAIN_NAME}\nC=US\nO=Velto, Inc.\n")
        verify(call("createCert", self.order | owner | {"CSR": made})["dsCert"]["Certificate"])
        self.assertEqual(server.certificates(PLAIN_NAME)[-1]["encDsId"], owner["encDsId"])

    def test_requests_that_are_wrong_are_refused(self) -> None:
        count = len(server.certificates())
        wider = (*GOOD_SUBJECT, (NameOID.LOCALITY_NAME, "Springfield"))
        signed = x509.load_pem_x509_csr(csr().encode()).public_bytes(serialization.Encoding.DER)
        tampered = x509.load_der_x509_csr(signed[:-1] + bytes((signed[-1] ^ 1,)))
        forged = tampered.public_bytes(serialization.Encoding.PEM).decode()
        other_name = ((NAME, JOHN), *GOOD_SUBJECT[1:])
        for label, change in (
                ("no session", {"dsSession": "x"}), ("other account's id", {"encDsId": "000100-05-0"}),
                ("no request", {"CSR": ""}), ("no PEM", {"CSR": "text"}), ("wrong signature", {"CSR": forged}),
                ("short key", {"CSR": csr(key=rsa.generate_private_key(65537, 1024))}),
                ("other kind of key", {"CSR": csr(key=ec.generate_private_key(ec.SECP256R1()))}),
                ("other name", {"CSR": csr(other_name)}), ("no subject", {"CSR": csr(())}),
                ("other order", {"CSR": csr(GOOD_SUBJECT[::-1])}), ("more than expected", {"CSR": csr(wider)}),
                ("less than expected", {"CSR": csr(GOOD_SUBJECT[:2])}),
                ("other company", {"CSR": csr((*GOOD_SUBJECT[:2], (COMPANY, "Velto")))}),
                ("UTF8String", {"CSR": csr(kind=StringType.UTF8String)}),
                ("lifetime as text", {"RequestedCertificateLifetimeInSeconds": "60"}),
                ("no lifetime", {"RequestedCertificateLifetimeInSeconds": 0.0})):
            with self.subTest(label):
                self.assertEqual(fault_of("createCert", self.order | change), -1)
        self.assertEqual(len(server.certificates()), count)


class IssuanceTest(CertificateTest):
    def answers(self, times: int) -> list[Any]:
        """The outcomes of createCert and so many fetches: fault codes, statuses, or "token"."""
        reply = call("createCert", self.order)
        if "CertificateToken" not in reply:
            return [reply["dsCert"]["CertStatus"]]
        claim = self.owner | {"CertificateToken": reply["CertificateToken"]}
        outcomes: list[Any] = ["token"]
        for _ in range(times):
            try:
                outcomes.append(call("fetchCert", claim)["dsCert"]["CertStatus"])
            except xmlrpc.client.Fault as fault:
                outcomes.append(fault.faultCode)
        return outcomes

    def test_ways_of_issuing(self) -> None:
        for settings, expected in (
                ({}, ["CERT_ISSUED"]), ({"issuance": "refuse"}, ["FAILED"]),
                ({"issuance": "token"}, ["token", "CERT_ISSUED", "CERT_ISSUED"]),
                ({"issuance": "token", "pendingPolls": 2}, ["token", PENDING, PENDING, "CERT_ISSUED"]),
                ({"issuance": "token", "pendingPolls": 1, "pendingAnswer": "dsCert"},
                 ["token", "SIGNIN_PENDING", "CERT_ISSUED"]),
                ({"issuance": "token-refuse", "pendingPolls": 1}, ["token", PENDING, "FAILED"]),
                ({"issuance": "never"}, ["token", PENDING, PENDING]),
                ({"issuance": "unknown", "unknownCertStatus": "ON_HOLD"}, ["token", "ON_HOLD"])):
            with self.subTest(settings):
                server.reset_settings()
                server.settings(**settings)
                self.assertEqual(self.answers(len(expected) - 1), expected)

    def test_a_token_belongs_to_its_account_and_is_used_up(self) -> None:
        server.settings(issuance="never")
        claim = self.owner | {"CertificateToken": call("createCert", self.order)["CertificateToken"]}
        self.assertEqual(fault_of("fetchCert", claim), PENDING)
        server.settings(issuance="token")
        for method in ("fetchCert", "downloadCertComplete"):
            self.assertEqual(fault_of(method, claim | signed_in(JOHN, JOHN_HASH)), -1)
        first = call("fetchCert", claim)
        self.assertEqual(call("fetchCert", claim), first)
        self.assertEqual(call("downloadCertComplete", claim), {})
        for method in ("fetchCert", "downloadCertComplete"):
            self.assertEqual(fault_of(method, claim), -1)

    def test_delays_are_as_set_and_within_the_client_s_bounds(self) -> None:
        for delay, bounds, expected in (
                (30, None, 30), (2.5, None, 2.5), (None, ("1", "2"), None), (30, ("5", "10"), 10), (1, ("5", "10"), 5),
                (7, ("5", "10"), 7), (30, ("ten", "20"), 30), (30, ("20", "10"), 30)):
            with self.subTest(delay=delay, bounds=bounds):
                server.settings(issuance="token", issuanceDelay=delay, pendingPolls=1, pendingAnswer="dsCert")
                names = ("__CERT_FETCH_DELAY_MIN", "__CERT_FETCH_DELAY_MAX")
                reply = call("createCert", self.order | dict(zip(names, bounds or ())))
                claim = self.owner | {"CertificateToken": reply["CertificateToken"]}
                pending, done = (call("fetchCert", claim) for _ in range(2))
                self.assertEqual((reply.get("Delay"), pending.get("Delay")), (expected, expected))
                self.assertNotIn("Delay", done)

    def test_forms_and_faults_of_what_is_issued(self) -> None:
        server.settings(issuance="token", dsCertAsArray=True, expiresAsText=True)
        claim = self.owner | {"CertificateToken": call("createCert", self.order)["CertificateToken"]}
        (entry,) = call("fetchCert", claim)["dsCert"]
        self.assertRegex(entry["Expires"], r"^\d{4}-\d\d-\d\dT\d\d:\d\d:\d\dZ$")
        self.assertEqual(server.certificates()[-1], {
            "serial": entry["SerialNumber"], "account": JANE, "encDsId": self.owner["encDsId"], "revoked": False,
            "notAfter": entry["Expires"]})
        other_key = self.issued(wrongKey=True)["Certificate"]
        verify(other_key)
        self.assertNotEqual(x509.load_pem_x509_certificate(other_key.encode()).public_key().public_numbers(),
                            KEY.public_key().public_numbers())
        foreign = self.issued(wrongKey=False, wrongIntermediate=True)
        file = Path(directory.name) / "foreign.pem"
        file.write_text(foreign["IntermediateCert"])
        with self.assertRaisesRegex(AssertionError, "unable to get local issuer certificate"):
            verify(foreign["Certificate"], intermediate=str(file))
        for lifetime in (-1, -1e300):
            with self.assertRaisesRegex(AssertionError, "certificate has expired"):
                verify(self.issued(wrongIntermediate=False, certificateLifetime=lifetime)["Certificate"])
        verify(self.issued(certificateLifetime=1e300)["Certificate"])


class StateTest(CertificateTest):
    def states(self, serial: str, session: dict[str, Any]) -> tuple[bool | None, bool | None]:
        named = {"CertificateSerialNumber": serial}
        return (call("authenticate", SIGN_IN | named).get("CertificateIsValid"),
                call("getMyInfo", session | named).get("CertificateIsValid"))

    def test_validity_is_told_to_who_names_a_certificate(self) -> None:
        good, expired = (self.issued(certificateLifetime=life)["SerialNumber"] for life in (None, -5))
        john = signed_in(JOHN, JOHN_HASH)
        for label, serial, expected in (("good", good, (True, True)), ("expired", expired, (False, False)),
                                        ("unknown", "00", (False, False))):
            with self.subTest(label):
                self.assertEqual(self.states(serial, self.session), expected)
        self.assertEqual(self.states(good, john), (True, False))
        self.assertNotIn("CertificateIsValid", call("getMyInfo", self.session))
        server.accounts({"name": JANE, "CertificateIsValid": False})
        self.assertEqual(self.states(good, self.session), (False, False))
        server.accounts({"name": JANE, "CertificateIsValid": None})
        self.assertEqual(fault_of("revokeCert", john | {"SerialNumber": good}), -1)
        self.assertEqual(call("revokeCert", self.session | {"SerialNumber": good}), {})
        self.assertEqual(self.states(good, self.session), (False, False))


class PageTest(CertificateTest):
    def get(self, certificate: str, newest: ssl.TLSVersion = ssl.TLSVersion.TLSv1_2) -> tuple[int, str]:
        """Status and text, as a client with this certificate gets them."""
        context = ssl.create_default_context(cafile=server.authority)
        context.maximum_version = newest
        if certificate:
            file = Path(directory.name) / "client.pem"
            file.write_text(certificate + KEY_TEXT)
            context.load_cert_chain(file)
        status, text = exchange(None, server.client_certificate_url, "GET", context)
        return status, text.decode()

    def test_the_page_shows_certificates_that_count(self) -> None:
        good = self.issued()
        text = (f"subject: O=Velto\\, Inc.,C=US,CN={JANE}\nissuer: CN=Velto ID development authority (clients)\n"
                f"serial: {good['SerialNumber']}\n")
        for newest in (ssl.TLSVersion.TLSv1_2, ssl.TLSVersion.TLSv1_3):
            self.assertEqual(self.get(good["Certificate"], newest), (200, text))
        server.revoke(good["SerialNumber"])
        self.assertEqual(self.get(good["Certificate"])[0], 403)
        self_made = openssl("req", "-x509", "-key", "/dev/stdin", "-subj", "/CN=self-made", stdin=KEY_TEXT)
        expired = self.issued(certificateLifetime=-5)["Certificate"]
        # By TLS 1.2, where the client waits for the verdict; by 1.3 it may be writing when that comes.
        for certificate, reason in (("", "HANDSHAKE_FAILURE"), (expired, "CERTIFICATE_EXPIRED"),
                                    (self_made, "UNKNOWN_CA")):
            with self.subTest(reason), self.assertRaisesRegex(ssl.SSLError, reason):
                self.get(certificate)


class RestartTest(CertificateTest):
    def test_a_root_that_allows_no_intermediate_is_renewed_under_its_key(self) -> None:
        state = Path(directory.name) / "old"
        state.mkdir()
        old = state / "old.pem"
        key = openssl("ecparam", "-name", "prime256v1", "-genkey", "-noout", stdin="")
        old.write_text(openssl("req", "-x509", "-key", "/dev/stdin", "-subj", "/CN=Velto ID development authority",
                               "-addext", "basicConstraints=critical,CA:TRUE,pathlen:0", stdin=key))
        (state / "authority-key.pem").write_text(key + old.read_text())
        anchors, intermediates = set(), set()
        for _ in range(2):
            with IdentityServer(state) as renewed:
                anchors.add(Path(renewed.authority).read_text())
                intermediates.add(Path(renewed.intermediate).read_text())
                openssl("verify", "-x509_strict", "-CAfile", renewed.authority, renewed.intermediate)
        self.assertEqual((len(anchors), len(intermediates)), (1, 1))
        public = {openssl("x509", "-noout", "-pubkey", stdin=text) for text in (*anchors, old.read_text())}
        self.assertEqual(len(public), 1)
        self.assertEqual((state / "intermediate-key.pem").stat().st_mode & 0o777, 0o600)
        (state / "authority-key.pem").unlink()
        with IdentityServer(state) as replaced:
            self.assertNotIn(Path(replaced.authority).read_text(), anchors)
            openssl("verify", "-CAfile", replaced.authority, replaced.intermediate)


if __name__ == "__main__":
    unittest.main()
