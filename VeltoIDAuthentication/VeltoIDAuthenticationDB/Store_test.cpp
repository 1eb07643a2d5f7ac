#include "VeltoIDAuthenticationDB/Store.h"

#include "TestSupport/DatabaseFixture.h"
#include "TestSupport/SideBySide.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"

namespace veltoid {
namespace {

using platform::transactions::openCount;

const Value kOwnVersion = Value::real(727.8);

Array accountNames() {
    Array names;
    __VeltoIDDBCopyVeltoIDs(&names);
    return names;
}

Dictionary account(const char* name) {
    AccountRecord record;
    EXPECT_TRUE(__VeltoIDDBCopyVeltoIDAccount(name, &record));
    return record.values();
}

/// An account's record in a copy of the domain.
Dictionary recordIn(const Dictionary& domain, std::string_view name) {
    const Dictionary* accounts = domain.dictionary("Accounts");
    const Dictionary* record = accounts != nullptr ? accounts->dictionary(name) : nullptr;
    return record != nullptr ? *record : Dictionary();
}

// --- Versions of the stored layout

struct VersionCase {
    const char* name;
    Value version;
    bool isKept;

    friend void PrintTo(const VersionCase& each, std::ostream* stream) { *stream << each.name; }
};

class StoredVersion : public DatabaseTest, public testing::WithParamInterface<VersionCase> {};

TEST_P(StoredVersion, DecidesWhetherTheDataIsKept) {
    Dictionary before = {{"Accounts", Dictionary{{"a@b", Dictionary{{"VeltoID", "a@b"}}}}},
                         {"AuthCertificates", Dictionary{{"d", Dictionary{{"encDsId", "d"}}}}},
                         {"MetaInfo", Dictionary{{"UserUUID", "U"}}},
                         {"AccessorVersions", Array{Value::real(700)}},
                         {"LeftByAnOlderAgent", "x"}};
    before.set("Version", GetParam().version);
    storeDomain(before);
    const bool isKept = GetParam().isKept;
    EXPECT_EQ(accountNames(), isKept ? Array{"a@b"} : Array());
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue(nullptr, {}, "UserUUID").isString(), isKept);
    flush();

    const Dictionary after = storedDomain();
    EXPECT_EQ(after["LeftByAnOlderAgent"].isString(), isKept);
    EXPECT_EQ(after["AccessorVersions"],
              isKept ? (Array{Value::real(700), kOwnVersion}) : Array{kOwnVersion});
    EXPECT_EQ(after["Version"], isKept ? GetParam().version : number(100));
    EXPECT_EQ(after.date("CreationDate"),
              isKept ? std::nullopt : std::optional(now() - kVeltoIDDBFlushDelay));
}

const VersionCase kVersionCases[] = {
    {"None", {}, false},
    {"Zero", number(0), false},
    {"NinetyNine", number(99), false},
    {"Hundred", number(100), true},
    {"HundredAndOne", number(101), true},
    {"Negative", number(-1), true},
    {"WholeDouble", Value::real(100), true},
    {"Fraction", Value::real(100.5), false},
    {"Text", "100", false},
    {"Boolean", kOn, false},
};
INSTANTIATE_TEST_SUITE_P(Versions, StoredVersion, testing::ValuesIn(kVersionCases),
                         [](const auto& each) { return each.param.name; });

// --- What earlier agents left behind

struct MigrationCase {
    const char* name;
    Value versions;
    /// What the load puts right: "dirty" (and certificates out of the records), "lists" (of certificates out
    /// of the records), "meta" (versions out of the meta information), "uuid" (for device and accounts).
    std::set<std::string> effects;
    Array versionsAfter;
    bool writesSections = true;

