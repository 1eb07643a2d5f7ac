// How the keychain's values are kept secret: each is sealed under its class key, together with all that the
// item is known by. Internal to the keychain; failures are thrown (KeychainClassKeys.h).
#pragma once

#include <cstdint>

#include "Platform/keychain/KeychainItem.h"
#include "Platform/storage/SQLiteFile.h"

namespace platform::keychain {

/// Everything of an item but its value.
struct ItemIdentity {
    PersistentReference id;
    KeychainAttributes attributes;
    Accessibility accessibility = Accessibility::AfterFirstUnlock;
};

/// An encoding of the identity that no other identity has: sealed together with the value.
std::vector<uint8_t> encodeIdentity(const ItemIdentity& identity);

/// Seals the value under the class key of the item's accessibility, which is created when there is none yet.
SecretBytes sealItem(SQLiteTransaction& transaction, const ItemIdentity& identity, Bytes value);

/// Corrupt, with a log line that names the item's id, when the value was not sealed for this identity.
SecretBytes unsealItem(SQLiteTransaction& transaction, const ItemIdentity& identity, Bytes sealed);

}  // namespace platform::keychain
