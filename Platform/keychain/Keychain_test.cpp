#include "Platform/keychain/Keychain.h"

#include <gtest/gtest.h>
#include <linux/keyctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <functional>
#include <set>
#include <vector>

#include "Platform/encoding/HexText.h"
#include "Platform/keychain/KeychainSealing.h"
#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/KeychainCases.h"
#include "TestSupport/SQLiteEdit.h"

namespace platform {
namespace {

namespace fs = std::filesystem;
using keychain::Changes;

const std::string kSecret = "a secret that is long enough to be found in a file";

Changes newData(std::string_view text) { return {SecretBytes(text.begin(), text.end()), {}, {}, {}}; }

KeychainQuery byReference(const PersistentReference& reference,
                          KeychainItemClass itemClass = KeychainItemClass::GenericPassword) {
    KeychainQuery query;
    query.attributes.itemClass = itemClass;
    query.itemList = {{reference}};
    return query;
}

PersistentReference added(const KeychainAttributes& attributes, std::string_view value = kSecret,
                          Accessibility accessibility = Accessibility::AfterFirstUnlock) {
    PersistentReference reference;
    EXPECT_EQ(keychain::add(attributes, accessibility, bytesOf(value), &reference), kKeychainSuccess);
    return reference;
}

/// The value of the first match as text, or its status.
std::string valueOf(const KeychainQuery& query) {
    SecretBytes data = {'u', 'n', 't', 'o', 'u', 'c', 'h', 'e', 'd'};
    const KeychainStatus status = keychain::copyMatchingData(query, &data);
    if (status == kKeychainSuccess) return std::string(textOf(data));
    EXPECT_EQ(textOf(data), "untouched");
    return std::to_string(status);
}

class KeychainTest : public testing::Test {
  protected:
    ~KeychainTest() override {
        EXPECT_FALSE(log_.contains(kSecret)) << "a secret was logged";
        if (fs::exists(directory_.base() / "harbwell")) expectNoSecretInFiles();
    }

    static void expectNoSecretInFiles() {
        for (const auto& [name, content] : TemporaryStateDirectory::contents()) {
            EXPECT_EQ(content.find(kSecret), std::string::npos) << name;
            EXPECT_EQ(fs::status(TemporaryStateDirectory::file(name)).permissions(),
                      fs::perms::owner_read | fs::perms::owner_write)
                << name;
        }
    }

    static void edit(const std::string& sql) { editDatabase("keychain.db", sql); }