    friend void PrintTo(const MigrationCase& each, std::ostream* stream) { *stream << each.name; }
};

class Migration : public DatabaseTest, public testing::WithParamInterface<MigrationCase> {};

TEST_P(Migration, PutsRightWhatTheAccessorsLeft) {
    const Dictionary before = {{"VeltoID", "a@b"},
                               {"Certificate", "c"},
                               {"PrivateKey", "k"},
                               {"Certificates", Array()},
                               {"FirstName", "A"}};
    Dictionary stored = {{"Version", number(100)},
                         {"Accounts", Dictionary{{"a@b", before}, {"dropped", "text"}}},
                         {"MetaInfo", Dictionary{{"AccessorVersions", "x"}, {"Other", "y"}}}};
    stored.set("AccessorVersions", GetParam().versions);
    storeDomain(stored);

    const Dictionary record = account("a@b");
    const Dictionary meta = database::perform([](const database::Store& store) { return store.metaInfo; });
    std::set<std::string> effects;
    if (record.boolean("Dirty") == true) effects.insert("dirty");
    if (!record.contains("Certificates")) effects.insert("lists");
    if (!meta.contains("AccessorVersions")) effects.insert("meta");
    if (meta.string("UserUUID").view().size() == 36) effects.insert("uuid");
    EXPECT_EQ(effects, GetParam().effects);
    EXPECT_EQ(record.contains("Certificate"), effects.count("dirty") == 0);
    EXPECT_EQ(record.contains("PrivateKey"), effects.count("dirty") == 0);
    EXPECT_EQ(record.string("AccountStableUUID").view().size(), effects.count("uuid") * 36);
    EXPECT_EQ(record.string("FirstName"), "A");
    EXPECT_EQ(meta.string("Other"), "y");

    const Dictionary after = storedDomain();
    EXPECT_EQ(after["AccessorVersions"], GetParam().versionsAfter);
    EXPECT_EQ(openCount() > 0, GetParam().writesSections);
    EXPECT_EQ(after.dictionary("Accounts")->contains("dropped"), !GetParam().writesSections);
    if (!GetParam().writesSections) doNotCompareWithDisk();
}

Array reals(std::initializer_list<double> values) {
    Array array;
    for (const double value : values) array.append(Value::real(value));
    return array;
}

const Array kNotPositive = {"x", number(0), Value::real(-300)};
const MigrationCase kMigrationCases[] = {
    {"None", {}, {}, reals({727.8})},
    {"NoArray", "300", {}, reals({727.8})},
    {"Own", reals({727.8}), {}, reals({727.8}), false},
    {"A300", reals({300}), {"dirty"}, reals({300, 727.8})},
    {"A478", reals({478}), {"dirty"}, reals({478, 727.8})},
    {"A478andABit", reals({478.5}), {"meta"}, reals({478.5, 727.8})},
    {"A480", Array{number(480)}, {"meta"}, Array{number(480), kOwnVersion}},
    {"A481", reals({481}), {"meta"}, reals({481, 727.8})},
    {"A482", reals({482}), {"uuid"}, reals({482, 727.8})},
    {"A508", reals({508}), {"uuid"}, reals({508, 727.8})},
    {"A509", reals({509}), {"lists"}, reals({509, 727.8})},
    {"A617", reals({617}), {"lists"}, reals({617, 727.8})},
    {"A618", reals({618}), {}, reals({618, 727.8})},
    {"All", reals({480, 500, 600, 700}), {"meta", "uuid", "lists"}, reals({480, 500, 600, 700, 727.8})},
    // The list is cut behind the largest of the oldest ones, and sorted with that.
    {"OldOnes", reals({200, 300, 100}), {"dirty"}, reals({300, 727.8})},
    {"Mixture", reals({300, 500, 600}), {"dirty", "uuid", "lists"}, reals({600, 500, 300, 727.8})},
    {"OldAndOwn", reals({300, 727.8}), {"dirty"}, reals({727.8, 300}), false},
    {"UUIDAndOwn", reals({500, 727.8}), {"uuid"}, reals({500, 727.8})},
    {"NotPositive", kNotPositive, {}, Array{"x", number(0), Value::real(-300), kOwnVersion}},
    {"OthersBehindOldOnes", Array{"x", Value::real(300), number(0)}, {"dirty"}, reals({300, 727.8})},
};
INSTANTIATE_TEST_SUITE_P(Accessors, Migration, testing::ValuesIn(kMigrationCases),
                         [](const auto& each) { return each.param.name; });

class StoreTest : public DatabaseTest {};

TEST_F(StoreTest, TheDevicesIdentifierIsMadeOnce) {
    storeDomain({{"Version", number(100)},
                 {"Accounts", Dictionary{{"a@b", Dictionary{}}}},
                 {"MetaInfo", Dictionary{{"UserUUID", "stays"}}},
                 {"AccessorVersions", reals({500, 727.8})}});
    EXPECT_EQ(account("a@b"), Dictionary());
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue(nullptr, {}, "UserUUID"), Value("stays"));
    EXPECT_EQ(openCount(), 0);
}

