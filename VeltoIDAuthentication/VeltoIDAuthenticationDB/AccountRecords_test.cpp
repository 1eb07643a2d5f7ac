#include "VeltoIDAuthenticationDB/AccountRecords.h"

#include "TestSupport/DatabaseFixture.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

constexpr const char* kName = "jane.roe@velto.example";
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

    static void create(const char* name = kName, const char* password = nullptr,
                       const char* encDsId = nullptr) {
        const auto text = [](const char* given) { return given != nullptr ? String(given) : String(); };
        ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount(name, text(password), text(encDsId)));
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
    EXPECT_EQ(created["Dirty"], flag(true));
    EXPECT_EQ(created["CreationDate"], created["ModificationDate"]);
    EXPECT_EQ(created.string("AccountUUID").view().size(), 36U);
    EXPECT_FALSE(__VeltoIDDBCreateVeltoIDAccount(nullptr, "hash", "d"));
}

TEST_F(AccountsTest, CreatingAgainUpdatesTheRecord) {
    create(kName, nullptr, "first");
    setValues(kName, {{"FirstName", "Jane"}, {"Dirty", Value::null()}});
    const Dictionary before = record();
    clock_.advanceBy(60);
    create(kName, nullptr, nullptr);
    Dictionary expected = before;
    expected.set("Dirty", flag(true));
    expected.set("ModificationDate", date());
    EXPECT_EQ(record(), expected) << "what is not given stays";
    create(kName, nullptr, "second");
    EXPECT_EQ(record()["encDsId"], Value("second"));
    EXPECT_EQ(record()["CreationDate"], before["CreationDate"]);
}

TEST_F(AccountsTest, ThePasswordGoesToTheKeychainOnce) {
    create(kName, "hash one");
    const Data reference = record().data("HashedPasswordRef");
    String stored;
    ASSERT_TRUE(copyPasswordFromKeychainGivenPersistentRef(reference, &stored));
    EXPECT_EQ(stored, "hash one");
    EXPECT_FALSE(record().contains("HashedPassword"));

    EXPECT_EQ(effectsOf([] { create(kName, "hash one"); }), "written, signalled");
    EXPECT_EQ(
        log_.count("Password being added for account jane.roe@velto.example matches password on keychain, "
                   "so skipping over addPasswordToKeychain"),
        1);
    EXPECT_FALSE(log_.contains("Password already in keychain"));

    create(kName, "hash two");
    EXPECT_EQ(record().data("HashedPasswordRef"), reference);
    EXPECT_EQ(__VeltoIDDBCopyHashedPassword({kName, record()}), "hash two");
    EXPECT_FALSE(log_.contains("hash one") || log_.contains("hash two"));
}

TEST_F(AccountsTest, APasswordThatTheKeychainRefusesLeavesTheRecordAsItWas) {
    create();
    const Dictionary before = record();
    // A directory in the place of its file: the keychain cannot be opened.
    std::filesystem::create_directory(platform::TemporaryStateDirectory::file("keychain.db"));
    EXPECT_EQ(effectsOf([] { EXPECT_FALSE(__VeltoIDDBCreateVeltoIDAccount(kName, "hash", "new")); }), "");
    EXPECT_EQ(record(), before);
    EXPECT_FALSE(__VeltoIDDBCreateVeltoIDAccount("other", "hash", nullptr));
    EXPECT_FALSE(__VeltoIDDBCopyVeltoIDAccount("other", nullptr));
    EXPECT_TRUE(log_.contains("Failed to add password to keychain,err="));
}

TEST_F(AccountsTest, IdentifiersOfAnAccount) {
    struct Case {
        const char* what;
        const char* name;
        Value uuid;
        Value stableUUID;
        const char* userUUID;
        bool changes;
        const char* newStableUUID;
    };
    const Case cases[] = {
        {"a new record", kName, {}, {}, kUserUUID, true, kStableUUID},
        {"whatever the case of the name", "Jane.Roe@Velto.Example", "U", {}, kUserUUID, true, kStableUUID},
        {"another device", kName, "U", {}, kOtherUserUUID, true, kOtherStableUUID},
        {"nothing to do", kName, "U", "S", kUserUUID, false, "S"},
        {"a new identifier makes the other one void", kName, {}, "S", kUserUUID, true, kStableUUID},
        {"wrong kinds", kName, number(1), number(2), kUserUUID, true, kStableUUID},
        {"a stable one of the wrong kind", kName, "U", number(2), kUserUUID, true, kStableUUID},
        {"no device identifier", kName, "U", {}, nullptr, false, nullptr},
        {"no device identifier, a new record", kName, {}, "S", nullptr, true, nullptr},
    };
    for (const Case& each : cases) {
        __VeltoIDDBSetMetaInfoValue(nullptr, "UserUUID",
                                    each.userUUID != nullptr ? Value(each.userUUID) : Value());
        Dictionary record = {{"AccountUUID", each.uuid}, {"AccountStableUUID", each.stableUUID}};
        EXPECT_EQ(__VeltoIDDBDeriveAccountUUIDs(each.name, record), each.changes) << each.what;
        const String uuid = record.string("AccountUUID");
        EXPECT_TRUE(each.uuid.isString() ? uuid == each.uuid.asString() : uuid.view().size() == 36)
            << each.what;
        EXPECT_EQ(record["AccountStableUUID"],
                  each.newStableUUID != nullptr ? Value(each.newStableUUID) : Value())
            << each.what;
    }
}

