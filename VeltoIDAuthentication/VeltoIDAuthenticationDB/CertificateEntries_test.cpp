#include "VeltoIDAuthenticationDB/CertificateEntries.h"

#include "TestSupport/DatabaseFixture.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {
namespace {

class CertificatesTest : public DatabaseTest {
  protected:
    static Dictionary entry(const char* encDsId = "d") {
        CertificateEntry entry;
        EXPECT_TRUE(__VeltoIDDBCopyCertificateInfo(encDsId, &entry));
        return entry.values();
    }
};

const Data kReference(std::vector<uint8_t>{1, 2, 3});

TEST_F(CertificatesTest, AnEntryTakesWhatTheResultHolds) {
    const Dictionary result = {{kCertificateReference, kReference},
                               {"Expires", Value::date(5)},
                               {"CertStatus", "CERT_ISSUED"},
                               {"SerialNumber", "7"},
                               {"CertType", "not taken over"}};
    EXPECT_EQ(effectsOf([&] { EXPECT_TRUE(__VeltoIDDBSetCertificateInfo("d", result)); }),
              "written, signalled");
    const Value created = operationDate();
    Dictionary expected = result;
    expected.remove("CertType");
    for (const auto& [key, value] : {std::pair("encDsId", Value("d")),
                                     {"CreationDate", created},
                                     {"Dirty", kOn},
                                     {"ModificationDate", created}})
        expected.set(key, value);
    EXPECT_EQ(entry(), expected);
    ASSERT_TRUE(__VeltoIDDBSetCertificateValue("d", "CertType", "stays", Notify::No));
    EXPECT_TRUE(__VeltoIDDBSetCertificateInfo(
        "d", Dictionary{
                 {kCertificateReference, "no data"}, {"Expires", "any kind"}, {"SerialNumber", number(7)}}));
    EXPECT_EQ(entry(), (Dictionary{{"CreationDate", created},
                                   {"encDsId", "d"},
                                   {kCertificateReference, kReference},
                                   {"Expires", "any kind"},
                                   {"CertType", "stays"},
                                   {"Dirty", kOn},
                                   {"ModificationDate", date()}}));
    EXPECT_TRUE(__VeltoIDDBSetCertificateInfo("d", std::nullopt));
    EXPECT_EQ(entry(), (Dictionary{{"Dirty", kOn}, {"ModificationDate", date()}}));
    EXPECT_FALSE(__VeltoIDDBSetCertificateInfo(nullptr, std::nullopt));
}

TEST_F(CertificatesTest, SettingAValue) {
    using enum Notify;
    constexpr const char* kAll = "written, signalled";
    const std::tuple<const char*, const char*, Value, Notify, std::string, Value> cases[] = {
        {"a new value", "k", "b", Yes, kAll, kOn},
        {"quietly", "k", "b", No, "written", {}},
        {"an equal one", "k", "a", Yes, "", {}},
        {"none", "k", {}, Yes, kAll, kOn},
        {"Null", "k", kGone, Yes, kAll, kOn},
        {"none for nothing", "x", {}, Yes, "", {}},
        {"the mark", "Dirty", kOff, Yes, "written", kOff},
        {"the modification date", "ModificationDate", Value::date(1), Yes, "written", kOn},
    };
    for (const auto& [what, key, value, notify, effects, dirty] : cases) {
        SCOPED_TRACE(what);
        ASSERT_TRUE(__VeltoIDDBSetCertificateInfo("d", std::nullopt));
        ASSERT_TRUE(__VeltoIDDBSetCertificateValue("d", "k", "a", Notify::No));
        ASSERT_TRUE(__VeltoIDDBSetCertificateValue("d", "Dirty", {}, Notify::No));
        const Value modified = entry()["ModificationDate"];
        clock_.advanceBy(10);
        EXPECT_EQ(effectsOf([&, key = key, &value = value, notify = notify] {
                      EXPECT_TRUE(__VeltoIDDBSetCertificateValue("d", key, value, notify));
                  }),
                  effects);
        EXPECT_EQ(entry()["Dirty"], dirty);
        EXPECT_EQ(entry()["ModificationDate"], effects.empty() ? modified : operationDate());
    }
    EXPECT_TRUE(__VeltoIDDBSetCertificateValue("d", "k", kGone, Notify::No));
    EXPECT_FALSE(entry().contains("k"));
    EXPECT_FALSE(__VeltoIDDBSetCertificateValue("e", "k", "a", Notify::Yes));
    EXPECT_FALSE(__VeltoIDDBSetCertificateValue(nullptr, "k", "a", Notify::Yes));
    EXPECT_FALSE(__VeltoIDDBSetCertificateValue("d", nullptr, "a", Notify::Yes));
}

TEST_F(CertificatesTest, KeysAndRemoval) {
    for (const char* key : {"d", "e"}) EXPECT_TRUE(__VeltoIDDBSetCertificateInfo(key, std::nullopt));
    Array keys;
    EXPECT_TRUE(__VeltoIDDBCopyCertificateKeys(&keys));
    EXPECT_EQ(keys, (Array{"d", "e"}));
    EXPECT_EQ(effectsOf([] { EXPECT_TRUE(__VeltoIDDBRemoveCertificateInfo("d")); }), "written, signalled");
    EXPECT_EQ(effectsOf([] { EXPECT_FALSE(__VeltoIDDBRemoveCertificateInfo("d")); }), "");
    EXPECT_FALSE(__VeltoIDDBRemoveCertificateInfo(nullptr));
    EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d", nullptr));
    EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo(nullptr, nullptr));
    EXPECT_TRUE(__VeltoIDDBCopyCertificateInfo("e", nullptr));
}

TEST_F(CertificatesTest, ValidUntilADayAfterItHasExpired) {
    constexpr double kHour = 3600;
    const std::tuple<const char*, Value, Value, bool> cases[] = {
        {"no expiry", "CERT_ISSUED", {}, true},
        {"an expiry that is no date", "CERT_ISSUED", "yesterday", true},
        {"in time", "CERT_ISSUED", date(kHour), true},
        {"12 hours late", "CERT_ISSUED", date(-12 * kHour), true},
        {"just within the day", "CERT_ISSUED", date(-24 * kHour + 1), true},
        {"a day late", "CERT_ISSUED", date(-24 * kHour), false},
        {"25 hours late", "CERT_ISSUED", date(-25 * kHour), false},
        {"another status", "CERTIFICATE_INVALID", date(kHour), false},
        {"no status", {}, date(kHour), false},
        {"a status that is no text", number(1), date(kHour), false},
    };
    for (const auto& [what, status, expires, isValid] : cases) {
        ASSERT_TRUE(
            __VeltoIDDBSetCertificateInfo("d", Dictionary{{"CertStatus", status}, {"Expires", expires}}));
        EXPECT_EQ(hasValidCertificateEntry("d"), isValid) << what;
    }
    EXPECT_FALSE(hasValidCertificateEntry("nobody"));
    EXPECT_FALSE(hasValidCertificateEntry(nullptr));
}

}  // namespace
}  // namespace veltoid
