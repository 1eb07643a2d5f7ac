#include "VeltoIDAuthenticationDB/AccountRecords.h"

#include "TestSupport/DatabaseFixture.h"
#include "TestSupport/SQLiteEdit.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDKeychainItems/KeychainItems.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

constexpr const char* kName = "jane.roe@velto.example";
constexpr const char* kReference = "HashedPasswordRef";
constexpr const char* kPassword = "HashedPassword";
constexpr const char* kUserUUID = "0F8FAD5B-D9CB-469F-A165-70867728950E";
constexpr const char* kOtherUserUUID = "7C9E6679-7425-40DE-944B-E07FC1F90AE7";
// SHA-256 of name and device identifier, folded in half; worked out apart from this code.
constexpr const char* kOtherStableUUID = "DCB960D9-5D73-41CA-0982-B260E956DF48";
constexpr const char* kStableUUID = "BC6E3091-6F0C-96A4-D7F8-EADEF427002A";

class AccountsTest : public DatabaseTest {
  protected:
    static Dictionary record(const char* name = kName) {
        AccountRecord record;
        EXPECT_TRUE(__VeltoIDDBCopyVeltoIDAccount(name, &record));
        return record.values();
    }

    static void create(const char* name = kName, const String& password = nullptr,
                       const String& encDsId = nullptr) {
        ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount(name, password, encDsId));
    }

    static void setValues(const char* name, const Dictionary& values) {
        ASSERT_TRUE(__VeltoIDDBSetAccountValues(name, values, Notify::No));
    }
};

TEST_F(AccountsTest, ARecordOfNothingButAName) {
    EXPECT_EQ(effectsOf([] { create(); }), "written, signalled");
    const Dictionary created = record();
    EXPECT_EQ(keysOf(created),
              (std::set<std::string>{"AccountUUID", "CreationDate", "Dirty", "ModificationDate", "VeltoID"}));
    EXPECT_EQ(created["VeltoID"], Value(kName));
    EXPECT_EQ(created["Dirty"], kOn);
    EXPECT_EQ(created["CreationDate"], created["ModificationDate"]);
    EXPECT_EQ(created.string("AccountUUID").view().size(), 36U);
    EXPECT_FALSE(__VeltoIDDBCreateVeltoIDAccount(nullptr, "hash", "d"));
}

TEST_F(AccountsTest, CreatingAgainUpdatesTheRecord) {
    create(kName, nullptr, "first");
    setValues(kName, {{"FirstName", "Jane"}, {"Dirty", kGone}});
    const Dictionary before = record();
    clock_.advanceBy(60);
    create();
    Dictionary expected = before;
    expected.set("Dirty", kOn);
    expected.set("ModificationDate", date());
    EXPECT_EQ(record(), expected) << "what is not given stays";
    create(kName, nullptr, "second");
    EXPECT_EQ(record()["encDsId"], Value("second"));
    EXPECT_EQ(record()["CreationDate"], before["CreationDate"]);
}

TEST_F(AccountsTest, ThePasswordGoesToTheKeychainOnce) {
    create(kName, "hash one");
    const Data reference = record().data(kReference);
    String stored;
    ASSERT_TRUE(copyPasswordFromKeychainGivenPersistentRef(reference, &stored));
    EXPECT_EQ(stored, "hash one");
    EXPECT_FALSE(record().contains(kPassword));

    EXPECT_EQ(effectsOf([] { create(kName, "hash one"); }), "written, signalled");
    const std::string same = "Password being added for account " + std::string(kName);
    EXPECT_EQ(log_.count(same + " matches password on keychain, so skipping over addPasswordToKeychain"), 1);
    EXPECT_FALSE(log_.contains("Password already in keychain"));

    create(kName, "hash two");
    EXPECT_EQ(record().data(kReference), reference);
    EXPECT_EQ(__VeltoIDDBCopyHashedPassword({kName, record()}), "hash two");
    EXPECT_FALSE(log_.contains("hash one") || log_.contains("hash two"));
}

TEST_F(AccountsTest, APasswordThatTheKeychainRefusesLeavesTheRecordAsItWas) {
    create();
    const Dictionary before = record();
    const platform::Obstacle noKeychain("keychain.db");
    EXPECT_EQ(effectsOf([] { EXPECT_FALSE(__VeltoIDDBCreateVeltoIDAccount(kName, "hash", "new")); }), "");
    EXPECT_EQ(record(), before);
    EXPECT_FALSE(__VeltoIDDBCreateVeltoIDAccount("other", "hash", nullptr));
    EXPECT_FALSE(__VeltoIDDBCopyVeltoIDAccount("other", nullptr));
    EXPECT_TRUE(log_.contains("Failed to add password to keychain,err="));
}

