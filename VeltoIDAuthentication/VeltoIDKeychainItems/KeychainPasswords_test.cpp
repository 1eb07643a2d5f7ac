#include "VeltoIDKeychainItems/KeychainPasswords.h"

#include <gtest/gtest.h>

#include "Platform/keychain/Keychain.h"
#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/KeychainCases.h"
#include "TestSupport/SQLiteEdit.h"
#include "TestSupport/SideBySide.h"
#include "VeltoIDKeychainItems/KeychainItems.h"

namespace veltoid {
namespace {

using platform::Accessibility;
using platform::KeychainQuery;
using platform::PersistentReference;

class PasswordsTest : public testing::Test {
  protected:
    static Data add(const char* account, const char* hash, const String& label = nullptr) {
        Data reference;
        EXPECT_TRUE(addPasswordToKeychain(account, hash, label, &reference));
        return reference;
    }
    static std::string read(const Data& reference) {
        String hash;
        return copyPasswordFromKeychainGivenPersistentRef(reference, &hash) ? hash.text() : "none";
    }
    static KeychainQuery item(const Data& reference) {
        KeychainQuery query;
        query.itemList = {{PersistentReference(reference.bytes().begin(), reference.bytes().end())}};
        return query;
    }

    platform::TemporaryStateDirectory directory_;
    platform::FakeSystemLog log_;
};

TEST_F(PasswordsTest, AHashIsKeptAndFoundByItsReference) {
    const Data one = add("one", "first hash");
    const Data other = add("other", "second hash");
    EXPECT_EQ(read(one), "first hash");
    EXPECT_EQ(read(other), "second hash");
    EXPECT_EQ(read(add("ümlaut", "häsh")), "häsh");
    EXPECT_EQ(read(add("empty", "")), "");
    KeychainQuery query = item(one);
    query.attributes = platform::password("one", "Velto ID Authentication");
    query.attributes.description = "Velto ID Authentication password";
    EXPECT_EQ(platform::keychain::accessibilityOf(query), Accessibility::AfterFirstUnlockThisDeviceOnly);
    query.attributes.label = "any";
    EXPECT_EQ(platform::keychain::accessibilityOf(query), std::nullopt);

    KeychainQuery labelled = item(add("labelled", "hash", "the label"));
    labelled.attributes.label = "the label";
    EXPECT_TRUE(platform::keychain::accessibilityOf(labelled));
    EXPECT_EQ(log_.count("Password not in keychain; adding it."), 5);
    EXPECT_FALSE(log_.contains("hash") || log_.contains("häsh"));
}

TEST_F(PasswordsTest, AnItemOfTheAccountIsUpdatedInPlace) {
    const Data reference = add("one", "before");
    EXPECT_EQ(add("one", "after"), reference);
    EXPECT_EQ(read(reference), "after");
    EXPECT_EQ(platform::keychain::accessibilityOf(item(reference)), Accessibility::AfterFirstUnlock);
    EXPECT_EQ(log_.count("Password already in keychain; updating it to (new) value.  persistentRef=$"), 1);

    PersistentReference added;
    platform::keychain::add(platform::password("foreign", "some other service"), Accessibility::Always,
                            platform::bytesOf("theirs"), &added);
    EXPECT_EQ(add("foreign", "ours"), Data(added)) << "whatever service it was made for";
    EXPECT_EQ(read(Data(added)), "ours");
}

TEST_F(PasswordsTest, AnItemThatCannotBeUpdatedIsReplaced) {
    const Data damaged = add("one", "before");
    // Edited behind the keychain's back, the item does not unseal any more.
    platform::editDatabase("keychain.db", "UPDATE items SET label = 'edited'");
    EXPECT_EQ(read(damaged), "none");

    const Data fresh = add("one", "after");
    EXPECT_NE(fresh, damaged);
    EXPECT_EQ(read(fresh), "after");
    EXPECT_EQ(platform::keychain::accessibilityOf(item(damaged)), std::nullopt);
    EXPECT_EQ(log_.count("SetItemUpdate({ "), 1);
    EXPECT_EQ(log_.count(", attrs=(supressed) err=-26275 so deleting and re-adding item."), 1);
    EXPECT_FALSE(log_.contains("before") || log_.contains("after"));
}

TEST_F(PasswordsTest, RemovingLeavesNothing) {
    const Data reference = add("one", "hash");
    const Data other = add("other", "hash");
    EXPECT_TRUE(removePasswordFromKeychainGivenPersistentRef(reference));
    EXPECT_EQ(read(reference), "none");
    EXPECT_EQ(log_.count("Failed to get password from keychain given persistentRef, err=-25300 ref=$"), 1);
    EXPECT_FALSE(removePasswordFromKeychainGivenPersistentRef(reference));
    EXPECT_EQ(log_.count("Error -25300 ? deleting item from keychain with persistentRef=$"), 1);
    EXPECT_EQ(read(other), "hash");
    EXPECT_NE(add("one", "hash"), reference);
}

TEST_F(PasswordsTest, WhatIsMissingFailsQuietly) {
    Data reference(std::vector<uint8_t>{1});
    EXPECT_FALSE(addPasswordToKeychain(nullptr, "hash", nullptr, &reference));
    EXPECT_FALSE(addPasswordToKeychain("one", nullptr, nullptr, &reference));
    EXPECT_EQ(reference.size(), 1U);
    EXPECT_FALSE(copyPasswordFromKeychainGivenPersistentRef({}, nullptr));
    EXPECT_FALSE(removePasswordFromKeychainGivenPersistentRef({}));
    EXPECT_TRUE(log_.lines().empty());
    EXPECT_TRUE(addPasswordToKeychain("one", "hash", nullptr, nullptr));
}

TEST_F(PasswordsTest, AKeychainThatCannotBeOpenedRefuses) {
    const platform::Obstacle noKeychain("keychain.db");
    const Data before(std::vector<uint8_t>{1});
    Data reference = before;
    EXPECT_FALSE(addPasswordToKeychain("one", "secret hash", nullptr, &reference));
    EXPECT_EQ(reference, before);
    EXPECT_EQ(log_.count("Failed to add password to keychain,err=-25291 ref=[ NULL ] "), 1);
    EXPECT_FALSE(log_.contains("Password not in keychain"));
    EXPECT_FALSE(copyPasswordFromKeychainGivenPersistentRef(before, nullptr));
    EXPECT_FALSE(removePasswordFromKeychainGivenPersistentRef(before));
    EXPECT_FALSE(log_.contains("secret"));
}

TEST_F(PasswordsTest, WithoutTheKeychainItemsLiveInMemory) {
    EXPECT_TRUE(usesSystemKeychain());
    const Data stored = add("stored", "on disk");
    setUseSystemKeychain(false);
    const auto before = platform::TemporaryStateDirectory::contents();
    const Data one = add("one", "first");
    const Data again = add("one", "second");
    EXPECT_EQ(one.size(), 16U);
    EXPECT_NE(one, again) << "each is an item of its own";
    EXPECT_EQ(read(one), "first");
    EXPECT_EQ(read(again), "second");
    EXPECT_EQ(read(stored), "none");
    EXPECT_TRUE(removePasswordFromKeychainGivenPersistentRef(one));
    EXPECT_FALSE(removePasswordFromKeychainGivenPersistentRef(one));
    EXPECT_EQ(read(one), "none");
    EXPECT_EQ(platform::TemporaryStateDirectory::contents(), before);
    setUseSystemKeychain(true);
    EXPECT_EQ(read(again), "none");
    EXPECT_EQ(read(stored), "on disk");
}

TEST_F(PasswordsTest, OperationsRunOneByOneOnTheirQueue) {
    EXPECT_EQ(keychainQueue().label(), "KeychainDispatchQueue");
    platform::sideBySide(4, [](int i) {
        const std::string account = "account" + std::to_string(i);
        for (int round = 0; round < 10; ++round) {
            const Data reference = add(account.c_str(), std::to_string(round).c_str());
            EXPECT_EQ(read(reference), std::to_string(round));
            EXPECT_TRUE(round % 3 != 2 || removePasswordFromKeychainGivenPersistentRef(reference));
        }
    });
    for (const auto& line : log_.lines())
        EXPECT_TRUE(line.text.find("Password") == std::string::npos ||
                    line.text.ends_with(" KeychainDispatchQueue"))
            << line.text;
}

}  // namespace
}  // namespace veltoid
