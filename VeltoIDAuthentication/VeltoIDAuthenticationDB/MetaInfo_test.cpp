#include "VeltoIDAuthenticationDB/MetaInfo.h"

#include <limits>

#include "TestSupport/DatabaseFixture.h"

namespace veltoid {
namespace {

class MetaInfoTest : public DatabaseTest {};

constexpr auto kString = Value::Kind::String;
constexpr auto kNumber = Value::Kind::Number;
const Value kDefaultURL = "https://identity.velto.example/dsservices/dsxmlrpc";

TEST_F(MetaInfoTest, TheNearestValueOfTheRightKindIsFound) {
    struct Case {
        const char* what;
        const char* key;
        /// What the options, the account's section and the top level hold.
        Value option;
        Value own;
        Value top;
        std::optional<Value::Kind> kind;
        Value found;
    };
    const Value one = number(1);
    const Case cases[] = {
        {"options first", "k", "o", "s", "t", {}, "o"},
        {"then the account's", "k", {}, "s", "t", {}, "s"},
        {"then the device's", "k", {}, {}, "t", {}, "t"},
        {"none", "k", {}, {}, {}, {}, {}},
        {"an option of the wrong kind", "k", one, "s", "t", kString, "s"},
        {"an own value of the wrong kind", "k", {}, one, "t", kString, "t"},
        {"all of the wrong kind", "k", one, one, one, kString, {}},
        {"the built-in one", "ServerURL", {}, {}, {}, kString, kDefaultURL},
        {"the built-in one behind a wrong kind", "ServerURL", {}, {}, one, kString, kDefaultURL},
        {"not built in in that kind", "ServerURL", {}, {}, {}, kNumber, {}},
        {"before the built-in one", "ServerURL", {}, {}, "t", kString, "t"},
        {"the other built-in one", "PreExpirationInterval", {}, {}, {}, {}, Value::real(129'600)},
    };
    for (const Case& each : cases) {
        __VeltoIDDBSetMetaInfoValue("account", each.key, each.own);
        __VeltoIDDBSetMetaInfoValue(nullptr, each.key, each.top);
        EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue("account", {{each.key, each.option}}, each.key, each.kind),
                  each.found)
            << each.what;
    }
    __VeltoIDDBSetMetaInfoValue("account", "k", "own");
    __VeltoIDDBSetMetaInfoValue(nullptr, "k", "top");
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue(nullptr, {}, "k"), Value("top"));
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue("somebody else", {}, "k"), Value("top"));
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue("k", {}, "k"), Value("top")) << "a section that is no dictionary";
    EXPECT_TRUE(__VeltoIDDBCopyMetaInfoValue("account", {}, nullptr).isAbsent());
}

TEST_F(MetaInfoTest, SettingWritesChangesAndNeverSignals) {
    struct Case {
        const char* what;
        String section;
        Value value;
        const char* effects;
        Value top;
        Value own;
    };
    // One after the other.
    const Case cases[] = {
        {"nothing to remove", nullptr, {}, "", {}, {}},
        {"a value", nullptr, "t", "written", "t", {}},
        {"the same", nullptr, "t", "", "t", {}},
        {"in a section", "s", "own", "written", "t", "own"},
        {"the same there", "s", "own", "", "t", "own"},
        {"none removes", nullptr, {}, "written", {}, "own"},
        {"Null removes", "s", Value::null(), "written", {}, {}},
        {"nothing left there", "s", Value::null(), "", {}, {}},
    };
    for (const Case& each : cases) {
        EXPECT_EQ(effectsOf([&] { EXPECT_TRUE(__VeltoIDDBSetMetaInfoValue(each.section, "k", each.value)); }),
                  each.effects)
            << each.what;
        database::perform([&](const database::Store& store) {
            EXPECT_EQ(store.metaInfo["k"], each.top) << each.what;
            const Dictionary* section = store.metaInfo.dictionary("s");
            EXPECT_EQ(section != nullptr ? (*section)["k"] : Value(), each.own) << each.what;
        });
    }
    EXPECT_FALSE(__VeltoIDDBSetMetaInfoValue("s", nullptr, "v"));
}

TEST_F(MetaInfoTest, CountersCount) {
    constexpr int64_t kMost = std::numeric_limits<int64_t>::max();
    struct Case {
        const char* what;
        Value stored;
        int64_t delta;
        int64_t sum;
    };
    const Case cases[] = {
        {"absent", {}, 5, 5},
        {"counted before", number(5), 2, 7},
        {"downwards", number(5), -6, -1},
        {"a text", "12", 1, 1},
        {"a whole double", Value::real(4), 1, 5},
        {"a fraction", Value::real(4.5), 1, 1},
        {"beyond the range", number(kMost), 1, std::numeric_limits<int64_t>::min()},
    };
    for (const Case& each : cases) {
        __VeltoIDDBSetMetaInfoValue(nullptr, "c", each.stored);
        EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter(nullptr, {}, "c", each.delta), each.sum) << each.what;
        const Value stored = __VeltoIDDBCopyMetaInfoValue(nullptr, {}, "c");
        EXPECT_EQ(stored, number(each.sum)) << each.what;
        EXPECT_EQ(stored.numberKind(), NumberKind::Int64) << each.what;
    }
    __VeltoIDDBSetMetaInfoValue(nullptr, "c", number(100));
    EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter("account", {}, "c", 1), 101) << "from where it is found";
    EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter("account", {}, "c", 1), 102);
    EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter("account", {{"c", number(1)}}, "c", 1), 2);
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue(nullptr, {}, "c"), number(100)) << "the device's own stays";
    EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter("account", {}, nullptr, 1), 0);
}

TEST_F(MetaInfoTest, WhatMayBeReported) {
    EXPECT_EQ(__VeltoIDDBCopyMetaInformation("account", {}), std::nullopt)
        << "built-in values are not reported";
    for (const char* key :
         {"UserUUID", "CertificateRenewalInterval", "VeltoIDXMLAuthenticateCount", "ServerURL"})
        __VeltoIDDBSetMetaInfoValue(nullptr, key, "top");
    __VeltoIDDBSetMetaInfoValue("account", "AccountValidationInterval", number(9));
    const Dictionary options = {{"DefaultRelaunchInterval", number(3)}, {"Other", "x"}};
    EXPECT_EQ(__VeltoIDDBCopyMetaInformation("account", options),
              (Dictionary{{"UserUUID", "top"},
                          {"CertificateRenewalInterval", "top"},
                          {"AccountValidationInterval", number(9)},
                          {"DefaultRelaunchInterval", number(3)}}));
    EXPECT_EQ(__VeltoIDDBCopyMetaInformation(nullptr, {})->size(), 2U);
}

}  // namespace
}  // namespace veltoid