TEST_F(AccountsTest, WhatCannotBeStoredIsUndone) {
    create(kName, "old hash", "d1");
    ASSERT_TRUE(__VeltoIDDBSetCertificateInfo("d1", std::nullopt));
    const Dictionary before = record();
    const Array items = *copyAllPasswordsFromKeychain();
    const struct {
        const char* what;
        bool (*change)();
    } cases[] = {
        {"a new account", [] { return __VeltoIDDBCreateVeltoIDAccount("other", "hash", nullptr); }},
        {"a new password", [] { return __VeltoIDDBCreateVeltoIDAccount(kName, "new hash", nullptr); }},
        {"forgotten", [] { return __VeltoIDDBRemoveVeltoIDAccountAndPassword(kName, {}, nullptr); }},
        {"refused", [] { return __VeltoIDDBRemovePassword(kName, "old hash"); }},
    };
    const auto expectUnchanged = [&](const char* what) {
        EXPECT_EQ(record(), before) << what;
        EXPECT_EQ(__VeltoIDDBCopyHashedPassword({kName, record()}), "old hash") << what;
        EXPECT_EQ(copyAllPasswordsFromKeychain(), items) << what;
        EXPECT_TRUE(__VeltoIDDBCopyCertificateInfo("d1", nullptr)) << what;
        EXPECT_EQ(accountNames(), Array{kName}) << what;
    };
    for (const auto& [what, change] : cases) {
        {
            const platform::Obstacle obstacle("preferences.db");
            EXPECT_FALSE(change()) << what;
        }
        expectUnchanged(what);
    }
    platform::editDatabase("keychain.db",
                           "CREATE TRIGGER full BEFORE DELETE ON items BEGIN SELECT raise(ABORT, 'no'); END");
    EXPECT_FALSE(cases[2].change());
    expectUnchanged("an item that cannot be deleted");
}

TEST_F(AccountsTest, AddingAgainHealsTheReferenceToThePassword) {
    const Data unknown(std::vector<uint8_t>(16, 7));
    for (const bool isPersistent : {true, false}) {
        setUseSystemKeychain(isPersistent);
        const char* name = isPersistent ? "in the keychain" : "in memory";
        create(name, "hash");
        for (const Value& reference : {Value(unknown), Value("text"), kGone}) {
            setValues(name, {{kReference, reference}});
            create(name, "new hash");
            EXPECT_EQ(__VeltoIDDBCopyHashedPassword({name, record(name)}), "new hash") << name;
        }
        create(name, "third hash");
        EXPECT_EQ(__VeltoIDDBCopyHashedPassword({name, record(name)}), "third hash") << name;
    }
}

TEST_F(AccountsTest, OnlyThePasswordThatWasRefusedGoes) {
    create(kName, "stored hash");
    EXPECT_FALSE(__VeltoIDDBRemovePassword(kName, "other hash"));
    {
        const platform::Obstacle unreadable("keychain.db");
        EXPECT_FALSE(__VeltoIDDBRemovePassword(kName, "stored hash"));
    }
    EXPECT_TRUE(record().contains(kReference));
    EXPECT_TRUE(__VeltoIDDBRemovePassword(kName, "stored hash"));
    EXPECT_FALSE(record().contains(kReference));
    EXPECT_TRUE(__VeltoIDDBRemovePassword(kName, "any hash")) << "there is none";
    setValues(kName, {{kPassword, "own hash"}});
    EXPECT_FALSE(__VeltoIDDBRemovePassword(kName, "other hash"));
    EXPECT_TRUE(__VeltoIDDBRemovePassword(kName, "own hash"));
}

