// The keychain: small items, each with plain attributes that queries match and one sealed value, kept in a
// SQLite file (keychain.db beside the preferences, mode 0600). Opened on first use.
//
// The value is sealed with AES-256-GCM under a class key; the item's id and attributes are the additional
// data, so that a swapped or edited row is refused as corrupt. The class keys are wrapped by a device key in
// keychain.key (0600), or that of "after first unlock" by a passphrase.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "Platform/keychain/KeychainItem.h"
#include "Platform/runtime/SecureMemory.h"

namespace platform {

struct KeychainQuery {
    KeychainAttributes attributes;
    /// When given, only the items with these references match.
    std::optional<std::vector<PersistentReference>> itemList;
};

/// All operations may be called from any thread; they serialise among themselves. Outputs are left alone on
/// failure. Two generic passwords of the same account and service (both absent counts as the same), or two
/// keys or certificates of the same application value and key class, are duplicates. What is done is durable
/// on disk when the operation returns, so that a reference stored elsewhere never outlives its item in a
/// power cut.
namespace keychain {

/// The references of the matching items, oldest first; not found when there is none.
KeychainStatus copyMatchingReferences(const KeychainQuery& query,
                                      std::vector<PersistentReference>* references);

/// The value of the first matching item.
KeychainStatus copyMatchingData(const KeychainQuery& query, SecretBytes* data);

KeychainStatus add(const KeychainAttributes& attributes, Accessibility accessibility, Bytes data,
                   PersistentReference* reference);

/// What update changes; absent members stay.
struct Changes {
    std::optional<SecretBytes> data;
    std::optional<Accessibility> accessibility;
    std::optional<std::string> label;
    std::optional<std::string> accessGroup;
};

/// Changes every matching item, all or none. An item that does not unseal is not changed: it is refused as
/// corrupt.
KeychainStatus update(const KeychainQuery& query, const Changes& changes);

/// Deletes every matching item; not found when there is none.
KeychainStatus remove(const KeychainQuery& query);

/// The stored accessibility of the first matching item.
std::optional<Accessibility> accessibilityOf(const KeychainQuery& query);

/// What tells this keychain from any other: made with its file, at random, and stored in it. Empty when its
/// items have been removed behind its back; none when the keychain cannot be read. With `Reopen::Yes` the
/// file is opened anew, as a copy may have been written over it.
enum class Reopen { No, Yes };
std::optional<std::vector<uint8_t>> identity(Reopen reopen = Reopen::No);

// --- The passphrase. With one, items other than the always accessible ones can be had only after it was
// given; what opens them is then in the kernel's keyring of the user until the device is switched off or
// locked again.

/// None when the keychain cannot be read.
std::optional<Protection> protection();

/// Takes the place of an earlier one; the keychain must not be locked, and stays unlocked.
KeychainStatus setPassphrase(Bytes passphrase);

/// From now on the device key alone opens everything; the keychain must not be locked.
KeychainStatus removePassphrase();

/// Nothing happens to a keychain without a passphrase.
KeychainStatus unlock(Bytes passphrase);
KeychainStatus lock();

}  // namespace keychain

}  // namespace platform