    TemporaryStateDirectory directory_;
    FakeSystemLog log_;
};

const std::string kNotFound = std::to_string(kKeychainItemNotFound);
const std::string kCorrupt = std::to_string(kKeychainItemCorrupt);
const std::string kNotAvailable = std::to_string(kKeychainNotAvailable);
const std::string kLocked = std::to_string(kKeychainLocked);

TEST_F(KeychainTest, RefusesDuplicates) {
    using enum KeychainItemClass;
    const std::tuple<KeychainAttributes, KeychainAttributes, bool> cases[] = {
        {password("a", "s"), password("a", "s"), true},
        {password("b", "s"), password("b", "t"), false},
        {password("c", "s"), password("d", "s"), false},
        {password("e", {}), password("e", {}), true},
        {password("f", {}), password("f", ""), false},
        {password({}, "g"), password({}, "g"), true},
        {password(std::string("h\0i", 3)), password(std::string("h\0j", 3)), false},
        {object(Key, "private", "v1"), object(Key, "private", "v1"), true},
        {object(Key, "private", "v2"), object(Key, "public", "v2"), false},
        {object(Key, "private", "v3"), object(Certificate, "private", "v3"), false},
        {object(Certificate, {}, "v4"), object(Certificate, {}, "v4"), true},
        {object(Certificate, {}, "v5"), object(Certificate, {}, "v6"), false},
        {object(Certificate, {}, {}), object(Certificate, {}, {}), false},
    };
    for (size_t i = 0; i < std::size(cases); ++i) {
        auto [first, second, duplicate] = cases[i];
        added(first);
        second.label = "another label makes no other item";
        PersistentReference reference = {1};
        EXPECT_EQ(keychain::add(second, Accessibility::Always, bytesOf("x"), &reference),
                  duplicate ? kKeychainDuplicateItem : kKeychainSuccess)
            << i;
        EXPECT_EQ(reference.size() == 1, duplicate) << i;
    }
    EXPECT_EQ(keychain::add(password("huge"), Accessibility::Always, SecretBytes(kMaxKeychainItemBytes + 1),
                            nullptr),
              kKeychainNotAvailable);
}

TEST_F(KeychainTest, QueriesMatchByTheAttributesThatTheyName) {
    KeychainAttributes labelled = password("b", "t");
    labelled.label = "label";
    labelled.accessGroup = "group";
    labelled.description = "description";
    const std::vector<PersistentReference> items = {added(password("a", "s")), added(labelled),
                                                    added(password("a", "t")),
                                                    added(object(KeychainItemClass::Key, "private", "v")),
                                                    added(object(KeychainItemClass::Key, "public", "v"))};
    const auto only = [](std::optional<std::string> KeychainAttributes::*field, const char* value) {
        KeychainAttributes attributes;
        attributes.*field = value;
        return attributes;
    };
    using References = std::vector<PersistentReference>;
    const PersistentReference unknown(16, 9);
    const std::pair<KeychainQuery, std::vector<size_t>> cases[] = {
        {{}, {0, 1, 2}},
        {{password("a", {}), {}}, {0, 2}},
        {{password("a", "t"), {}}, {2}},
        {{password("A", {}), {}}, {}},
        {{password("", {}), {}}, {}},
        {{only(&KeychainAttributes::label, "label"), {}}, {1}},
        {{only(&KeychainAttributes::accessGroup, "group"), {}}, {1}},
        {{only(&KeychainAttributes::description, "description"), {}}, {1}},
        {{object(KeychainItemClass::Key, {}, {}), {}}, {3, 4}},
        {{object(KeychainItemClass::Key, "public", "v"), {}}, {4}},
        {{object(KeychainItemClass::Certificate, {}, {}), {}}, {}},
        {{{}, References{items[2], items[0], unknown, items[2]}}, {0, 2}},
        {{password("b", {}), References{items[0], items[1]}}, {1}},
        {{{}, References{items[3]}}, {}},
        {{{}, References{}}, {}},
        {{{}, References{{}}}, {}},
    };
    for (const auto& [query, matches] : cases) {
        SCOPED_TRACE(testing::PrintToString(matches));
        References expected;
        for (const size_t item : matches) expected.push_back(items[item]);
        References found;
        EXPECT_EQ(keychain::copyMatchingReferences(query, &found),
                  expected.empty() ? kKeychainItemNotFound : kKeychainSuccess);
        EXPECT_EQ(found, expected);
    }
}

TEST_F(KeychainTest, UpdatesInPlace) {
    const auto first = added(password("a"), "old", Accessibility::AfterFirstUnlockThisDeviceOnly);
    added(password("b"), "other");
    Changes changes = newData(kSecret);
    changes.accessibility = Accessibility::Always;
    changes.label = "new label";
    changes.accessGroup = "new group";
    EXPECT_EQ(keychain::update(byReference(first), changes), kKeychainSuccess);
    EXPECT_EQ(keychain::update(byReference(first), {{}, {}, "newer label", {}}), kKeychainSuccess);

    KeychainAttributes expected = password("a");
    expected.label = "newer label";
    expected.accessGroup = "new group";
    EXPECT_EQ(valueOf({expected, std::vector<PersistentReference>{first}}), kSecret);
    EXPECT_EQ(keychain::accessibilityOf(byReference(first)), Accessibility::Always);
    EXPECT_EQ(valueOf({password("b"), {}}), "other");
    std::vector<PersistentReference> all;
    EXPECT_EQ(keychain::copyMatchingReferences({}, &all), kKeychainSuccess);
    EXPECT_EQ(all.front(), first) << "an updated item keeps its age";
    EXPECT_EQ(keychain::update({password("nobody"), {}}, changes), kKeychainItemNotFound);

    EXPECT_EQ(keychain::update({}, newData("all of them")), kKeychainSuccess);
    for (const auto& reference : all) EXPECT_EQ(valueOf(byReference(reference)), "all of them");
}

TEST_F(KeychainTest, RefusesRowsThatWereChangedFromOutside) {
    const std::string sealOfOther = "sealed = (SELECT sealed FROM items WHERE account = 'other')";
    const std::string changes[] = {sealOfOther,
                                   "account = 'renamed'",
                                   "service = NULL",
                                   "label = ''",
                                   "description = account",
                                   "access_group = 'theirs'",
                                   "key_class = 'private'",
                                   "application_value = 'v'",
                                   "accessibility = 0",
                                   "accessibility = 2",
                                   "accessibility = 77",
                                   "sealed = x''",
                                   "sealed = 'text'",
                                   "sealed = substr(sealed, 1, length(sealed) - 1)",
                                   "sealed = zeroblob(length(sealed))",
                                   "account = account || 'x', " + sealOfOther};
    const auto spoil = [](const std::string& change) {
        edit("UPDATE items SET " + change + " WHERE account = 'victim'");
    };
    const Changes fresh = newData("new");
    const auto other = added(password("other"), "unharmed");
    added(password("always"), "unharmed too", Accessibility::Always);
    for (const auto& change : changes) {
        SCOPED_TRACE(change);
        const auto victim = added(password("victim"));
        spoil(change);
        const FakeSystemLog log;
        EXPECT_EQ(valueOf(byReference(victim)), kCorrupt);
        EXPECT_TRUE(log.contains(hexText(victim)));
        EXPECT_EQ(keychain::update(byReference(victim), fresh), kKeychainItemCorrupt);
        EXPECT_FALSE(log.contains(kSecret));
        EXPECT_EQ(keychain::remove(byReference(victim)), kKeychainSuccess);
    }
    // One bad item among several: none is changed.
    const auto victim = added(password("victim"));
    spoil(sealOfOther);
    EXPECT_EQ(keychain::update({}, fresh), kKeychainItemCorrupt);
    EXPECT_EQ(valueOf(byReference(other)), "unharmed");
    // Another item's id with that item's seal is still not that item.
    edit("DELETE FROM items WHERE account = 'other'");
    edit("UPDATE items SET id = x'" + hexText(other) + "' WHERE account = 'always'");
    EXPECT_EQ(valueOf(byReference(other)), kCorrupt);
    EXPECT_EQ(valueOf(byReference(victim)), kCorrupt);
}

TEST(KeychainSealing, NoTwoIdentitiesHaveTheSameEncoding) {
    std::vector<keychain::ItemIdentity> identities = {
        {{1, 2}, password("ab", "c"), Accessibility::Always},
        {{1, 2}, password("a", "bc"), Accessibility::Always},
        {{1, 2}, password("", "abc"), Accessibility::Always},
        {{1, 2}, password({}, "abc"), Accessibility::Always},
        {{1, 2}, password("abc", {}), Accessibility::Always},
        {{1, 2}, password("abc", ""), Accessibility::Always},
        {{1}, password("\2abc", ""), Accessibility::Always},
        {{1, 2}, password({}, {}), Accessibility::Always},
        {{1, 2}, password({}, {}), Accessibility::AfterFirstUnlock}};
    identities.push_back(identities.back());
    identities.back().attributes.itemClass = KeychainItemClass::Key;
    std::set<std::string> encodings;
    for (const auto& identity : identities) encodings.emplace(textOf(keychain::encodeIdentity(identity)));
    EXPECT_EQ(encodings.size(), identities.size());
}

TEST_F(KeychainTest, IsNotAvailableWithoutASoundDeviceKey) {
    const auto item = added(password("a"));
    const fs::path path = TemporaryStateDirectory::file("keychain.key");
    const std::string sound = TemporaryStateDirectory::readFile(path);
    const auto flipped = [&](size_t at) {
        std::string bytes = sound;
        bytes[at] = static_cast<char>(bytes[at] ^ 1);
        return bytes;
    };
    const std::pair<const char*, std::optional<std::string>> cases[] = {
        {"missing", std::nullopt},
        {"empty", ""},
        {"cut", sound.substr(0, sound.size() - 1)},
        {"too long", sound + "x"},
        {"another magic", flipped(0)},
        {"another version", flipped(11)},
        {"a flipped check", flipped(12)},
        {"a flipped key", flipped(sound.size() - 1)},
    };
    for (const auto& [name, content] : cases) {
        fs::remove(path);
        if (content) TemporaryStateDirectory::writeFile(path, *content);
        const FakeSystemLog log;
        SCOPED_TRACE(name);
        EXPECT_EQ(valueOf(byReference(item)), kNotAvailable);
        EXPECT_TRUE(log.contains(path.string()));
        EXPECT_EQ(keychain::add(password("b"), Accessibility::Always, bytesOf(kSecret), nullptr),
                  kKeychainNotAvailable);
        EXPECT_EQ(fs::exists(path), content.has_value());
        EXPECT_EQ(TemporaryStateDirectory::readFile(path), content.value_or("")) << "replaced";
    }
    fs::remove(path);
    fs::create_directory(path);
    EXPECT_EQ(valueOf(byReference(item)), kNotAvailable);
    fs::remove(path);
    fs::create_symlink("/dev/zero", path);
    EXPECT_EQ(valueOf(byReference(item)), kNotAvailable);
    fs::remove(path);

    TemporaryStateDirectory::writeFile(path, sound);
    fs::permissions(path, fs::perms::owner_read | fs::perms::owner_write | fs::perms::others_read);
    const FakeSystemLog log;
    EXPECT_EQ(valueOf(byReference(item)), kSecret);
    EXPECT_TRUE(log.contains("was open to other users"));
}

TEST_F(KeychainTest, HasAnIdentityOfItsOwn) {
    using keychain::identity;
    using keychain::Reopen;
    const auto first = identity();
    ASSERT_TRUE(first && !first->empty());
    const auto item = added(password("a"));
    EXPECT_EQ(identity(Reopen::Yes), first);
    const fs::path file = TemporaryStateDirectory::file("keychain.db");
    const std::string kept = TemporaryStateDirectory::readFile(file);

    edit("DELETE FROM items");
    EXPECT_TRUE(identity()->empty()) << "not by this program";
    fs::remove(file);
    const auto second = identity();
    EXPECT_TRUE(!second->empty() && second != first);
    fs::remove(file);
    TemporaryStateDirectory::writeFile(file, kept);
    EXPECT_EQ(identity(), first) << "restored";
    EXPECT_EQ(valueOf(byReference(item)), kSecret);
    EXPECT_EQ(keychain::remove(byReference(item)), kKeychainSuccess);
    EXPECT_EQ(identity(), first);

    const auto old = added(password("b"));
    edit("DROP TABLE identity");
    const auto given = identity(Reopen::Yes);
    EXPECT_TRUE(!given->empty() && given != first) << "to a file of an earlier agent";
    EXPECT_EQ(valueOf(byReference(old)), kSecret);
    const Obstacle obstacle("keychain.db");
    EXPECT_EQ(identity(), std::nullopt);
}

class PassphraseTest : public KeychainTest {
  protected:
    void SetUp() override {
        // The kernel is asked by itself, so that a fault of ours is not taken for its refusal.
        if (syscall(SYS_add_key, "user", "veltoid test", "x", 1, KEY_SPEC_USER_KEYRING) < 0)
            GTEST_SKIP() << "the kernel's keyring is not permitted here";
    }
    ~PassphraseTest() override {
        if (IsSkipped()) return;
        EXPECT_EQ(keychain::lock(), kKeychainSuccess) << "nothing of this is to stay in the kernel";
    }