TEST_F(AccountsTest, IdentifiersOfAnAccount) {
    const struct {
        const char* what;
        String name;
        Value givenUUID, stableUUID, userUUID;
        bool changes;
        Value newStableUUID;
    } cases[] = {
        {"a new record", kName, {}, {}, kUserUUID, true, kStableUUID},
        {"whatever the case of the name", "Jane.Roe@Velto.Example", "U", {}, kUserUUID, true, kStableUUID},
        {"another device", kName, "U", {}, kOtherUserUUID, true, kOtherStableUUID},
        {"nothing to do", kName, "U", "S", kUserUUID, false, "S"},
        {"a new identifier makes the other one void", kName, {}, "S", kUserUUID, true, kStableUUID},
        {"wrong kinds", kName, number(1), number(2), kUserUUID, true, kStableUUID},
        {"a stable one of the wrong kind", kName, "U", number(2), kUserUUID, true, kStableUUID},
        {"no device identifier", kName, "U", {}, {}, false, {}},
        {"no device identifier, a new record", kName, {}, "S", {}, true, {}},
    };
    for (const auto& [what, name, givenUUID, stableUUID, userUUID, changes, newStableUUID] : cases) {
        SCOPED_TRACE(what);
        __VeltoIDDBSetMetaInfoValue(nullptr, "UserUUID", userUUID);
        Dictionary record = {{"AccountUUID", givenUUID}, {"AccountStableUUID", stableUUID}};
        EXPECT_EQ(__VeltoIDDBDeriveAccountUUIDs(name, record), changes);
        const String uuid = record.string("AccountUUID");
        EXPECT_TRUE(givenUUID.isString() ? uuid == givenUUID.asString() : uuid.view().size() == 36);
        EXPECT_EQ(record["AccountStableUUID"], newStableUUID);
    }
}

TEST_F(AccountsTest, ErrorsOfLookUps) {
    const auto codeOf = [](auto operation) {
        std::optional<Error> error;
        EXPECT_FALSE(operation(&error));
        EXPECT_EQ(error->domain, kIdentityErrorDomain);
        EXPECT_TRUE(error->userInfo.string("function").view().starts_with("__VeltoIDDB"));
        EXPECT_TRUE(error->userInfo.contains("file") && error->userInfo.contains("line"));
        EXPECT_TRUE(error->userInfo.string(kErrorDescriptionKey));
        return error->code;
    };
    Array names{"left over"};
    EXPECT_EQ(codeOf([&](ErrorOut error) { return __VeltoIDDBCopyVeltoIDs(&names, error); }), -107);
    EXPECT_EQ(names, Array{"left over"}) << "filled only on success";
    for (const auto& [name, code] : {std::pair(String(), -99), std::pair(String("x"), -108)})
        EXPECT_EQ(codeOf([&, name = name](ErrorOut error) {
                      return __VeltoIDDBCopyVeltoIDAccount(name, nullptr, error);
                  }),
                  code);
    EXPECT_EQ(codeOf([](ErrorOut error) { return __VeltoIDDBRemoveVeltoIDAccount("x", error); }), -108);

    std::optional<Error> error;
    EXPECT_FALSE(__VeltoIDDBRemoveVeltoIDAccount(nullptr, &error));
    EXPECT_EQ(std::pair(error->domain, error->code), std::pair(String(kOSStatusErrorDomain), int64_t{-1}));
    EXPECT_EQ(error->userInfo.string("function"), "__VeltoIDDBRemoveVeltoIDAccount");
    EXPECT_EQ(error->userInfo.string(kErrorDescriptionKey), "No account was named");
    for (const String& encDsId : {String("d"), String()}) {
        EXPECT_FALSE(__VeltoIDDBCopyVeltoIDForDSID(encDsId, nullptr, &error));
        EXPECT_EQ(error->code, -1);
        EXPECT_EQ(error->userInfo[kErrorFailureReasonKey], Value("Unknown error"));
        for (const std::string_view key : {kErrorDescriptionKey, kErrorRecoverySuggestionKey})
            EXPECT_EQ(error->userInfo[key], Value("?"));
        EXPECT_EQ(error->userInfo["function"], Value("__VeltoIDDBCopyVeltoIDForDSID"));
    }
    EXPECT_FALSE(__VeltoIDDBSetAccountValues("x", {{"a", "b"}}, Notify::Yes));
    EXPECT_FALSE(__VeltoIDDBRemovePassword("x"));
    EXPECT_FALSE(__VeltoIDDBRemovePassword(nullptr));
    EXPECT_TRUE(__VeltoIDDBCopyAccountValue("x", "a").isAbsent());
    EXPECT_EQ(takeSignals(), 0);
}