TEST_F(AccountsTest, ErrorsOfLookUps) {
    const auto codeOf = [](auto operation) {
        std::optional<Error> error;
        EXPECT_FALSE(operation(&error));
        EXPECT_EQ(error->domain, kIdentityErrorDomain);
        return error->code;
    };
    Array names{"left over"};
    EXPECT_EQ(codeOf([&](ErrorOut error) { return __VeltoIDDBCopyVeltoIDs(&names, error); }), -107);
    EXPECT_EQ(names, Array{"left over"}) << "filled only on success";
    EXPECT_EQ(codeOf([](ErrorOut error) { return __VeltoIDDBCopyVeltoIDAccount(nullptr, nullptr, error); }),
              -99);
    EXPECT_EQ(codeOf([](ErrorOut error) { return __VeltoIDDBCopyVeltoIDAccount("x", nullptr, error); }),
              -108);
    EXPECT_EQ(codeOf([](ErrorOut error) { return __VeltoIDDBRemoveVeltoIDAccount("x", error); }), -108);

    std::optional<Error> error;
    EXPECT_FALSE(__VeltoIDDBRemoveVeltoIDAccount(nullptr, &error));
    EXPECT_EQ(error, (Error{kOSStatusErrorDomain, -1, {}}));
    for (const String& encDsId : {String("d"), String()}) {
        EXPECT_FALSE(__VeltoIDDBCopyVeltoIDForDSID(encDsId, nullptr, &error));
        EXPECT_EQ(error->code, -1);
        EXPECT_EQ(error->userInfo[kErrorFailureReasonKey], Value("Unknown error"));
        EXPECT_EQ(error->userInfo[kErrorDescriptionKey], Value("?"));
        EXPECT_EQ(error->userInfo[kErrorRecoverySuggestionKey], Value("?"));
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
    setValues("own hash", {{"HashedPassword", "h"}, {"HashedPasswordRef", "no data"}});
    create("dsid", nullptr, "d1");
    setValues("dsid", {{"HashedPassword", number(1)}});
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
    struct Case {
        const char* what;
        Dictionary values;
        bool signal;
        const char* effects;
        /// Of the record afterwards: its value of "k" and its mark.
        Value k;
        Value dirty;
    };
    const Value on = flag(true);
    const Value off = flag(false);
    const Value null = Value::null();
    const Case cases[] = {
        {"a new value", {{"k", "b"}}, true, "written, signalled", "b", on},
        {"quietly", {{"k", "b"}}, false, "written", "b", {}},
        {"an equal value", {{"k", "a"}}, true, "", "a", {}},
        {"an equal number of another form", {{"n", Value::real(1)}}, true, "", "a", {}},
        {"another kind", {{"k", number(1)}}, false, "written", number(1), {}},
        {"Null removes", {{"k", null}}, true, "written, signalled", {}, on},
        {"Null for nothing", {{"x", null}}, true, "", "a", {}},
        {"the mark alone", {{"Dirty", on}}, true, "written", "a", on},
        {"a change without mark", {{"Dirty", off}, {"k", "b"}}, true, "written, signalled", "b", off},
        {"the mark removed", {{"Dirty", null}, {"k", "b"}}, true, "written, signalled", "b", on},
        {"the modification date alone", {{"ModificationDate", "x"}}, true, "written", "a", on},
        {"the mark, and an equal value", {{"Dirty", on}, {"k", "a"}}, true, "written, signalled", "a", on},
    };
    create();
    for (const Case& each : cases) {
        // Out of the way first, so that each case starts from the same record.
        setValues(kName, {{"k", "a"}, {"n", number(1)}, {"Dirty", null}});
        const Value modified = record()["ModificationDate"];
        clock_.advanceBy(10);
        double changedAt = 0;
        EXPECT_EQ(effectsOf([&] {
                      changedAt = now();
                      EXPECT_TRUE(__VeltoIDDBSetAccountValues(kName, each.values,
                                                              each.signal ? Notify::Yes : Notify::No));
                  }),
                  each.effects)
            << each.what;
        const bool changed = std::string_view(each.effects) != "";
        EXPECT_EQ(record()["k"], each.k) << each.what;
        EXPECT_EQ(record()["Dirty"], each.dirty) << each.what;
        EXPECT_EQ(record()["ModificationDate"], changed ? Value::date(changedAt) : modified) << each.what;
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
    const Data reference = record().data("HashedPasswordRef");
    const Data unknown(std::vector<uint8_t>(16, 7));
    EXPECT_EQ(
        __VeltoIDDBCopyHashedPassword({kName, {{"HashedPasswordRef", reference}, {"HashedPassword", "own"}}}),
        "from keychain");
    EXPECT_EQ(
        __VeltoIDDBCopyHashedPassword({kName, {{"HashedPasswordRef", unknown}, {"HashedPassword", "own"}}}),
        "own");
    EXPECT_EQ(
        __VeltoIDDBCopyHashedPassword({kName, {{"HashedPasswordRef", "text"}, {"HashedPassword", "own"}}}),
        "own");
    EXPECT_EQ(__VeltoIDDBCopyHashedPassword({kName, {{"HashedPasswordRef", unknown}}}), String());
    EXPECT_EQ(__VeltoIDDBCopyHashedPassword({kName, {{"HashedPassword", number(1)}}}), String());
}

TEST_F(AccountsTest, RemovingThePassword) {
    create(kName, "hash");
    const Data reference = record().data("HashedPasswordRef");
    setValues(kName, {{"HashedPassword", "own"}, {"Dirty", Value::null()}});
    EXPECT_EQ(effectsOf([] { EXPECT_TRUE(__VeltoIDDBRemovePassword(kName)); }), "written, signalled");
    EXPECT_FALSE(record().contains("HashedPassword") || record().contains("HashedPasswordRef"));
    EXPECT_EQ(record()["Dirty"], flag(true));
    EXPECT_FALSE(copyPasswordFromKeychainGivenPersistentRef(reference, nullptr));
    EXPECT_EQ(effectsOf([] { EXPECT_TRUE(__VeltoIDDBRemovePassword(kName)); }), "")
        << "there is nothing left to remove";
    setValues(kName, {{"HashedPasswordRef", "text"}});
    EXPECT_TRUE(__VeltoIDDBRemovePassword(kName));
    EXPECT_FALSE(record().contains("HashedPasswordRef"));
}

TEST_F(AccountsTest, DirtyAccounts) {
    create("a");
    create("b");
    create("c");
    ASSERT_TRUE(__VeltoIDDBSetCertificateInfo("d", std::nullopt));
    setValues("b", {{"Dirty", flag(false)}});
    setValues("c", {{"Dirty", "true"}});
    EXPECT_EQ(__VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::Keep), Array{"a"});
    EXPECT_EQ(
        effectsOf([] { EXPECT_EQ(__VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::ClearOfAccounts), Array{"a"}); }),
        "")
        << "in memory only, until the section is next written";
    EXPECT_EQ(__VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::ClearOfAccounts), std::nullopt);
    EXPECT_FALSE(record("b").contains("Dirty") || record("c").contains("Dirty"));
    CertificateEntry entry;
    ASSERT_TRUE(__VeltoIDDBCopyCertificateInfo("d", &entry));
    EXPECT_TRUE(entry.isDirty());
    EXPECT_EQ(__VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::ClearAll), std::nullopt);
    ASSERT_TRUE(__VeltoIDDBCopyCertificateInfo("d", &entry));
    EXPECT_FALSE(entry.isDirty());
    setValues("a", {{"x", "y"}});
    ASSERT_TRUE(__VeltoIDDBSetCertificateValue("d", "x", "y", Notify::No));
}

TEST_F(AccountsTest, CertificateStateOfAnAccount) {
    create();
    EXPECT_FALSE(__VeltoIDDBHasValidCertificate(kName));
    EXPECT_FALSE(__VeltoIDDBHasCertificateToken(kName));
    setValues(kName, {{"encDsId", "d"}, {"CertificateToken", number(5)}});
    EXPECT_FALSE(__VeltoIDDBHasCertificateToken(kName));
    setValues(kName, {{"CertificateToken", "t"}});
    EXPECT_TRUE(__VeltoIDDBHasCertificateToken(kName));
    EXPECT_FALSE(__VeltoIDDBHasValidCertificate(kName));
    __VeltoIDDBSetCertificateInfo("d", Dictionary{{"CertStatus", "CERT_ISSUED"}});
    EXPECT_TRUE(__VeltoIDDBHasValidCertificate(kName));
    EXPECT_FALSE(__VeltoIDDBHasValidCertificate("nobody"));
    EXPECT_FALSE(__VeltoIDDBHasCertificateToken(nullptr));
}

}  // namespace
}  // namespace veltoid