    const std::string passphrase_ = "open, " + kSecret;
};

TEST_F(PassphraseTest, OpensAndClosesAllButTheAlwaysAccessible) {
    using enum keychain::Protection;
    const auto item = byReference(added(password("a")));
    const auto always = byReference(added(password("b"), kSecret, Accessibility::Always));
    const auto set = [](std::string_view text) { return keychain::setPassphrase(bytesOf(text)); };
    const auto unlock = [](std::string_view text) { return keychain::unlock(bytesOf(text)); };
    using Action = std::function<KeychainStatus()>;
    const std::tuple<const char*, Action, KeychainStatus, keychain::Protection> steps[] = {
        {"nothing to unlock", [&] { return unlock("anything"); }, kKeychainSuccess, NoPassphrase},
        {"nothing to lock", keychain::lock, kKeychainSuccess, NoPassphrase},
        {"nothing to remove", keychain::removePassphrase, kKeychainSuccess, NoPassphrase},
        {"set", [&] { return set(passphrase_); }, kKeychainSuccess, Unlocked},
        {"lock", keychain::lock, kKeychainSuccess, Locked},
        {"set while locked", [&] { return set("another"); }, kKeychainLocked, Locked},
        {"remove while locked", keychain::removePassphrase, kKeychainLocked, Locked},
        {"wrong", [&] { return unlock("Open, " + kSecret); }, kKeychainWrongPassphrase, Locked},
        {"none", [&] { return unlock(""); }, kKeychainWrongPassphrase, Locked},
        {"right", [&] { return unlock(passphrase_); }, kKeychainSuccess, Unlocked},
        {"change", [&] { return set("another"); }, kKeychainSuccess, Unlocked},
        {"lock again", keychain::lock, kKeychainSuccess, Locked},
        {"the old one", [&] { return unlock(passphrase_); }, kKeychainWrongPassphrase, Locked},
        {"the new one", [&] { return unlock("another"); }, kKeychainSuccess, Unlocked},
        {"remove", keychain::removePassphrase, kKeychainSuccess, NoPassphrase},
        {"lock no more", keychain::lock, kKeychainSuccess, NoPassphrase},
    };
    for (const auto& [step, action, expected, after] : steps) {
        SCOPED_TRACE(step);
        EXPECT_EQ(action(), expected);
        EXPECT_EQ(keychain::protection(), after);
        EXPECT_EQ(valueOf(item), after == Locked ? kLocked : kSecret);
        EXPECT_EQ(keychain::add(password(step), Accessibility::AfterFirstUnlock, bytesOf("x"), nullptr),
                  after == Locked ? kKeychainLocked : kKeychainSuccess);
        EXPECT_EQ(valueOf(always), kSecret);
        expectNoSecretInFiles();
    }
}

TEST_F(PassphraseTest, EarlierCopiesOpenNothingThatCameLater) {
    const auto item = byReference(added(password("a"), "old"));
    const auto corrupt = byReference(added(password("b")));
    edit("UPDATE items SET sealed = x'00' WHERE account = 'b'");
    edit("CREATE TABLE earlier AS SELECT * FROM class_keys");
    ASSERT_EQ(keychain::setPassphrase(bytesOf(passphrase_)), kKeychainSuccess);
    EXPECT_EQ(valueOf(item), "old");
    EXPECT_EQ(valueOf(corrupt), kCorrupt);
    ASSERT_EQ(keychain::update(item, newData(kSecret)), kKeychainSuccess);
    edit("CREATE TABLE sound AS SELECT * FROM class_keys");
    edit("INSERT OR REPLACE INTO class_keys SELECT * FROM earlier");
    EXPECT_EQ(valueOf(item), kCorrupt);
    edit("INSERT OR REPLACE INTO class_keys SELECT * FROM sound");
    EXPECT_EQ(valueOf(item), kSecret);
}

TEST_F(PassphraseTest, DamageIsToldFromAWrongPassphrase) {
    const auto item = byReference(added(password("a")));
    ASSERT_EQ(keychain::setPassphrase(bytesOf(passphrase_)), kKeychainSuccess);
    const std::pair<const char*, KeychainStatus> cases[] = {
        {"wrapped = x''", kKeychainNotAvailable},
        {"wrapped = 'text'", kKeychainNotAvailable},
        {"wrapped = substr(wrapped, 1, 20)", kKeychainNotAvailable},
        {"wrapped = x'02' || substr(wrapped, 2)", kKeychainNotAvailable},
        {"wrapped = x'01000801' || substr(wrapped, 5)", kKeychainNotAvailable},
        {"wrapped = x'01ff0801' || substr(wrapped, 5)", kKeychainNotAvailable},
        {"wrapped = x'011fffff' || substr(wrapped, 5)", kKeychainNotAvailable},
        {"wrapped = x'01100001' || substr(wrapped, 5)", kKeychainNotAvailable},
        {"wrapped = x'010a0801' || substr(wrapped, 5)", kKeychainWrongPassphrase},
        {"wrapped = substr(wrapped, 1, length(wrapped) - 1)", kKeychainWrongPassphrase},
        {"wrapped = substr(wrapped, 1, 21)", kKeychainWrongPassphrase},
        {"wrapped = zeroblob(16777216)", kKeychainNotAvailable},
        {"wrapping = 0", kKeychainSuccess},
        {"wrapping = 9", kKeychainSuccess},
    };
    edit("CREATE TABLE sound AS SELECT * FROM class_keys");
    for (const auto& [change, unlocking] : cases) {
        edit(std::string("UPDATE class_keys SET ") + change + " WHERE class = 2");
        EXPECT_NE(valueOf(item), kSecret) << change;
        EXPECT_EQ(keychain::unlock(bytesOf(passphrase_)), unlocking) << change;
        EXPECT_NE(valueOf(item), kSecret) << change;
        edit("INSERT OR REPLACE INTO class_keys SELECT * FROM sound");
    }
    EXPECT_EQ(keychain::unlock(bytesOf(passphrase_)), kKeychainSuccess);
    EXPECT_EQ(valueOf(item), kSecret);
}

}  // namespace
}  // namespace platform
