// RSA key pairs and certification requests (OpenSSL). Keys travel as DER: a private key as PKCS#8 (RFC 5958),
// a public one as SubjectPublicKeyInfo (RFC 5280). All operations may be called from any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string_view>
#include <vector>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

/// Longer encodings are refused: an RSA key of 16384 bits has less than 10,000 bytes.
inline constexpr size_t kMaxKeyBytes = size_t{64} << 10U;

struct KeyPair {
    SecretBytes privateKey;
    std::vector<uint8_t> publicKey;
};

/// A new pair; takes tens of milliseconds for 2048 bits. None (and a log line) when the library refuses.
std::optional<KeyPair> generateRSAKeyPair(size_t bits);

/// The public key of a private one; none when the bytes are no private key.
std::optional<std::vector<uint8_t>> publicKeyOf(Bytes privateKey);

/// Whether the bytes are exactly one public key.
bool isPublicKey(Bytes bytes);

/// One relative distinguished name of a subject (X.520 attribute types).
struct SubjectAttribute {
    enum class Type : uint8_t { CommonName, CountryName, OrganizationName };
    Type type;
    std::string_view value;
};

/// A certification request (PKCS#10, RFC 2986) in DER, signed with the private key (SHA-256), that asks for
/// the key usages digitalSignature and keyEncipherment (critical).
///
/// Each attribute is written in the given order, as a UTF8String when there is anything beyond ASCII in it,
/// else as a PrintableString holding the value's bytes as they are. PrintableString (X.680) has no "@" and no
/// "_": values with such characters make a request that strict readers may refuse, but the identity service
/// tells accounts apart by exactly this text.
///
/// None (and a log line) when the key is none or the library refuses.
std::optional<std::vector<uint8_t>> createCertificationRequest(Bytes privateKey,
                                                               std::span<const SubjectAttribute> subject);

}  // namespace platform
