// What an account needs to ask for a client certificate, and what comes back: a fresh RSA key pair with a
// certificate signing request, and the certificate from the server's PEM text. Any thread; nothing is kept.
#pragma once

#include <optional>

#include "Platform/crypto/Certificate.h"
#include "Values/Value.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"

namespace veltoid {

inline constexpr size_t kVeltoIDKeyBits = 2048;

/// Status of a key-pair generation that failed; 0 is success.
inline constexpr int32_t kKeyGenerationFailed = -1;

/// Generates a key pair and, signed with it, a certificate signing request (PKCS#10) as PEM text in lines of
/// 64 characters. Subject: commonName = the account name as given, countryName "US", organizationName "Velto,
/// Inc.". The status of the generation; outputs (which may be null) are cleared first and stay so when it
/// failed, or when it succeeded but no request could be made.
int32_t createKeyPairAndCertificateRequest(const String& accountName, String* request, Key* publicKey,
                                           Key* privateKey);

/// None when the text has no body or the body is no certificate.
std::optional<platform::Certificate> certificateFromPEM(const String& pem);

/// Keychain label of an account's certificate; null for null.
String certificateLabelForAccount(const String& accountName);

}  // namespace veltoid
