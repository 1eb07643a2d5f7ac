// X.509 certificates (RFC 5280), read from DER.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

/// Longer ones are refused.
inline constexpr size_t kMaxCertificateBytes = size_t{64} << 10U;

/// A certificate and what it says of itself; nothing of it has been verified. Equal when the DER is.
struct Certificate {
    std::vector<uint8_t> der;
    /// What people call it: its common name, else its organization; empty when it has neither.
    std::string summary;
    /// RFC 2253 texts.
    std::string subject;
    std::string issuer;
    /// Upper-case hexadecimal.
    std::string serialNumber;
    /// Seconds since 1970.
    double notBefore = 0;
    double notAfter = 0;
    /// SubjectPublicKeyInfo, DER.
    std::vector<uint8_t> publicKey;

    friend bool operator==(const Certificate& a, const Certificate& b) { return a.der == b.der; }
};

/// None when the bytes are not exactly one certificate, or its dates cannot be read. Any thread.
std::optional<Certificate> readCertificate(Bytes der);

}  // namespace platform
