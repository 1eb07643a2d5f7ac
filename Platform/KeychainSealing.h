// How the keychain's values are kept secret: a device key in a file of its own wraps the class keys, a class
// key seals the items of its class. Internal to the keychain.
//
// Nothing is cached: a key is in memory only while an operation uses it, and a replaced file or row counts at
// once.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "Platform/Keychain.h"
#include "Platform/SQLiteFile.h"

namespace platform::keychain {

/// The table of the class keys.
inline constexpr const char* kClassKeysSchema =
    "CREATE TABLE class_keys ("
    "  class INTEGER PRIMARY KEY,"
    "  wrapping INTEGER NOT NULL,"
    "  wrapped BLOB NOT NULL"
    ");";

/// Everything of an item but its value.
struct ItemIdentity {
    PersistentReference id;
    KeychainAttributes attributes;
    Accessibility accessibility = Accessibility::AfterFirstUnlock;
};

/// An encoding of the identity that no other identity has: sealed together with the value.
std::vector<uint8_t> encodeIdentity(const ItemIdentity& identity);

/// The device key of `directory` (keychain.key). Created when it is missing and `mayCreate`; an existing file
/// is never replaced. None, with a log line, when it cannot be had.
std::optional<SecretBytes> deviceKey(const std::string& directory, bool mayCreate);

/// Seals the value under the class key of the item's accessibility, which is created when there is none yet.
KeychainStatus sealItem(SQLiteTransaction& transaction, const ItemIdentity& identity, Bytes value,
                        SecretBytes& sealed);

/// Corrupt, with a log line that names the item's id, when the value was not sealed for this identity.
KeychainStatus unsealItem(SQLiteTransaction& transaction, const ItemIdentity& identity, Bytes sealed,
                          SecretBytes& value);

}  // namespace platform::keychain