TEST_F(AccountsTest, FindsAccounts) {
    create("nothing");
    create("own hash");
    setValues("own hash", {{kPassword, "h"}, {kReference, "no data"}});
    create("dsid", nullptr, "d1");
    setValues("dsid", {{kPassword, number(1)}});
    create("both", "hash", "d2");
    create("wrong dsid", "hash");
    setValues("wrong dsid", {{"encDsId", number(3)}});

    const auto first = [](bool password, bool dsid) {
        const auto found = __VeltoIDDBCopyFirstVeltoIDAccount({password, dsid});
        return found ? found->accountName().text() : "none";
    };
    EXPECT_EQ(first(false, false), "nothing");
    EXPECT_EQ(first(true, false), "own hash");
    EXPECT_EQ(first(false, true), "dsid");
    EXPECT_EQ(first(true, true), "both");
    String name;
    EXPECT_TRUE(__VeltoIDDBCopyVeltoIDForDSID("d2", &name));
    EXPECT_EQ(name, "both");
    EXPECT_FALSE(__VeltoIDDBCopyVeltoIDForDSID("3", &name));
    Array names;
    EXPECT_TRUE(__VeltoIDDBCopyVeltoIDs(&names));
    EXPECT_EQ(names, (Array{"nothing", "own hash", "dsid", "both", "wrong dsid"}));

    EXPECT_EQ(effectsOf([] { EXPECT_TRUE(__VeltoIDDBRemoveVeltoIDAccount("both")); }), "written, signalled");
    EXPECT_EQ(first(true, true), "none");
}

TEST_F(AccountsTest, SettingValues) {
    using enum Notify;
    constexpr const char* kAll = "written, signalled";
    const struct {
        const char* what;
        Dictionary values;
        Notify notify;
        std::string effects;
        /// Of the record afterwards: its value of "k" and its mark.
        Value k, dirty;
    } cases[] = {
        {"a new value", {{"k", "b"}}, Yes, kAll, "b", kOn},
        {"quietly", {{"k", "b"}}, No, "written", "b", {}},
        {"an equal value", {{"k", "a"}}, Yes, "", "a", {}},
        {"an equal number of another form", {{"n", Value::real(1)}}, Yes, "", "a", {}},
        {"another kind", {{"k", number(1)}}, No, "written", number(1), {}},
        {"Null removes", {{"k", kGone}}, Yes, kAll, {}, kOn},
        {"Null for nothing", {{"x", kGone}}, Yes, "", "a", {}},
        {"the mark alone", {{"Dirty", kOn}}, Yes, "written", "a", kOn},
        {"a change without mark", {{"Dirty", kOff}, {"k", "b"}}, Yes, kAll, "b", kOff},
        {"the mark removed", {{"Dirty", kGone}, {"k", "b"}}, Yes, kAll, "b", kOn},
        {"the modification date alone", {{"ModificationDate", "x"}}, Yes, "written", "a", kOn},
        {"the mark, and an equal value", {{"Dirty", kOn}, {"k", "a"}}, Yes, kAll, "a", kOn},
    };
    create();
    for (const auto& [what, values, notify, effects, k, dirty] : cases) {
        SCOPED_TRACE(what);
        // Out of the way first, so that each case starts from the same record.
        setValues(kName, {{"k", "a"}, {"n", number(1)}, {"Dirty", kGone}});
        const Value modified = record()["ModificationDate"];
        clock_.advanceBy(10);
        EXPECT_EQ(effectsOf([&, &values = values, notify = notify] {
                      EXPECT_TRUE(__VeltoIDDBSetAccountValues(kName, values, notify));
                  }),
                  effects);
        EXPECT_EQ(record()["k"], k);
        EXPECT_EQ(record()["Dirty"], dirty);
        EXPECT_EQ(record()["ModificationDate"], effects.empty() ? modified : operationDate());
    }
    EXPECT_FALSE(__VeltoIDDBSetAccountValues(kName, {}, Notify::Yes));
    EXPECT_FALSE(__VeltoIDDBSetAccountValues(nullptr, {{"k", "v"}}, Notify::Yes));
}

TEST_F(AccountsTest, SettingOneValue) {
    create();
    EXPECT_EQ(effectsOf([] { EXPECT_TRUE(__VeltoIDDBSetAccountValue(kName, "k", "v", Notify::Yes)); }),
              "written, signalled");
    EXPECT_EQ(__VeltoIDDBCopyAccountValue(kName, "k"), Value("v"));
    EXPECT_TRUE(__VeltoIDDBSetAccountValue(kName, "k", {}, Notify::No));
    EXPECT_TRUE(__VeltoIDDBCopyAccountValue(kName, "k").isAbsent());
    EXPECT_FALSE(__VeltoIDDBSetAccountValue(kName, nullptr, "v", Notify::Yes));
    EXPECT_TRUE(__VeltoIDDBCopyAccountValue(kName, nullptr).isAbsent());
    EXPECT_TRUE(__VeltoIDDBCopyAccountValue(nullptr, "k").isAbsent());
}

