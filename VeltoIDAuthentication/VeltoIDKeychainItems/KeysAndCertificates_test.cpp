#include <gtest/gtest.h>

#include "Platform/crypto/KeyPair.h"
#include "Platform/keychain/Keychain.h"
#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/KeychainCases.h"
#include "TestSupport/SQLiteEdit.h"
#include "TestSupport/TemporaryStateDirectory.h"
#include "TestSupport/TestAuthority.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainItems.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"

namespace veltoid {
namespace {

using platform::Accessibility;
using platform::KeychainItemClass;

struct Pair {
    Key privateKey, publicKey;
};

Pair newPair() {
    const auto pair = platform::generateRSAKeyPair(2048);
    return {Key::privateKey(pair->privateKey), Key::publicKey(pair->publicKey)};
}

Data add(const Key& key, const String& owner = "jane") {
    Data reference;
    EXPECT_TRUE(addKeyToKeychain(owner, key.isPrivate ? String("private key") : String("public key"), key,
                                 &reference));
    return reference;
}

Key read(const Data& reference) {
    Key key;
    return copyKeyFromKeychainGivenPersistentRef(reference, &key) ? key : Key();
}

class KeysTest : public testing::Test {
  protected:
    /// The item's label and accessibility, when it has the access group.
    static std::string described(KeychainItemClass itemClass, const Data& reference,
                                 const std::string& label) {
        platform::KeychainQuery query = keychain_items::queryForReference(itemClass, reference);
        query.attributes.label = label;
        query.attributes.accessGroup = "com.velto.harbwell.veltoidauthentication.keychainaccessgroup";
        const auto accessibility = platform::keychain::accessibilityOf(query);
        if (!accessibility) return "no such item";
        return accessibility == Accessibility::Always ? "always" : "after first unlock";
    }

