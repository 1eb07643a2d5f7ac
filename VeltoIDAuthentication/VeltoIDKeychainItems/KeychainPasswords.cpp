#include "VeltoIDKeychainItems/KeychainPasswords.h"

#include "Logging/Log.h"
#include "Platform/keychain/Keychain.h"
#include "VeltoIDKeychainItems/KeychainItems.h"

namespace veltoid {
namespace {

using platform::Accessibility;
using platform::KeychainAttributes;
using platform::KeychainQuery;
using platform::KeychainStatus;
using platform::PersistentReference;

keychain_items::MemoryTable<String>& memoryItems() { return keychain_items::memoryItems<String>(); }

KeychainQuery queryForReference(const Data& reference) {
    return keychain_items::queryForReference(platform::KeychainItemClass::GenericPassword, reference);
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

/// Changes the item's password in place; one bound to this device may move with its backup from then on.
KeychainStatus updateItem(const Data& reference, const String& passwordHash) {
    VELTOID_LOG_FROM("addPasswordToKeychain", kError,
                     "Password already in keychain; updating it to (new) value.  persistentRef=", reference);
    const KeychainStatus status = platform::keychain::update(
        queryForReference(reference), {secretBytes(passwordHash), Accessibility::AfterFirstUnlock, {}, {}});
    if (status == platform::kKeychainSuccess || keychain_items::mayPass(status)) return status;
    VELTOID_LOG_FROM("addPasswordToKeychain", kNotice, "SetItemUpdate(",
                     keychain_items::describeItemQuery("genp", reference), ", attrs=(supressed) err=", status,
                     " so deleting and re-adding item.");
    return status;
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
    if (status == platform::kKeychainSuccess) *reference = Data(added);
    return status;
}

/// The reference of the account's item; null when the keychain refuses.
Data addOrUpdate(const String& accountName, const String& passwordHash, const String& label) {
    KeychainStatus status = platform::kKeychainSuccess;
    Data reference = keychain_items::copyReference(queryForAccount(accountName).attributes, &status);
    if (reference) {
        status = updateItem(reference, passwordHash);
        if (status != platform::kKeychainSuccess && !keychain_items::mayPass(status)) {
            platform::keychain::remove(queryForAccount(accountName));
            status = platform::kKeychainItemNotFound;
        }
    }
    if (status == platform::kKeychainItemNotFound)
        status = addItem(creationAttributes(accountName, label), passwordHash, &reference);
    if (status == platform::kKeychainSuccess) return reference;
    VELTOID_LOG_FROM("addPasswordToKeychain", kError, "Failed to add password to keychain,err=", status,
                     " ref=", Value());
    return {};
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