TEST_F(StoreTest, NamesThatAnotherLocaleKeptInCapitalsCanBeAskedForAgain) {
    storeDomain({{"Version", number(100)},
                 {"Accounts", Dictionary{{"Änne@x", Dictionary{{"VeltoID", "Änne@x"}, {"k", "v"}}}}},
                 {"AccessorVersions", Array{kOwnVersion}}});
    EXPECT_EQ(account("änne@x"), (Dictionary{{"VeltoID", "änne@x"}, {"k", "v"}}));
    EXPECT_EQ(accountNames(), Array{"änne@x"});
}

TEST_F(StoreTest, SectionsOfTheWrongFormLoadAsFarAsTheyAreRight) {
    storeDomain(
        {{"Version", number(100)},
         {"Accounts", Dictionary{{"good", Dictionary{{"x", "y"}}}, {"bad", "text"}, {"list", Array()}}},
         {"AuthCertificates", "text"},
         {"MetaInfo", Dictionary{{"value", number(5)}, {"section", Dictionary{{"x", "z"}}}}}});
    EXPECT_EQ(accountNames(), Array{"good"});
    EXPECT_EQ(account("good"), (Dictionary{{"x", "y"}}));
    Array keys{"left over"};
    EXPECT_TRUE(__VeltoIDDBCopyCertificateKeys(&keys));
    EXPECT_TRUE(keys.empty());
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue(nullptr, {}, "value"), number(5));
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue("section", {}, "x"), Value("z"));
}

// --- Writing and flushing

TEST_F(StoreTest, WritesAreFlushedTogetherAndKeepTheAgentAliveUntilThen) {
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("a", nullptr, nullptr));
    const auto write = [&](int64_t value) {
        EXPECT_TRUE(__VeltoIDDBSetAccountValue("a", "n", number(value), Notify::No));
        EXPECT_EQ(recordIn(storedDomain(), "a")["n"], number(value))
            << "a change survives the process at once";
    };
    flush();
    EXPECT_EQ(openCount(), 0);

    write(1);
    EXPECT_EQ(openCount(), 1);
    clock_.advanceBy(2.5);
    write(2);
    EXPECT_EQ(openCount(), 1);
    clock_.advanceBy(0.5);
    EXPECT_EQ(openCount(), 0) << "three seconds after the first write";

    write(3);
    EXPECT_TRUE(__VeltoIDDBSynchronize());
    EXPECT_EQ(openCount(), 0) << "an explicit flush ends the wait for the planned one";
    clock_.advanceBy(1);
    write(4);
    EXPECT_EQ(openCount(), 1);
    clock_.advanceBy(2);
    EXPECT_EQ(openCount(), 0) << "the flush planned by the third write does for the fourth";
    clock_.advanceBy(1);
    EXPECT_EQ(openCount(), 0) << "and the one planned by the fourth has nothing to end";
    EXPECT_TRUE(__VeltoIDDBSynchronize());
    EXPECT_EQ(openCount(), 0);
}