    platform::TemporaryStateDirectory directory_;
    platform::FakeSystemLog log_;
};

TEST_F(KeysTest, AKeyIsKeptAndFoundAgainByItsPublicPart) {
    const Pair pair = newPair();
    const Data privateItem = add(pair.privateKey);
    const Data publicItem = add(pair.publicKey);
    EXPECT_NE(privateItem, publicItem);
    EXPECT_EQ(read(privateItem), pair.privateKey);
    EXPECT_EQ(read(privateItem).encoded, pair.privateKey.encoded);
    EXPECT_EQ(read(publicItem), pair.publicKey);
    EXPECT_EQ(described(KeychainItemClass::Key, privateItem, "Velto ID jane private key"),
              "after first unlock");
    EXPECT_EQ(described(KeychainItemClass::Key, publicItem, "Velto ID jane public key"), "always");

    Data found;
    EXPECT_TRUE(copyPersistentRefForKey(pair.privateKey, &found));
    EXPECT_EQ(found, privateItem);
    EXPECT_TRUE(copyPersistentRefForKey(pair.publicKey, &found));
    EXPECT_EQ(found, publicItem);
    EXPECT_EQ(copyAllKeysFromKeychain(), (Array{privateItem, publicItem}));
    EXPECT_EQ(copyKeysFromKeychainGivenOwner("jane", kPrivateKeyKind), Array{privateItem});
    EXPECT_EQ(copyKeysFromKeychainGivenOwner("john", kPrivateKeyKind), std::nullopt);

    EXPECT_TRUE(removeKeyFromKeychainGivenPersistentRef(privateItem));
    EXPECT_FALSE(removeKeyFromKeychainGivenPersistentRef(privateItem));
    EXPECT_FALSE(read(privateItem));
    EXPECT_FALSE(copyPersistentRefForKey(pair.privateKey, nullptr));
    EXPECT_EQ(copyAllKeysFromKeychain(), Array{publicItem});
    const std::string raw = platform::TemporaryStateDirectory::contents()["keychain.db"];
    const std::string_view secret = platform::textOf(pair.privateKey.encoded.bytes());
    EXPECT_EQ(raw.find(secret.substr(40, 64)), std::string::npos) << "a private key in clear";
}

TEST_F(KeysTest, AKeyThatIsThereAlreadyKeepsItsReference) {
    const Pair pair = newPair();
    const Data before = add(pair.privateKey, "jane");
    EXPECT_EQ(add(pair.privateKey, "john"), before);
    EXPECT_EQ(described(KeychainItemClass::Key, before, "Velto ID john private key"), "after first unlock");
    EXPECT_EQ(copyAllKeysFromKeychain(), Array{before});
    EXPECT_EQ(read(before), pair.privateKey);
}

TEST_F(KeysTest, WhatIsNoKeyIsRefused) {
    const Pair pair = newPair();
    Data reference;
    EXPECT_FALSE(addKeyToKeychain("jane", nullptr, Key(), &reference));
    EXPECT_FALSE(addKeyToKeychain("jane", nullptr, pair.publicKey, &reference)) << "no kind says private";
    EXPECT_FALSE(addKeyToKeychain("jane", "public key", pair.privateKey, &reference));
    EXPECT_FALSE(reference);
    EXPECT_TRUE(addKeyToKeychain(nullptr, nullptr, pair.privateKey, nullptr));
    using Bytes = std::vector<uint8_t>;
    for (const Bytes& bytes : {Bytes{}, Bytes{0x30, 0x03, 1, 2, 3}, Bytes(100'000, 0x30)})
        EXPECT_FALSE(Key::privateKey(bytes) || Key::publicKey(bytes));
    const auto encoded = pair.privateKey.encoded.bytes();
    EXPECT_FALSE(Key::privateKey(encoded.first(encoded.size() - 1)));
    EXPECT_FALSE(Key::publicKey(encoded));
    EXPECT_FALSE(Key::privateKey(pair.publicKey.encoded.bytes()));
    EXPECT_FALSE(copyKeyFromKeychainGivenPersistentRef({}, nullptr));
    EXPECT_FALSE(removeKeyFromKeychainGivenPersistentRef({}));

    platform::PersistentReference added;
    platform::keychain::add(platform::object(KeychainItemClass::Key, {}, "other"), Accessibility::Always,
                            platform::bytesOf("no key"), &added);
    Key none;
    EXPECT_TRUE(copyKeyFromKeychainGivenPersistentRef(Data(added), &none)) << "the item is there";
    EXPECT_FALSE(none);
}

TEST_F(KeysTest, WithoutTheKeychainKeysLiveInMemory) {
    const Pair pair = newPair();
    setUseSystemKeychain(false);
    EXPECT_EQ(copyAllKeysFromKeychain(), std::nullopt);
    const Data reference = add(pair.privateKey);
    EXPECT_EQ(reference.size(), 16U);
    EXPECT_EQ(read(reference), pair.privateKey);
    Data found;
    EXPECT_TRUE(copyPersistentRefForKey(pair.privateKey, &found));
    EXPECT_EQ(found, reference);
    EXPECT_FALSE(copyPersistentRefForKey(pair.publicKey, &found));
    EXPECT_EQ(copyAllKeysFromKeychain(), Array{reference});
    EXPECT_TRUE(removeKeyFromKeychainGivenPersistentRef(reference));
    EXPECT_FALSE(removeKeyFromKeychainGivenPersistentRef(reference));
    EXPECT_FALSE(read(reference));

    const testing_support::TestAuthority authority;
    const auto certificate = platform::readCertificate(authority.certificate());
    EXPECT_FALSE(addCertificateToKeychain(*certificate, "label", &found));
    EXPECT_FALSE(copyPersistentRefForCertificate(*certificate, &found));
    EXPECT_EQ(copyAllCertificatesFromKeychain(), std::nullopt);
    EXPECT_FALSE(platform::TemporaryStateDirectory::contents().contains("keychain.db"));
}

TEST_F(KeysTest, ACertificateIsKeptUnderItsLabel) {
    const testing_support::TestAuthority one;
    const testing_support::TestAuthority other;
    const auto certificate = platform::readCertificate(one.certificate());
    const auto another = platform::readCertificate(other.certificate());
    Data reference;
    ASSERT_TRUE(addCertificateToKeychain(*certificate, "label", &reference));
    EXPECT_EQ(described(KeychainItemClass::Certificate, reference, "label"), "always");
    std::optional<platform::Certificate> found;
    EXPECT_TRUE(copyCertificateFromKeychainGivenPersistentRef(reference, &found));
    EXPECT_EQ(found, certificate);
    Data again;
    EXPECT_TRUE(addCertificateToKeychain(*certificate, "new label", &again));
    EXPECT_EQ(again, reference);
    EXPECT_EQ(copyCertificatesFromKeychainGivenLabel("new label"), Array{reference});
    EXPECT_EQ(copyCertificatesFromKeychainGivenLabel("label"), std::nullopt);
    EXPECT_FALSE(addCertificateToKeychain(*certificate, nullptr, nullptr));
    EXPECT_FALSE(copyPersistentRefForCertificate(*another, &again));
    EXPECT_TRUE(addCertificateToKeychain(*another, "label", &again));
    EXPECT_EQ(copyAllCertificatesFromKeychain(), (Array{reference, again}));

    EXPECT_FALSE(removeKeyFromKeychainGivenPersistentRef(reference)) << "it is no key";
    EXPECT_FALSE(copyKeyFromKeychainGivenPersistentRef(reference, nullptr));
    EXPECT_TRUE(removeCertificateFromKeychainGivenPersistentRef(reference));
    EXPECT_TRUE(removeCertificateFromKeychainGivenPersistentRef(reference)) << "gone is gone";
    EXPECT_FALSE(copyCertificateFromKeychainGivenPersistentRef(reference, &found));
    EXPECT_FALSE(removeCertificateFromKeychainGivenPersistentRef({}));
}

TEST_F(KeysTest, AnItemThatCannotBeChangedForAMomentStays) {
    const testing_support::TestAuthority authority;
    const auto certificate = platform::readCertificate(authority.certificate());
    const Key key = newPair().privateKey;
    Data reference;
    ASSERT_TRUE(addCertificateToKeychain(*certificate, "label", &reference));
    const Data keyReference = add(key);
    platform::editDatabase("keychain.db",
                           "CREATE TRIGGER busy BEFORE UPDATE ON items BEGIN "
                           "SELECT RAISE(ABORT, 'not now'); END");
    EXPECT_FALSE(addCertificateToKeychain(*certificate, "label", nullptr));
    EXPECT_FALSE(addKeyToKeychain("jane", kPrivateKeyKind, key, nullptr));
    EXPECT_EQ(log_.count("Certificate \"label\" not added to keychain; err=-25291"), 1);
    EXPECT_FALSE(log_.contains("deleting and re-adding item"));
    platform::editDatabase("keychain.db", "DROP TRIGGER busy");
    EXPECT_EQ(copyAllCertificatesFromKeychain(), Array{reference});
    EXPECT_EQ(copyAllKeysFromKeychain(), Array{keyReference});
}

TEST_F(KeysTest, AKeychainThatCannotBeOpenedRefuses) {
    const platform::Obstacle noKeychain("keychain.db");
    const testing_support::TestAuthority authority;
    const auto certificate = platform::readCertificate(authority.certificate());
    Data reference;
    EXPECT_FALSE(addKeyToKeychain("jane", nullptr, newPair().privateKey, &reference));
    EXPECT_FALSE(addCertificateToKeychain(*certificate, "the label", &reference));
    EXPECT_FALSE(reference);
    EXPECT_FALSE(removeCertificateFromKeychainGivenPersistentRef(Data(std::vector<uint8_t>{1})));
    for (const char* line :
         {"Certificate \"the label\" not added to keychain; err=-25291",
          "Error #-25291 from keychain::remove(), removeCertificateFromKeychainGivenPersistentRef"})
        EXPECT_EQ(log_.count(line), 1) << line;
}

}  // namespace
}  // namespace veltoid
