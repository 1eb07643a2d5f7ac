// Certificates in the keychain, as certificate items named by their persistent references.
//
// Every operation runs synchronously on KeychainDispatchQueue; outputs are set only on success and may be
// null. Without the system keychain no certificate is kept: adding fails, everything else finds nothing.
#pragma once

#include <optional>

#include "Platform/crypto/Certificate.h"
#include "Values/Value.h"

namespace veltoid {

/// Adds the certificate, or updates the item that it has. False without label or when the keychain refuses.
bool addCertificateToKeychain(const platform::Certificate& certificate, const String& label,
                              Data* persistentReference);

/// True and the reference of the item that holds the certificate.
bool copyPersistentRefForCertificate(const platform::Certificate& certificate, Data* persistentReference);

/// True when the item exists and can be read; the certificate is handed out when it is one.
bool copyCertificateFromKeychainGivenPersistentRef(const Data& persistentReference,
                                                   std::optional<platform::Certificate>* certificate);

/// True when the item was deleted or was already gone.
bool removeCertificateFromKeychainGivenPersistentRef(const Data& persistentReference);

/// The references of all certificate items, or of those with the label; none when there are none.
std::optional<Array> copyAllCertificatesFromKeychain();
std::optional<Array> copyCertificatesFromKeychainGivenLabel(const String& label);

}  // namespace veltoid
