#include "VeltoIDKeychainItems/Passwords.h"

#include <algorithm>
#include <atomic>
#include <utility>
#include <vector>

#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/Keychain.h"
#include "Values/Digest.h"

namespace veltoid {
namespace {

using platform::Accessibility;
using platform::KeychainAttributes;
using platform::KeychainQuery;
using platform::KeychainStatus;
using platform::PersistentReference;

std::atomic<bool> useKeychain{true};

/// Reference and password of each item kept in memory; on the keychain queue only.
std::vector<std::pair<Data, String>>& memoryItems() {
    static auto* items = new std::vector<std::pair<Data, String>>;
    return *items;
}

auto findInMemory(const Data& reference) {
    auto& items = memoryItems();
    return std::find_if(items.begin(), items.end(),
                        [&](const auto& item) { return item.first == reference; });
}

Data dataOf(const PersistentReference& reference) { return Data(reference); }

KeychainQuery queryForReference(const Data& reference) {
    KeychainQuery query;
    const auto bytes = reference.bytes();
    query.itemList = {{PersistentReference(bytes.begin(), bytes.end())}};
    return query;
}

KeychainQuery queryForAccount(const String& accountName) {
    KeychainQuery query;
    query.attributes.account = accountName.text();
    return query;
}

KeychainAttributes creationAttributes(const String& accountName, const String& label) {
    KeychainAttributes attributes;
    attributes.description = "Velto ID Authentication password";
    attributes.account = accountName.text();
    attributes.service = "Velto ID Authentication";
    if (label) attributes.label = label.text();
    return attributes;
}

platform::SecretBytes secretBytes(const String& passwordHash) {
    const platform::Bytes bytes = platform::bytesOf(passwordHash.view());
    return {bytes.begin(), bytes.end()};
}

std::string describeItemQuery(const Data& reference) {
    return describeValue(Dictionary{{"class", "genp"}, {"itemList", Array{reference}}});
}

/// Changes the item's password in place; an item that was bound to this device may move with its backup from
/// then on.
bool updateItem(const Data& reference, const String& passwordHash) {
    VELTOID_LOG_FROM("addPasswordToKeychain", kError,
                     "Password already in keychain; updating it to (new) value.  persistentRef="
                         << describeValue(reference));
    const KeychainStatus status = platform::keychain::update(
        queryForReference(reference), {secretBytes(passwordHash), Accessibility::AfterFirstUnlock, {}, {}});
    if (status == platform::kKeychainSuccess) return true;
    VELTOID_LOG_FROM("addPasswordToKeychain", kNotice,
                     "SetItemUpdate(" << describeItemQuery(reference) << ", attrs=(supressed) err=" << status
                                      << " so deleting and re-adding item.");
    return false;
}

/// Adds a fresh item; a duplicate that the search by account did not find makes room for it once.
KeychainStatus addItem(const KeychainAttributes& attributes, const String& passwordHash, Data* reference) {
    VELTOID_LOG_FROM("addPasswordToKeychain", kError, "Password not in keychain; adding it.");
    const platform::SecretBytes data = secretBytes(passwordHash);
    constexpr Accessibility accessibility = Accessibility::AfterFirstUnlockThisDeviceOnly;
    PersistentReference added;
    KeychainStatus status = platform::keychain::add(attributes, accessibility, data, &added);
    if (status == platform::kKeychainDuplicateItem &&
        platform::keychain::remove({attributes, {}}) == platform::kKeychainSuccess)
        status = platform::keychain::add(attributes, accessibility, data, &added);
    if (status == platform::kKeychainSuccess) *reference = dataOf(added);
    return status;
}

bool addOrUpdate(const String& accountName, const String& passwordHash, const String& label,
                 Data* reference) {
    std::vector<PersistentReference> found;
    KeychainStatus status = platform::keychain::copyMatchingReferences(queryForAccount(accountName), &found);
    if (status == platform::kKeychainSuccess && !found.empty()) {
        *reference = dataOf(found.front());
        if (updateItem(*reference, passwordHash)) return true;
        *reference = {};
        platform::keychain::remove(queryForAccount(accountName));
        status = platform::kKeychainItemNotFound;
    }
    if (status == platform::kKeychainItemNotFound)
        status = addItem(creationAttributes(accountName, label), passwordHash, reference);
    if (status == platform::kKeychainSuccess) return true;
    VELTOID_LOG_FROM("addPasswordToKeychain", kError,
                     "Failed to add password to keychain,err=" << status << " ref=" << describeValue({}));
    return false;
}

bool addToMemory(const String& passwordHash, Data* reference) {
    *reference = uuidBytes(platform::randomUUID());
    memoryItems().emplace_back(*reference, passwordHash);
    return true;
}

}  // namespace

void setUseSystemKeychain(bool use) { useKeychain = use; }
bool usesSystemKeychain() { return useKeychain; }

platform::WorkQueue keychainQueue() {
    static const auto* queue = new platform::WorkQueue("KeychainDispatchQueue");
    return *queue;
}

bool addPasswordToKeychain(const String& accountName, const String& passwordHash, const String& label,
                           Data* persistentReference) {
    if (!accountName || !passwordHash) return false;
    return keychainQueue().sync([&] {
        Data reference;
        const bool added = useKeychain ? addOrUpdate(accountName, passwordHash, label, &reference)
                                       : addToMemory(passwordHash, &reference);
        if (added && persistentReference != nullptr) *persistentReference = reference;
        return added;
    });
}

bool copyPasswordFromKeychainGivenPersistentRef(const Data& persistentReference, String* passwordHash) {
    if (!persistentReference) return false;
    return keychainQueue().sync([&] {
        if (!useKeychain) {
            const auto item = findInMemory(persistentReference);
            if (item == memoryItems().end()) return false;
            if (passwordHash != nullptr) *passwordHash = item->second;
            return true;
        }
        platform::SecretBytes data;
        const KeychainStatus status =
            platform::keychain::copyMatchingData(queryForReference(persistentReference), &data);
        if (status != platform::kKeychainSuccess) {
            VELTOID_LOG_FROM("copyPasswordFromKeychainGivenPersistentRef", kError,
                             "Failed to get password from keychain given persistentRef, err="
                                 << status << " ref=" << describeValue(persistentReference));
            return false;
        }
        if (passwordHash != nullptr) *passwordHash = String(platform::textOf(data));
        return true;
    });
}

bool removePasswordFromKeychainGivenPersistentRef(const Data& persistentReference) {
    if (!persistentReference) return false;
    return keychainQueue().sync([&] {
        if (!useKeychain) {
            const auto item = findInMemory(persistentReference);
            if (item == memoryItems().end()) return false;
            memoryItems().erase(item);
            return true;
        }
        const KeychainStatus status = platform::keychain::remove(queryForReference(persistentReference));
        if (status == platform::kKeychainSuccess) return true;
        VELTOID_LOG_FROM("removePasswordFromKeychainGivenPersistentRef", kError,
                         "Error " << status << " ? deleting item from keychain with persistentRef="
                                  << describeValue(persistentReference));
        return false;
    });
}

}  // namespace veltoid
