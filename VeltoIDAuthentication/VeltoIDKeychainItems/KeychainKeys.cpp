#include "VeltoIDKeychainItems/KeychainKeys.h"

#include "Platform/crypto/KeyPair.h"
#include "Values/Digest.h"
#include "Values/SecurityObject.h"
#include "VeltoIDKeychainItems/KeychainItems.h"

namespace veltoid {
namespace {

using platform::Accessibility;
using platform::KeychainAttributes;
using platform::KeychainItemClass;

keychain_items::MemoryTable<Key>& memoryItems() { return keychain_items::memoryItems<Key>(); }

/// What identifies the key among those of its class.
KeychainAttributes identityOf(const Key& key) {
    KeychainAttributes attributes = keychain_items::itemsOf(KeychainItemClass::Key);
    attributes.keyClass = key.isPrivate ? "private" : "public";
    attributes.applicationValue = sha256Text(key.publicPart);
    return attributes;
}

std::string labelOf(const String& owner, const String& kind) {
    return "Velto ID " + owner.text() + " " + kind.text();
}

Accessibility accessibilityOf(const Key& key) {
    return key.isPrivate ? Accessibility::AfterFirstUnlock : Accessibility::Always;
}

/// The reference of the key's item; null when the keychain refuses. Label, accessibility and access group of
/// an item that is there already may be outdated.
Data addOrUpdate(const Key& key, const std::string& label) {
    const auto bytes = key.encoded.bytes();
    keychain_items::WantedItem item{identityOf(key),
                                    {platform::SecretBytes(bytes.begin(), bytes.end()), accessibilityOf(key),
                                     label, kKeychainAccessGroup},
                                    identityOf(key),
                                    accessibilityOf(key)};
    item.attributes.label = label;
    item.attributes.accessGroup = kKeychainAccessGroup;
    Data reference;
    keychain_items::addOrUpdate(item, &reference, [](auto...) {});
    return reference;
}

}  // namespace

Key Key::privateKey(platform::Bytes pkcs8) {
    const auto publicPart = platform::publicKeyOf(pkcs8);
    if (!publicPart) return {};
    return {true, Data(pkcs8), Data(*publicPart)};
}

Key Key::publicKey(platform::Bytes publicKeyInfo) {
    if (!platform::isPublicKey(publicKeyInfo)) return {};
    return {false, Data(publicKeyInfo), Data(publicKeyInfo)};
}

Value Key::description() const {
    if (!encoded) return {};
    const std::string text = (isPrivate ? "private " : "public ") + sha256Text(publicPart);
    return Value::object({KeyDescription{text}});
}

bool addKeyToKeychain(const String& owner, const String& kind, const Key& key, Data* persistentReference) {
    const bool kindIsPrivate = !kind || kind == kPrivateKeyKind;
    if (!key || key.isPrivate != kindIsPrivate) return false;
    return keychain_items::handOut(persistentReference, [&] {
        return usesSystemKeychain() ? addOrUpdate(key, labelOf(owner, kind)) : memoryItems().add(key);
    });
}

bool copyPersistentRefForKey(const Key& key, Data* persistentReference) {
    if (!key) return false;
    return keychain_items::handOut(persistentReference, [&] {
        if (usesSystemKeychain()) return keychain_items::copyReference(identityOf(key));
        for (const auto& [known, item] : memoryItems().items())
            if (item == key) return known;
        return Data();
    });
}

bool copyKeyFromKeychainGivenPersistentRef(const Data& persistentReference, Key* key) {
    if (!persistentReference) return false;
    return keychainQueue().sync([&] {
        if (!usesSystemKeychain()) return memoryItems().copy(persistentReference, key);
        platform::SecretBytes data;
        const auto query = keychain_items::queryForReference(KeychainItemClass::Key, persistentReference);
        if (platform::keychain::copyMatchingData(query, &data) != platform::kKeychainSuccess) return false;
        if (key == nullptr) return true;
        Key read = Key::privateKey(data);
        if (!read) read = Key::publicKey(data);
        if (read) *key = std::move(read);
        return true;
    });
}

bool removeKeyFromKeychainGivenPersistentRef(const Data& persistentReference) {
    if (!persistentReference) return false;
    return keychainQueue().sync([&] {
        if (!usesSystemKeychain()) return memoryItems().remove(persistentReference);
        return platform::keychain::remove(keychain_items::queryForReference(
                   KeychainItemClass::Key, persistentReference)) == platform::kKeychainSuccess;
    });
}

std::optional<Array> copyAllKeysFromKeychain() {
    if (usesSystemKeychain())
        return keychain_items::copyReferences(keychain_items::itemsOf(KeychainItemClass::Key));
    return memoryItems().references();
}

std::optional<Array> copyKeysFromKeychainGivenOwner(const String& owner, const String& kind) {
    return keychain_items::copyReferences(
        keychain_items::itemsOf(KeychainItemClass::Key, labelOf(owner, kind)));
}

}  // namespace veltoid
