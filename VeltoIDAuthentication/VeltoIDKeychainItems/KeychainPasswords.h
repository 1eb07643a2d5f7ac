// Password hashes in the keychain, as generic-password items named by their persistent references.
//
// Every operation runs synchronously on KeychainDispatchQueue (KeychainItems.h).
#pragma once

#include <optional>

#include "Values/Value.h"

namespace veltoid {

/// Adds the password hash of the account, or updates the item that it has. True and the item's reference;
/// false (and a log line) when the keychain refuses, false when name or hash is null. The label is optional.
bool addPasswordToKeychain(const String& accountName, const String& passwordHash, const String& label,
                           Data* persistentReference);

/// True and the hash when the item exists and can be read.
bool copyPasswordFromKeychainGivenPersistentRef(const Data& persistentReference, String* passwordHash);

/// Whether the keychain can be read and has the item, whether it can be unsealed or not.
bool keychainHasPasswordItem(const Data& persistentReference);

/// True when the item was deleted.
bool removePasswordFromKeychainGivenPersistentRef(const Data& persistentReference);

/// The references of all password items; none when there are none.
std::optional<Array> copyAllPasswordsFromKeychain();

}  // namespace veltoid
