// The class keys, each of which seals the items of its class: how they are kept and had. Internal to the
// keychain.
//
// Nothing is cached: a key is in memory only while an operation uses it, and a replaced file or row counts at
// once. All operations are part of a transaction of the keychain's file, which a Failure ends.
#pragma once

#include <optional>
#include <string>

#include "Platform/keychain/KeychainItem.h"
#include "Platform/storage/SQLiteFile.h"

namespace platform::keychain {

/// Their table. "wrapping" tells what a key is wrapped by: 0 the device key, 1 a passphrase; "wrapped" is the
/// sealed key, behind what the passphrase's key is derived with in the second case.
inline constexpr const char* kClassKeysSchema =
    "CREATE TABLE class_keys ("
    "  class INTEGER PRIMARY KEY,"
    "  wrapping INTEGER NOT NULL,"
    "  wrapped BLOB NOT NULL"
    ");";

/// Thrown by what works inside a transaction; the operation of the keychain answers with the status.
struct Failure {
    KeychainStatus status;
};

/// The values are stored: they do not change.
enum class ClassKey : int { Always = 1, AfterFirstUnlock = 2 };

/// Reads and unwraps a class key; none when there is none yet.
std::optional<SecretBytes> readClassKey(SQLiteTransaction& transaction, ClassKey which);

/// The same; it is made when there is none.
SecretBytes classKey(SQLiteTransaction& transaction, ClassKey which);

// --- The key of the class "after first unlock"; see Keychain.h

Protection readProtection(SQLiteTransaction& transaction);

/// A new key takes the place of the one that there is, which has to be at hand: what it has sealed has to be
/// read before, and sealed again after it.
void replaceByPassphrase(SQLiteTransaction& transaction, Bytes passphrase);
void replaceByDeviceKey(SQLiteTransaction& transaction);

void unlockByPassphrase(SQLiteTransaction& transaction, Bytes passphrase);

/// What the kernel keeps the passphrase's key by while the keychain is unlocked; empty without a passphrase.
std::string keptKeyName(SQLiteTransaction& transaction);

}  // namespace platform::keychain
