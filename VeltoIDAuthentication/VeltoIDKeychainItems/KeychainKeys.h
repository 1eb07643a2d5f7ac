// Keys in the keychain, as key items that are known by their persistent references.
//
// Every operation runs synchronously on KeychainDispatchQueue; outputs are set only on success, may be null.
#pragma once

#include "Platform/runtime/SecureMemory.h"
#include "Values/Value.h"

namespace veltoid {

/// A private or public key; false when the encoding is null. Keys of one class are equal when their public
/// parts are equal.
struct Key {
    bool isPrivate = false;
    /// PKCS#8 or SubjectPublicKeyInfo (DER).
    Data encoded;
    /// The SubjectPublicKeyInfo, also of a private key.
    Data publicPart;

    static Key privateKey(platform::Bytes pkcs8);
    static Key publicKey(platform::Bytes publicKeyInfo);

    explicit operator bool() const { return static_cast<bool>(encoded); }
    /// For log lines; contains nothing of the private part.
    Value description() const;

    friend bool operator==(const Key& a, const Key& b) {
        return a.isPrivate == b.isPrivate && a.publicPart == b.publicPart;
    }
};

/// The kind of a private key, as a label says it.
inline constexpr const char* kPrivateKeyKind = "private key";

/// Adds the key, or updates the item that it has, under the label "Velto ID " + owner + blank + kind. A kind
/// that is null or kPrivateKeyKind stands for a private key, readable after the first unlock; any other for a
/// public one. False when there is no key, it is of the other class, or the keychain refuses.
bool addKeyToKeychain(const String& owner, const String& kind, const Key& key, Data* persistentReference);

/// True and the reference of the item that holds the key.
bool copyPersistentRefForKey(const Key& key, Data* persistentReference);

/// True when the item exists and can be read; the key is handed out when it is one.
bool copyKeyFromKeychainGivenPersistentRef(const Data& persistentReference, Key* key);

/// True when the item was deleted.
bool removeKeyFromKeychainGivenPersistentRef(const Data& persistentReference);

/// The references of all key items; none when there are none.
std::optional<Array> copyAllKeysFromKeychain();

/// The references of the key items that were added for this owner and kind; none when there are none.
std::optional<Array> copyKeysFromKeychainGivenOwner(const String& owner, const String& kind);

}  // namespace veltoid
