// Password hashes in the keychain, as generic-password items named by their persistent references.
//
// Every operation runs synchronously on KeychainDispatchQueue, which never calls back into the database.
// Without the system keychain, items live in an in-memory table under random 16-byte references and are gone
// at exit.
#pragma once

#include "Platform/WorkQueue.h"
#include "Values/Value.h"

namespace veltoid {

/// Whether items go to the keychain (the default) or into memory. Called once, at start.
void setUseSystemKeychain(bool use);
bool usesSystemKeychain();

/// The queue of all keychain operations.
platform::WorkQueue keychainQueue();

/// Adds the password hash of the account, or updates the item that it has. True and the item's reference;
/// false (and a log line) when the keychain refuses, false when name or hash is null. The label is optional.
bool addPasswordToKeychain(const String& accountName, const String& passwordHash, const String& label,
                           Data* persistentReference);

/// True and the hash when the item exists and can be read.
bool copyPasswordFromKeychainGivenPersistentRef(const Data& persistentReference, String* passwordHash);

/// True when the item was deleted.
bool removePasswordFromKeychainGivenPersistentRef(const Data& persistentReference);

}  // namespace veltoid
