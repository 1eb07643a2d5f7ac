"""The test authority: the one trust anchor of this server, and everything that it signs.

The root and the intermediate (each with key and certificate in one file, so that they can never come apart)
are made once per state directory and reused, because clients pin the root and because what was issued must
stay verifiable after a restart. The certificates that the server itself uses are cheap and short-lived: they
are issued anew at each start and their keys never stay on disk.
"""

from __future__ import annotations

import datetime
import ipaddress
import os
import ssl
import tempfile
from dataclasses import dataclass
from pathlib import Path
from typing import Callable

from cryptography import x509
from cryptography.exceptions import InvalidSignature
from cryptography.hazmat.primitives import hashes, serialization
from cryptography.hazmat.primitives.asymmetric import ec, rsa
from cryptography.hazmat.primitives.serialization import pkcs7
from cryptography.x509.oid import ExtendedKeyUsageOID, NameOID

AUTHORITY_LIFETIME = datetime.timedelta(days=3650)
OWN_CERTIFICATE_LIFETIME = datetime.timedelta(days=90)
CLOCK_TOLERANCE = datetime.timedelta(hours=1)
EARLIEST = datetime.datetime(1951, 1, 1)
LATEST = datetime.datetime(9999, 12, 31, 23, 59, 59)
KEY_USAGES = ("digital_signature", "content_commitment", "key_encipherment", "data_encipherment", "key_agreement",
              "key_cert_sign", "crl_sign", "encipher_only", "decipher_only")

PublicKey = ec.EllipticCurvePublicKey | rsa.RSAPublicKey


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
    """A root and its intermediate, which issues client certificates: kept on disk or for one process."""

    def __init__(self, root: Credential, intermediate: Credential) -> None:
        self.root = root
        self.intermediate = intermediate

    @classmethod
    def create(cls, name: str) -> Authority:
        root = _root(name, _new_key())
        return cls(root, _intermediate(root, _new_key()))

    @classmethod
    def load_or_create(cls, state_dir: Path) -> Authority:
        """The authority of a state directory; of two simultaneous first starts one makes it, both use it."""
        root = _kept(state_dir / "authority-key.pem", _may_have_intermediate,
                     lambda key: _root("Velto ID development authority", key))
        intermediate = _kept(state_dir / "intermediate-key.pem",
                             lambda credential: _is_issued_by(credential.certificate, root),
                             lambda key: _intermediate(root, key))
        return cls(root, intermediate)

    def issue_server(self, *names: str) -> Credential:
        """A credential for a TLS server of these host names and IP addresses."""
        return self._issue_own(names[0], x509.ExtendedKeyUsage([ExtendedKeyUsageOID.SERVER_AUTH]),
                               x509.SubjectAlternativeName([_general_name(name) for name in names]))

    def issue_signer(self) -> Credential:
        """A credential that signs validation records."""
        return self._issue_own("Velto ID validation records",
                               x509.ExtendedKeyUsage([ExtendedKeyUsageOID.EMAIL_PROTECTION]))

    def issue_client(self, subject: x509.Name, key: rsa.RSAPublicKey, lifetime: float) -> x509.Certificate:
        """A client certificate of the intermediate that ends `lifetime` seconds from now, or ended so long ago.

        It begins now: a client that plans by the length of a certificate's life gets the length it asked for.
        """
        now = datetime.datetime.utcnow().replace(microsecond=0)
        end = _moved(now, lifetime)
        begin = now if end > now else end - CLOCK_TOLERANCE
        builder = _builder(subject, self.intermediate, key, begin, end)
        builder = builder.add_extension(x509.BasicConstraints(ca=False, path_length=None), critical=True)
        builder = builder.add_extension(_key_usage(digital_signature=True, key_encipherment=True), critical=True)
        builder = builder.add_extension(x509.ExtendedKeyUsage([ExtendedKeyUsageOID.CLIENT_AUTH]), critical=False)
        return builder.sign(self.intermediate.key, hashes.SHA256())

    def _issue_own(self, name: str, *extensions: x509.ExtensionType) -> Credential:
        key = _new_key()
        now = datetime.datetime.utcnow()
        builder = _builder(_common_name(name), self.root, key.public_key(),
                           now - CLOCK_TOLERANCE, now + OWN_CERTIFICATE_LIFETIME)
        builder = builder.add_extension(x509.BasicConstraints(ca=False, path_length=None), critical=True)
        builder = builder.add_extension(_key_usage(digital_signature=True), critical=True)
        for extension in extensions:
            builder = builder.add_extension(extension, critical=False)
        return Credential(key, builder.sign(self.root.key, hashes.SHA256()))


def export_certificate(credential: Credential, path: Path) -> None:
    """Writes the certificate for clients, in one step, so that no reader sees half of it."""
    fresh = _private_temporary_file(path.parent, credential.certificate_pem())
    fresh.chmod(0o644)
    fresh.replace(path)


