#include "VeltoIDAuthenticationDB/MetaInfo.h"

#include <limits>

#include "TestSupport/DatabaseFixture.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {
namespace {

class MetaInfoTest : public DatabaseTest {};

constexpr auto kString = Value::Kind::String;
constexpr auto kNumber = Value::Kind::Number;
const Value kDefaultURL = "https://identity.velto.example/dsservices/dsxmlrpc";

TEST_F(MetaInfoTest, TheNearestValueOfTheRightKindIsFound) {
    const Value one = number(1);
    const struct {
        const char* what;
        const char* key;
        /// What the options, the account's section and the top level hold.
        Value option, own, top;
        std::optional<Value::Kind> kind;
        Value found;
    } cases[] = {
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
    for (const auto& [what, key, option, own, top, kind, found] : cases) {
        __VeltoIDDBSetMetaInfoValue("account", key, own);
        __VeltoIDDBSetMetaInfoValue(nullptr, key, top);
        EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue("account", {{key, option}}, key, kind), found) << what;
    }
    __VeltoIDDBSetMetaInfoValue("account", "k", "own");
    __VeltoIDDBSetMetaInfoValue(nullptr, "k", "top");
    // The last is a section that is no dictionary.
    for (const String& section : {String(), String("somebody else"), String("k")})
        EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue(section, {}, "k"), Value("top")) << section.view();
    EXPECT_TRUE(__VeltoIDDBCopyMetaInfoValue("account", {}, nullptr).isAbsent());
}

TEST_F(MetaInfoTest, SettingWritesChangesAndNeverSignals) {
    // One after the other.
    const struct {
        const char* what;
        String where;
        Value value;
        const char* effects;
        Value top, own;
    } cases[] = {
        {"nothing to remove", nullptr, {}, "", {}, {}},  {"a value", nullptr, "t", "written", "t", {}},
        {"the same", nullptr, "t", "", "t", {}},         {"in a section", "s", "own", "written", "t", "own"},
        {"the same there", "s", "own", "", "t", "own"},  {"none removes", nullptr, {}, "written", {}, "own"},
        {"Null removes", "s", kGone, "written", {}, {}}, {"nothing left there", "s", kGone, "", {}, {}},
    };
    for (const auto& [what, where, value, effects, top, own] : cases) {
        SCOPED_TRACE(what);
        const auto set = [&where = where, &value = value] {
            EXPECT_TRUE(__VeltoIDDBSetMetaInfoValue(where, "k", value));
        };
        EXPECT_EQ(effectsOf(set), effects);
        const Dictionary all = database::perform([](const database::Store& store) { return store.metaInfo; });
        EXPECT_EQ(all["k"], top);
        const Dictionary* section = all.dictionary("s");
        EXPECT_EQ(section != nullptr ? (*section)["k"] : Value(), own);
    }
    EXPECT_FALSE(__VeltoIDDBSetMetaInfoValue("s", nullptr, "v"));
}

TEST_F(MetaInfoTest, CountersCount) {
    constexpr int64_t kMost = std::numeric_limits<int64_t>::max();
    const std::tuple<const char*, Value, int64_t, int64_t> cases[] = {
        {"absent", {}, 5, 5},
        {"counted before", number(5), 2, 7},
        {"downwards", number(5), -6, -1},
        {"a text", "12", 1, 1},
        {"a whole double", Value::real(4), 1, 5},
        {"a fraction", Value::real(4.5), 1, 1},
        {"beyond the range", number(kMost), 1, std::numeric_limits<int64_t>::min()},
    };
    for (const auto& [what, before, delta, sum] : cases) {
        SCOPED_TRACE(what);
        __VeltoIDDBSetMetaInfoValue(nullptr, "c", before);
        EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter(nullptr, {}, "c", delta), sum);
        const Value stored = __VeltoIDDBCopyMetaInfoValue(nullptr, {}, "c");
        EXPECT_EQ(stored, number(sum));
        EXPECT_EQ(stored.numberKind(), NumberKind::Int64);
    }
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("account", nullptr, nullptr));
    __VeltoIDDBSetMetaInfoValue(nullptr, "c", number(100));
    for (const int sum : {101, 102})
        EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter("account", {}, "c", 1), sum)
            << "from where it is found";
    EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter("account", {{"c", number(1)}}, "c", 1), 2);
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue(nullptr, {}, "c"), number(100)) << "the device's own stays";
    EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter("account", {}, nullptr, 1), 0);
    EXPECT_EQ(__VeltoIDDBIncrementMetaInfoCounter("nobody", {}, "c", 1), 101);
    EXPECT_EQ(__VeltoIDDBCopyMetaInfoValue("nobody", {}, "c"), number(100))
        << "names without account leave nothing";
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