TEST_F(StoreTest, OnlyTheChangedSectionIsWritten) {
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("a", nullptr, nullptr));
    ASSERT_TRUE(__VeltoIDDBSetCertificateInfo("d", std::nullopt));
    ASSERT_TRUE(__VeltoIDDBSetMetaInfoValue(nullptr, "m", "1"));
    const std::pair<std::string_view, std::function<void()>> cases[] = {
        {"Accounts", [] { __VeltoIDDBSetAccountValue("a", "x", "1", Notify::No); }},
        {"AuthCertificates", [] { __VeltoIDDBSetCertificateValue("d", "x", "1", Notify::No); }},
        {"MetaInfo", [] { __VeltoIDDBSetMetaInfoValue(nullptr, "x", "1"); }},
    };
    for (const auto& [changed, change] : cases) {
        ASSERT_TRUE(domain().remove({"Accounts", "AuthCertificates", "MetaInfo"}));
        change();
        EXPECT_EQ(keysOf(storedDomain()), (std::set<std::string>{"AccessorVersions", "CreationDate",
                                                                 "Version", std::string(changed)}));
    }
    __VeltoIDDBSetUsePreferences(true);
}

TEST_F(StoreTest, ALaterProcessReadsWhatAKilledOneHadInMemory) {
    ASSERT_TRUE(platform::ChildProcess([] {
                    return __VeltoIDDBCreateVeltoIDAccount("a@b", "hash", "d") &&
                           __VeltoIDDBSetAccountValue("a@b", "ValidatedEmail", Array{"a@b", "ä@b"},
                                                      Notify::Yes) &&
                           __VeltoIDDBSetCertificateInfo("d", Dictionary{{"CertStatus", "CERT_ISSUED"}}) &&
                           __VeltoIDDBSetMetaInfoValue("a@b", "Count", number(7));
                }).succeeded());
    const Dictionary record = account("a@b");
    EXPECT_EQ(record["ValidatedEmail"], (Array{"a@b", "ä@b"}));
    EXPECT_EQ(__VeltoIDDBCopyHashedPassword({"a@b", record}), "hash");
    EXPECT_TRUE(__VeltoIDDBHasValidCertificate("a@b"));
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue("a@b", {}, "Count"), number(7));
    EXPECT_EQ(openCount(), 0) << "reading back changes nothing";
}

TEST_F(StoreTest, AnotherDomainLeavesTheUsualOneAlone) {
    doNotCompareWithDisk();
    __VeltoIDDBSetPreferencesDomainName("com.example.other");
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("a", nullptr, nullptr));
    EXPECT_EQ(storedDomain(), Dictionary());
    const Dictionary other = storedDomain("com.example.other");
    EXPECT_EQ(recordIn(other, "a"), account("a"));
    std::optional<Dictionary> contents;
    EXPECT_TRUE(__VeltoIDDBCopyAllContents(&contents));
    EXPECT_EQ(*contents, other);
    EXPECT_EQ(keysOf(other), (std::set<std::string>{"AccessorVersions", "Accounts", "AuthCertificates",
                                                    "CreationDate", "MetaInfo", "Version"}));
    EXPECT_TRUE(__VeltoIDDBCopyAllContents(nullptr));
}

TEST_F(StoreTest, WithoutPreferencesEverythingStaysInMemory) {
    doNotCompareWithDisk();
    __VeltoIDDBSetUsePreferences(false);
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("a", nullptr, "d"));
    EXPECT_EQ(takeSignals(), 1) << "the account check works without persistence too";
    ASSERT_TRUE(__VeltoIDDBSetMetaInfoValue(nullptr, "m", "1"));
    EXPECT_TRUE(__VeltoIDDBSynchronize());
    EXPECT_EQ(openCount(), 0);
    std::optional<Dictionary> contents;
    EXPECT_TRUE(__VeltoIDDBCopyAllContents(&contents));
    EXPECT_EQ(*contents, (Dictionary{{"Accounts", Dictionary{{"a", account("a")}}},
                                     {"Certificates", Dictionary()},
                                     {"MetaInfo", Dictionary{{"m", "1"}}}}));
    EXPECT_TRUE(platform::TemporaryStateDirectory::contents().empty());
}

TEST_F(StoreTest, SwitchingPreferencesOffWritesEverythingFirst) {
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("a", nullptr, nullptr));
    ASSERT_TRUE(__VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::ClearOfAccounts)) << "marks go in memory only";
    const auto storedMark = [] { return recordIn(storedDomain(), "a").contains("Dirty"); };
    EXPECT_TRUE(storedMark());
    __VeltoIDDBSetUsePreferences(false);
    EXPECT_FALSE(storedMark());
    EXPECT_EQ(takeSignals(), 1) << "only the creation is a change";
    ASSERT_TRUE(__VeltoIDDBSetAccountValue("a", "x", "memory", Notify::Yes));
    EXPECT_EQ(takeSignals(), 1);
    EXPECT_FALSE(recordIn(storedDomain(), "a").contains("x"));
    doNotCompareWithDisk();
}

