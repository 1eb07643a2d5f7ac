#include "VeltoIDKeychainItems/KeychainPasswords.h"

#include "Logging/Log.h"
#include "Platform/keychain/Keychain.h"
#include "VeltoIDKeychainItems/KeychainItems.h"

namespace veltoid {
namespace {

using platform::Accessibility;
using platform::KeychainQuery;
using platform::KeychainStatus;

keychain_items::MemoryTable<String>& memoryItems() { return keychain_items::memoryItems<String>(); }

KeychainQuery queryForReference(const Data& reference) {
    return keychain_items::queryForReference(platform::KeychainItemClass::GenericPassword, reference);
}

/// A password is bound to this device; one that is changed may move with its backup from then on.
keychain_items::WantedItem wantedItem(const String& accountName, const String& passwordHash,
                                      const String& label) {
    const platform::Bytes hash = platform::bytesOf(passwordHash.view());
    keychain_items::WantedItem item;
    item.identity.account = accountName.text();
    item.changes.data.emplace(hash.begin(), hash.end());
    item.changes.accessibility = Accessibility::AfterFirstUnlock;
    item.attributes.description = "Velto ID Authentication password";
    item.attributes.account = accountName.text();
    item.attributes.service = "Velto ID Authentication";
    if (label) item.attributes.label = label.text();
    item.accessibility = Accessibility::AfterFirstUnlockThisDeviceOnly;
    return item;
}

void logStep(keychain_items::Step step, const Data& reference, KeychainStatus status) {
    constexpr const char* kFunction = "addPasswordToKeychain";
    switch (step) {
        case keychain_items::Step::Update:
            VELTOID_LOG_FROM(
                kFunction, kError,
                "Password already in keychain; updating it to (new) value.  persistentRef=", reference);
            break;
        case keychain_items::Step::Replace:
            VELTOID_LOG_FROM(kFunction, kNotice, "SetItemUpdate(",
                             keychain_items::describeItemQuery("genp", reference),
                             ", attrs=(supressed) err=", status, " so deleting and re-adding item.");
            break;
        case keychain_items::Step::Add:
            VELTOID_LOG_FROM(kFunction, kError, "Password not in keychain; adding it.");
            break;
    }
}

/// The reference of the account's item; null when the keychain refuses.
Data addOrUpdate(const String& accountName, const String& passwordHash, const String& label) {
    Data reference;
    const KeychainStatus status =
        keychain_items::addOrUpdate(wantedItem(accountName, passwordHash, label), &reference, logStep);
    if (status != platform::kKeychainSuccess)
        VELTOID_LOG_FROM("addPasswordToKeychain", kError, "Failed to add password to keychain,err=", status,
                         " ref=", Value());
    return reference;
}

}  // namespace

bool addPasswordToKeychain(const String& accountName, const String& passwordHash, const String& label,
                           Data* persistentReference) {
    if (!accountName || !passwordHash) return false;
    return keychain_items::handOut(persistentReference, [&] {
        return usesSystemKeychain() ? addOrUpdate(accountName, passwordHash, label)
                                    : memoryItems().add(passwordHash);
    });
}

bool copyPasswordFromKeychainGivenPersistentRef(const Data& persistentReference, String* passwordHash) {
    if (!persistentReference) return false;
    return keychainQueue().sync([&] {
        if (!usesSystemKeychain()) return memoryItems().copy(persistentReference, passwordHash);
        platform::SecretBytes data;
        const KeychainStatus status =
            platform::keychain::copyMatchingData(queryForReference(persistentReference), &data);
        if (status != platform::kKeychainSuccess) {
            VELTOID_LOG_FROM("copyPasswordFromKeychainGivenPersistentRef", kError,
                             "Failed to get password from keychain given persistentRef, err=", status,
                             " ref=", persistentReference);
            return false;
        }
        if (passwordHash != nullptr) *passwordHash = String(platform::textOf(data));
        return true;
    });
}

bool keychainHasPasswordItem(const Data& persistentReference) {
    if (!persistentReference) return false;
    return keychainQueue().sync([&] {
        if (!usesSystemKeychain()) return memoryItems().copy(persistentReference, nullptr);
        return platform::keychain::copyMatchingReferences(queryForReference(persistentReference), nullptr) ==
               platform::kKeychainSuccess;
    });
}

std::optional<Array> copyAllPasswordsFromKeychain() {
    if (usesSystemKeychain())
        return keychain_items::copyReferences(
            keychain_items::itemsOf(platform::KeychainItemClass::GenericPassword));
    return memoryItems().references();
}

bool removePasswordFromKeychainGivenPersistentRef(const Data& persistentReference) {
    if (!persistentReference) return false;
    return keychainQueue().sync([&] {
        if (!usesSystemKeychain()) return memoryItems().remove(persistentReference);
        const KeychainStatus status = platform::keychain::remove(queryForReference(persistentReference));
        if (status == platform::kKeychainSuccess) return true;
        VELTOID_LOG_FROM("removePasswordFromKeychainGivenPersistentRef", kError, "Error ", status,
                         " ? deleting item from keychain with persistentRef=", persistentReference);
        return false;
    });
}

}  // namespace veltoid