def server_context(credential: Credential, state_dir: Path,
                   clients_of: Authority | None = None) -> ssl.SSLContext:
    """TLS 1.2+ with this credential; with an authority, clients must show a certificate of its intermediate.

    `ssl` reads keys from files only, hence the moment on disk.
    """
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
    context.minimum_version = ssl.TLSVersion.TLSv1_2
    file = _private_temporary_file(state_dir, credential.pem())
    try:
        context.load_cert_chain(file)
    finally:
        file.unlink()
    if clients_of is not None:
        known = clients_of.root.certificate_pem() + clients_of.intermediate.certificate_pem()
        context.load_verify_locations(cadata=known.decode())
        context.verify_mode = ssl.CERT_REQUIRED
    return context


def sign_message(content: bytes, signer: Credential, detached: bool = False) -> bytes:
    """A CMS signed-data message (DER) with the signer's certificate and, unless detached, the content inside."""
    builder = pkcs7.PKCS7SignatureBuilder().set_data(content)
    builder = builder.add_signer(signer.certificate, signer.key, hashes.SHA256())
    options = [pkcs7.PKCS7Options.Binary]
    if detached:
        options.append(pkcs7.PKCS7Options.DetachedSignature)
    return builder.sign(serialization.Encoding.DER, options)


def _root(name: str, key: ec.EllipticCurvePrivateKey) -> Credential:
    return _authority_credential(_common_name(name), key, None, path_length=1)


def _intermediate(root: Credential, key: ec.EllipticCurvePrivateKey) -> Credential:
    name = root.certificate.subject.get_attributes_for_oid(NameOID.COMMON_NAME)[0].value
    return _authority_credential(_common_name(f"{name} (clients)"), key, root, path_length=0)


def _authority_credential(subject: x509.Name, key: ec.EllipticCurvePrivateKey, issuer: Credential | None,
                          path_length: int) -> Credential:
    """One that signs certificates; without an issuer it signs itself."""
    now = datetime.datetime.utcnow()
    builder = _builder(subject, issuer, key.public_key(), now - CLOCK_TOLERANCE, now + AUTHORITY_LIFETIME)
    builder = builder.add_extension(x509.BasicConstraints(ca=True, path_length=path_length), critical=True)
    builder = builder.add_extension(_key_usage(key_cert_sign=True, crl_sign=True), critical=True)
    return Credential(key, builder.sign(issuer.key if issuer else key, hashes.SHA256()))


def _may_have_intermediate(root: Credential) -> bool:
    length = root.certificate.extensions.get_extension_for_class(x509.BasicConstraints).value.path_length
    return length is None or length > 0


def _is_issued_by(certificate: x509.Certificate, issuer: Credential) -> bool:
    try:
        issuer.key.public_key().verify(certificate.signature, certificate.tbs_certificate_bytes,
                                       ec.ECDSA(hashes.SHA256()))
    except InvalidSignature:
        return False
    return True


def _kept(store: Path, is_usable: Callable[[Credential], bool],
          make: Callable[[ec.EllipticCurvePrivateKey], Credential]) -> Credential:
    """The credential of a file, made when there is none.

    One that is of no use any more is certified anew under its old key: whoever pinned or was certified by
    that key goes on working, and servers that do so at the same time agree.
    """
    if not store.exists():
        fresh = _private_temporary_file(store.parent, make(_new_key()).pem())
        try:
            os.link(fresh, store)
        except FileExistsError:
            pass
        finally:
            fresh.unlink()
    credential = _loaded(store)
    if not is_usable(credential):
        credential = make(credential.key)
        _private_temporary_file(store.parent, credential.pem()).replace(store)
    return credential


def _loaded(store: Path) -> Credential:
    pem = store.read_bytes()
    key = serialization.load_pem_private_key(pem, password=None)
    if not isinstance(key, ec.EllipticCurvePrivateKey):
        raise ValueError(f"{store} does not hold an EC key")
    return Credential(key, x509.load_pem_x509_certificate(pem))


def _builder(subject: x509.Name, issuer: Credential | None, key: PublicKey, begin: datetime.datetime,
             end: datetime.datetime) -> x509.CertificateBuilder:
    issuer_name = issuer.certificate.subject if issuer else subject
    issuer_key = issuer.key.public_key() if issuer else key
    return (x509.CertificateBuilder().subject_name(subject).issuer_name(issuer_name).public_key(key)
            .serial_number(x509.random_serial_number()).not_valid_before(begin).not_valid_after(end)
            .add_extension(x509.SubjectKeyIdentifier.from_public_key(key), critical=False)
            .add_extension(x509.AuthorityKeyIdentifier.from_issuer_public_key(issuer_key), critical=False))


def _moved(moment: datetime.datetime, seconds: float) -> datetime.datetime:
    """The moment so much later, or the nearest one that a certificate can state."""
    try:
        return min(max((moment + datetime.timedelta(seconds=seconds)).replace(microsecond=0), EARLIEST), LATEST)
    except OverflowError:
        return LATEST if seconds > 0 else EARLIEST


def _key_usage(**wanted: bool) -> x509.KeyUsage:
    return x509.KeyUsage(**dict.fromkeys(KEY_USAGES, False) | wanted)


def _new_key() -> ec.EllipticCurvePrivateKey:
    return ec.generate_private_key(ec.SECP256R1())


def _common_name(name: str) -> x509.Name:
    return x509.Name([x509.NameAttribute(NameOID.COMMON_NAME, name)])


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
