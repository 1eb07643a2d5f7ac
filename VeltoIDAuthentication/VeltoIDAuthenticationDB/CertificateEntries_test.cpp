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
    const double created = now();
    EXPECT_EQ(
        effectsOf([&] {
            EXPECT_TRUE(__VeltoIDDBSetCertificateInfo("d", Dictionary{{"CertificateReference", kReference},
                                                                      {"Expires", Value::date(5)},
                                                                      {"CertStatus", "CERT_ISSUED"},
                                                                      {"SerialNumber", "7"},
                                                                      {"CertType", "not taken over"}}));
        }),
        "written, signalled");
    EXPECT_EQ(entry(), (Dictionary{{"CreationDate", Value::date(created + kVeltoIDDBFlushDelay)},
                                   {"encDsId", "d"},
                                   {"CertificateReference", kReference},
                                   {"Expires", Value::date(5)},
                                   {"CertStatus", "CERT_ISSUED"},
                                   {"SerialNumber", "7"},
                                   {"Dirty", flag(true)},
                                   {"ModificationDate", Value::date(created + kVeltoIDDBFlushDelay)}}));
    ASSERT_TRUE(__VeltoIDDBSetCertificateValue("d", "CertType", "stays", Notify::No));
    const double updated = now();
    EXPECT_TRUE(__VeltoIDDBSetCertificateInfo(
        "d", Dictionary{
                 {"CertificateReference", "no data"}, {"Expires", "any kind"}, {"SerialNumber", number(7)}}));
    EXPECT_EQ(entry(), (Dictionary{{"CreationDate", Value::date(created + kVeltoIDDBFlushDelay)},
                                   {"encDsId", "d"},
                                   {"CertificateReference", kReference},
                                   {"Expires", "any kind"},
                                   {"CertType", "stays"},
                                   {"Dirty", flag(true)},
                                   {"ModificationDate", Value::date(updated)}}));
    EXPECT_TRUE(__VeltoIDDBSetCertificateInfo("d", std::nullopt));
    EXPECT_EQ(entry(), (Dictionary{{"Dirty", flag(true)}, {"ModificationDate", Value::date(updated)}}));
    EXPECT_FALSE(__VeltoIDDBSetCertificateInfo(nullptr, std::nullopt));
}

TEST_F(CertificatesTest, SettingAValue) {
    struct Case {
        const char* what;
        const char* key;
        Value value;
        bool signal;
        const char* effects;
        Value dirty;
    };
    const Case cases[] = {
        {"a new value", "k", "b", true, "written, signalled", flag(true)},
        {"quietly", "k", "b", false, "written", {}},
        {"an equal one", "k", "a", true, "", {}},
        {"none", "k", {}, true, "written, signalled", flag(true)},
        {"Null", "k", Value::null(), true, "written, signalled", flag(true)},
        {"none for nothing", "x", {}, true, "", {}},
        {"the mark", "Dirty", flag(false), true, "written", flag(false)},
        {"the modification date", "ModificationDate", Value::date(1), true, "written", flag(true)},
    };
    for (const Case& each : cases) {
        ASSERT_TRUE(__VeltoIDDBSetCertificateInfo("d", std::nullopt));
        ASSERT_TRUE(__VeltoIDDBSetCertificateValue("d", "k", "a", Notify::No));
        ASSERT_TRUE(__VeltoIDDBSetCertificateValue("d", "Dirty", {}, Notify::No));
        const Value modified = entry()["ModificationDate"];
        double changedAt = 0;
        clock_.advanceBy(10);
        EXPECT_EQ(effectsOf([&] {
                      changedAt = now();
                      EXPECT_TRUE(__VeltoIDDBSetCertificateValue("d", each.key, each.value,
                                                                 each.signal ? Notify::Yes : Notify::No));
                  }),
                  each.effects)
            << each.what;
        EXPECT_EQ(entry()["Dirty"], each.dirty) << each.what;
        EXPECT_EQ(entry()["ModificationDate"],
                  std::string_view(each.effects).empty() ? modified : Value::date(changedAt))
            << each.what;
    }
    EXPECT_TRUE(__VeltoIDDBSetCertificateValue("d", "k", Value::null(), Notify::No));
    EXPECT_FALSE(entry().contains("k"));
    EXPECT_FALSE(__VeltoIDDBSetCertificateValue("e", "k", "a", Notify::Yes));
    EXPECT_FALSE(__VeltoIDDBSetCertificateValue(nullptr, "k", "a", Notify::Yes));
    EXPECT_FALSE(__VeltoIDDBSetCertificateValue("d", nullptr, "a", Notify::Yes));
}

TEST_F(CertificatesTest, KeysAndRemoval) {
    EXPECT_TRUE(__VeltoIDDBSetCertificateInfo("d", std::nullopt));
    EXPECT_TRUE(__VeltoIDDBSetCertificateInfo("e", std::nullopt));
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
    struct Case {
        const char* what;
        Value status;
        Value expires;
        bool isValid;
    };
    const Case cases[] = {
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
    for (const Case& each : cases) {
        ASSERT_TRUE(__VeltoIDDBSetCertificateInfo(
            "d", Dictionary{{"CertStatus", each.status}, {"Expires", each.expires}}));
        EXPECT_EQ(hasValidCertificateEntry("d"), each.isValid) << each.what;
    }
    EXPECT_FALSE(hasValidCertificateEntry("nobody"));
    EXPECT_FALSE(hasValidCertificateEntry(nullptr));
}

}  // namespace
}  // namespace veltoid
