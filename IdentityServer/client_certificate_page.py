"""The HTTPS door that shows which client certificate it was shown; TLS has proved it by then."""

from __future__ import annotations

from cryptography import x509

from certificates import IssuedCertificates, serial_text
from loopback_http import LoopbackHandler

PAGE = "/client-certificate"
TEXT = "text/plain; charset=utf-8"


class ClientCertificateHandler(LoopbackHandler):
    """One connection of a client that has proved to own a certificate of the authority."""

    def do_GET(self) -> None:
        if self.path != PAGE:
            self.answer(404, b"not found\n", TEXT)
            return
        certificate = x509.load_der_x509_certificate(self.connection.getpeercert(binary_form=True))
        issued: IssuedCertificates = self.server.app
        known = issued.find(serial_text(certificate))
        if known is not None and known.revoked:
            self.answer(403, b"this certificate has been revoked\n", TEXT)
            return
        lines = (f"subject: {certificate.subject.rfc4514_string()}", f"issuer: {certificate.issuer.rfc4514_string()}",
                 f"serial: {serial_text(certificate)}")
        self.answer(200, "".join(f"{line}\n" for line in lines).encode(), TEXT)
