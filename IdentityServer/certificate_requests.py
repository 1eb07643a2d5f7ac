"""Reading of certificate requests, and what is expected of them."""

from __future__ import annotations

from cryptography import x509
from cryptography.hazmat.primitives.asymmetric import rsa
from cryptography.x509.oid import NameOID

SMALLEST_KEY = 2048
COUNTRY = "US"
ORGANIZATION = "Velto, Inc."

SEQUENCE, SET, OBJECT_IDENTIFIER, PRINTABLE_STRING = 0x30, 0x31, 0x06, 0x13
# The contents of the three object identifiers, all of them below 2.5.4.
COMMON_NAME, COUNTRY_NAME, ORGANIZATION_NAME = b"\x55\x04\x03", b"\x55\x04\x06", b"\x55\x04\x0a"


def read_request(pem: str, account_name: str) -> x509.CertificateSigningRequest:
    """The request, when it is one for a client certificate of this account; ValueError says why it is not."""
    request = x509.load_pem_x509_csr(pem.encode())
    key = request.public_key()
    if not isinstance(key, rsa.RSAPublicKey) or key.key_size < SMALLEST_KEY:
        raise ValueError(f"the key is no RSA key of at least {SMALLEST_KEY} bits")
    if not request.is_signature_valid:
        raise ValueError("the signature does not belong to the key")
    common_names = request.subject.get_attributes_for_oid(NameOID.COMMON_NAME)
    name = common_names[0].value if common_names else ""
    if name.lower() != account_name.lower():
        raise ValueError("the common name is not the account's name")
    if request.subject.public_bytes() != _subject(name):
        raise ValueError(f"the subject is not the name, {COUNTRY} and {ORGANIZATION} as PrintableStrings")
    return request


def _subject(name: str) -> bytes:
    """The subject's DER. Written here because libraries refuse an "@" in a PrintableString, and clients do not."""
    parts = ((COMMON_NAME, name), (COUNTRY_NAME, COUNTRY), (ORGANIZATION_NAME, ORGANIZATION))
    return _der(SEQUENCE, *(_der(SET, _der(SEQUENCE, _der(OBJECT_IDENTIFIER, kind),
                                           _der(PRINTABLE_STRING, value.encode()))) for kind, value in parts))


def _der(tag: int, *contents: bytes) -> bytes:
    content = b"".join(contents)
    size = len(content)
    if size < 0x80:
        return bytes((tag, size)) + content
    length = size.to_bytes((size.bit_length() + 7) // 8, "big")
    return bytes((tag, 0x80 | len(length))) + length + content
