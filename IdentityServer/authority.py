"""The test authority: the one trust anchor of this server, and everything that it signs.

The root (key and certificate in one file, so that they can never come apart) is made once per state
directory and reused, because clients pin it and because what it issued must stay verifiable after a
restart. The certificates that the server itself uses are cheap and short-lived: they are issued anew at
each start and their keys never stay on disk.
"""

from __future__ import annotations

import datetime
import ipaddress
import os
import ssl
import tempfile
from dataclasses import dataclass
from pathlib import Path

from cryptography import x509
from cryptography.hazmat.primitives import hashes, serialization
from cryptography.hazmat.primitives.asymmetric import ec
from cryptography.hazmat.primitives.serialization import pkcs7
from cryptography.x509.oid import ExtendedKeyUsageOID, NameOID

ROOT_LIFETIME = datetime.timedelta(days=3650)
OWN_CERTIFICATE_LIFETIME = datetime.timedelta(days=90)
CLOCK_TOLERANCE = datetime.timedelta(hours=1)


@dataclass(frozen=True)
class Credential:
    """A private key and the certificate that belongs to it."""

    key: ec.EllipticCurvePrivateKey
    certificate: x509.Certificate

    def pem(self) -> bytes:
        """Key and certificate as one unencrypted PEM text."""
        key = self.key.private_bytes(
            serialization.Encoding.PEM, serialization.PrivateFormat.PKCS8, serialization.NoEncryption())
        return key + self.certificate_pem()

    def certificate_pem(self) -> bytes:
        return self.certificate.public_bytes(serialization.Encoding.PEM)


class Authority:
    """A root that issues certificates: kept on disk (`load_or_create`), or for one process (`create`)."""

    def __init__(self, root: Credential) -> None:
        self.root = root

    @classmethod
    def create(cls, name: str) -> Authority:
        key = ec.generate_private_key(ec.SECP256R1())
        subject = x509.Name([x509.NameAttribute(NameOID.COMMON_NAME, name)])
        builder = _builder(subject, subject, key.public_key(), key.public_key(), ROOT_LIFETIME)
        builder = builder.add_extension(x509.BasicConstraints(ca=True, path_length=0), critical=True)
        builder = builder.add_extension(_key_usage(signs_certificates=True), critical=True)
        return cls(Credential(key, builder.sign(key, hashes.SHA256())))

    @classmethod
    def load_or_create(cls, state_dir: Path) -> Authority:
        """The authority of a state directory; of two simultaneous first starts one makes it, both use it."""
        store = state_dir / "authority-key.pem"
        if not store.exists():
            root = cls.create("Velto ID development authority").root
            fresh = _private_temporary_file(state_dir, root.pem())
            try:
                os.link(fresh, store)
            except FileExistsError:
                pass
            finally:
                fresh.unlink()
        pem = store.read_bytes()
        key = serialization.load_pem_private_key(pem, password=None)
        if not isinstance(key, ec.EllipticCurvePrivateKey):
            raise ValueError(f"{store} does not hold an EC key")
        return cls(Credential(key, x509.load_pem_x509_certificate(pem)))

    def export_anchor(self, path: Path) -> None:
        """Writes the root certificate for clients, in one step, so that no reader sees half of it."""
        fresh = _private_temporary_file(path.parent, self.root.certificate_pem())
        fresh.chmod(0o644)
        fresh.replace(path)

    def issue_server(self, *names: str) -> Credential:
        """A credential for a TLS server of these host names and IP addresses."""
        return self._issue_own(names[0], x509.ExtendedKeyUsage([ExtendedKeyUsageOID.SERVER_AUTH]),
                               x509.SubjectAlternativeName([_general_name(name) for name in names]))

    def issue_signer(self) -> Credential:
        """A credential that signs validation records."""
        return self._issue_own("Velto ID validation records",
                               x509.ExtendedKeyUsage([ExtendedKeyUsageOID.EMAIL_PROTECTION]))

    def _issue_own(self, name: str, *extensions: x509.ExtensionType) -> Credential:
        key = ec.generate_private_key(ec.SECP256R1())
        subject = x509.Name([x509.NameAttribute(NameOID.COMMON_NAME, name)])
        builder = _builder(subject, self.root.certificate.subject, key.public_key(),
                           self.root.key.public_key(), OWN_CERTIFICATE_LIFETIME)
        builder = builder.add_extension(x509.BasicConstraints(ca=False, path_length=None), critical=True)
        builder = builder.add_extension(_key_usage(signs_certificates=False), critical=True)
        for extension in extensions:
            builder = builder.add_extension(extension, critical=False)
        return Credential(key, builder.sign(self.root.key, hashes.SHA256()))


def server_context(credential: Credential, state_dir: Path) -> ssl.SSLContext:
    """TLS 1.2+ with this credential; `ssl` reads keys from files only, hence the moment on disk."""
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
    context.minimum_version = ssl.TLSVersion.TLSv1_2
    file = _private_temporary_file(state_dir, credential.pem())
    try:
        context.load_cert_chain(file)
    finally:
        file.unlink()
    return context


def sign_message(content: bytes, signer: Credential) -> bytes:
    """A CMS signed-data message (DER) with the content and the signer's certificate inside."""
    builder = pkcs7.PKCS7SignatureBuilder().set_data(content)
    builder = builder.add_signer(signer.certificate, signer.key, hashes.SHA256())
    return builder.sign(serialization.Encoding.DER, [pkcs7.PKCS7Options.Binary])


def _builder(subject: x509.Name, issuer: x509.Name, public_key: ec.EllipticCurvePublicKey,
             issuer_key: ec.EllipticCurvePublicKey, lifetime: datetime.timedelta) -> x509.CertificateBuilder:
    now = datetime.datetime.utcnow()
    return (x509.CertificateBuilder().subject_name(subject).issuer_name(issuer).public_key(public_key)
            .serial_number(x509.random_serial_number())
            .not_valid_before(now - CLOCK_TOLERANCE).not_valid_after(now + lifetime)
            .add_extension(x509.SubjectKeyIdentifier.from_public_key(public_key), critical=False)
            .add_extension(x509.AuthorityKeyIdentifier.from_issuer_public_key(issuer_key), critical=False))


def _key_usage(signs_certificates: bool) -> x509.KeyUsage:
    return x509.KeyUsage(
        digital_signature=not signs_certificates, key_cert_sign=signs_certificates,
        crl_sign=signs_certificates, content_commitment=False, key_encipherment=False,
        data_encipherment=False, key_agreement=False, encipher_only=False, decipher_only=False)


def _general_name(name: str) -> x509.GeneralName:
    try:
        return x509.IPAddress(ipaddress.ip_address(name))
    except ValueError:
        return x509.DNSName(name)


def _private_temporary_file(directory: Path, content: bytes) -> Path:
    """A new file with mode 0600 from its first moment."""
    descriptor, name = tempfile.mkstemp(prefix=".new-", dir=directory)
    with os.fdopen(descriptor, "wb") as file:
        file.write(content)
    return Path(name)