TEST_F(AccountsTest, ThePasswordOfARecord) {
    create(kName, "from keychain");
    const Data unknown(std::vector<uint8_t>(16, 7));
    const std::pair<Dictionary, String> cases[] = {
        {{{kReference, record().data(kReference)}, {kPassword, "own"}}, "from keychain"},
        {{{kReference, unknown}, {kPassword, "own"}}, "own"},
        {{{kReference, "text"}, {kPassword, "own"}}, "own"},
        {{{kReference, unknown}}, {}},
        {{{kPassword, number(1)}}, {}},
    };
    for (const auto& [values, password] : cases)
        EXPECT_EQ(__VeltoIDDBCopyHashedPassword({kName, values}), password) << testing::PrintToString(values);
}

TEST_F(AccountsTest, RemovingThePassword) {
    create(kName, "hash");
    const Data reference = record().data(kReference);
    setValues(kName, {{kPassword, "own"}, {"Dirty", kGone}});
    EXPECT_EQ(effectsOf([] { EXPECT_TRUE(__VeltoIDDBRemovePassword(kName)); }), "written, signalled");
    EXPECT_FALSE(record().contains(kPassword) || record().contains(kReference));
    EXPECT_EQ(record()["Dirty"], kOn);
    EXPECT_FALSE(copyPasswordFromKeychainGivenPersistentRef(reference, nullptr));
    EXPECT_EQ(effectsOf([] { EXPECT_TRUE(__VeltoIDDBRemovePassword(kName)); }), "")
        << "there is nothing left to remove";
    setValues(kName, {{kReference, "text"}});
    EXPECT_TRUE(__VeltoIDDBRemovePassword(kName));
    EXPECT_FALSE(record().contains(kReference));
}

TEST_F(AccountsTest, DirtyAccounts) {
    for (const char* name : {"a", "b", "c"}) create(name);
    ASSERT_TRUE(__VeltoIDDBSetCertificateInfo("d", std::nullopt));
    setValues("b", {{"Dirty", kOff}});
    setValues("c", {{"Dirty", "true"}});
    EXPECT_EQ(__VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::Keep), Array{"a"});
    const auto clear = [] { return __VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::ClearOfAccounts); };
    EXPECT_EQ(effectsOf([&] { EXPECT_EQ(clear(), Array{"a"}); }), "")
        << "in memory only, until the section is next written";
    EXPECT_EQ(clear(), std::nullopt);
    EXPECT_FALSE(record("b").contains("Dirty") || record("c").contains("Dirty"));
    const auto entryIsDirty = [] {
        CertificateEntry entry;
        EXPECT_TRUE(__VeltoIDDBCopyCertificateInfo("d", &entry));
        return entry.isDirty();
    };
    EXPECT_TRUE(entryIsDirty());
    EXPECT_EQ(__VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::ClearAll), std::nullopt);
    EXPECT_FALSE(entryIsDirty());
    setValues("a", {{"x", "y"}});
    ASSERT_TRUE(__VeltoIDDBSetCertificateValue("d", "x", "y", Notify::No));
}

TEST_F(AccountsTest, CertificateStateOfAnAccount) {
    create();
    EXPECT_FALSE(__VeltoIDDBHasValidCertificate(kName));
    EXPECT_FALSE(__VeltoIDDBHasCertificateToken(kName));
    setValues(kName, {{"encDsId", "d"}, {kToken, number(5)}});
    EXPECT_FALSE(__VeltoIDDBHasCertificateToken(kName));
    setValues(kName, {{kToken, "t"}});
    EXPECT_TRUE(__VeltoIDDBHasCertificateToken(kName));
    EXPECT_FALSE(__VeltoIDDBHasValidCertificate(kName));
    __VeltoIDDBSetCertificateInfo("d", Dictionary{{"CertStatus", "CERT_ISSUED"}});
    EXPECT_TRUE(__VeltoIDDBHasValidCertificate(kName));
    EXPECT_FALSE(__VeltoIDDBHasValidCertificate("nobody"));
    EXPECT_FALSE(__VeltoIDDBHasCertificateToken(nullptr));
}

}  // namespace
}  // namespace veltoid