TEST_F(StoreTest, AStoreThatCannotBeReadIsNeverOverwritten) {
    ASSERT_TRUE(platform::ChildProcess([] {
                    return __VeltoIDDBCreateVeltoIDAccount("kept", nullptr, nullptr) &&
                           __VeltoIDDBSynchronize();
                }).succeeded());
    std::optional<platform::Obstacle> obstacle("preferences.db");
    const auto before = platform::TemporaryStateDirectory::readFile(obstacle->aside());
    std::optional<Error> error;
    EXPECT_FALSE(__VeltoIDDBCopyVeltoIDs(nullptr, &error));
    EXPECT_EQ(error->code, -1) << "not that there are no accounts";
    EXPECT_FALSE(__VeltoIDDBCopyCertificateKeys(nullptr, &error));
    EXPECT_EQ(error->code, -106);
    EXPECT_EQ(referencesInUse(), std::nullopt) << "in doubt an item belongs to somebody";
    EXPECT_FALSE(__VeltoIDDBCreateVeltoIDAccount("lost", "hash", nullptr));
    EXPECT_FALSE(__VeltoIDDBSetCertificateInfo("lost", std::nullopt));
    EXPECT_FALSE(__VeltoIDDBSetMetaInfoValue(nullptr, "lost", "too"));
    EXPECT_TRUE(__VeltoIDDBSynchronize());
    __VeltoIDDBSetUsePreferences(true);
    EXPECT_EQ(takeSignals(), 0);
    EXPECT_FALSE(log_.contains("Password not in keychain")) << "an item that no record names";
    EXPECT_EQ(platform::TemporaryStateDirectory::readFile(obstacle->aside()), before);
    obstacle.reset();
    EXPECT_EQ(accountNames(), Array{"kept"}) << "readable again, without a restart";
    EXPECT_TRUE(__VeltoIDDBCopyMetaInfoValue(nullptr, {}, "lost").isAbsent());
    EXPECT_TRUE(__VeltoIDDBSetAccountValue("kept", "x", "y", Notify::Yes));
}

TEST_F(StoreTest, WhatCannotBeStoredIsNotKeptInMemoryEither) {
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("a", nullptr, nullptr));
    ASSERT_TRUE(__VeltoIDDBSetCertificateInfo("d", std::nullopt));
    const Dictionary before = account("a");
    const Value tooDeep = nestedArrays(1000);
    EXPECT_EQ(effectsOf([&] {
                  EXPECT_FALSE(__VeltoIDDBSetAccountValue("a", "x", tooDeep, Notify::Yes));
                  EXPECT_FALSE(__VeltoIDDBSetCertificateValue("d", "x", tooDeep, Notify::Yes));
                  EXPECT_FALSE(__VeltoIDDBSetMetaInfoValue("a", "x", tooDeep));
              }),
              "");
    EXPECT_EQ(account("a"), before);
    EXPECT_TRUE(__VeltoIDDBSetAccountValue("a", "x", "y", Notify::Yes)) << "and harms nothing later";
}

TEST_F(StoreTest, ConcurrentFirstCallersShareOneLoad) {
    platform::sideBySide(8, [](int i) {
        const std::string name = "account" + std::to_string(i);
        EXPECT_TRUE(__VeltoIDDBCreateVeltoIDAccount(name, nullptr, nullptr));
        for (int round = 0; round < 20; ++round) {
            EXPECT_TRUE(__VeltoIDDBSetAccountValue(name, "round", number(round), Notify::Yes));
            EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter(name, {}, "rounds", 1), round + 1);
            EXPECT_TRUE(__VeltoIDDBSynchronize());
        }
    });
    EXPECT_EQ(accountNames().size(), 8U);
}

}  // namespace
}  // namespace veltoid
