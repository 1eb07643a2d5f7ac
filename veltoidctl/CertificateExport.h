// Certificates and their private keys in the forms that other programs read.
#pragma once

#include <optional>
#include <string>

#include "Platform/crypto/Certificate.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"

namespace veltoidctl {

std::string pemOf(const platform::Certificate& certificate);

/// A private key, its certificate, and the issuer's certificate if that is known.
struct Identity {
    veltoid::Key privateKey;
    platform::Certificate certificate;
    std::optional<platform::Certificate> intermediate;
};

/// One PEM text: PKCS#8 key, certificate, intermediate certificate. Programs that want two files, one for the
/// key, take it twice.
platform::SecretBytes pemOf(const Identity& identity);

/// PKCS#12 (RFC 7292) under the password, which may be empty. Throws std::runtime_error when OpenSSL refuses.
platform::SecretBytes pkcs12Of(const Identity& identity, const platform::SecretText& password,
                               const std::string& name);

}  // namespace veltoidctl
