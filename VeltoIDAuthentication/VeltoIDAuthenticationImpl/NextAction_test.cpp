// What the examination of an account finds, and what it changes on the way.
#include "VeltoIDAuthenticationImpl/NextAction.h"

#include "TestSupport/CertificateFixture.h"
#include "VeltoIDAuthenticationImpl/ServerRequests.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

using enum AccountState;

constexpr double kDay = 86'400;
const Value kOn = flag(true);
const Value kGone = Value::null();

class NextActionTest : public CertificateTest {
  protected:
    /// An account with a certificate of 100 days, just issued and not marked, known to a server of this
    /// version.
    void prepare(int32_t serverVersion = 100) {
        server_.answer("authenticate",
                       Dictionary{{"encDsId", "d1"}, {"Version", Value::int32(serverVersion)}});
        __VeltoIDDoVerifyPassword("somebody", kPassword, {});
        if (!__VeltoIDDBCopyVeltoIDAccount(kName, nullptr)) createAccount("d1");
        issueAtOnce();
        ASSERT_TRUE(request());
        setValues({{"Dirty", kGone}, {"ValidationDate", date()}, {"CertificateRequestDates", kGone}});
        set({{"Dirty", kGone}});
        (void)server_.take();
    }
    /// Sets values of the entry; Null removes.
    static void set(const Dictionary& values) {
        for (const auto& [key, value] : values) __VeltoIDDBSetCertificateValue("d1", key, value, Notify::No);
    }
    static AccountState check(const Dictionary& options = {{"CheckNetwork", flag(true)}}) {
        return checkAccountAndDetermineNextAction(kName, options);
    }
    static AccountState checkOffline() { return check({}); }
    static Data storedReference(const char* key) { return certificateEntry().data(key); }
};

TEST_F(NextActionTest, WithoutWhatASignInNeedsThereIsNothingToExamine) {
    std::optional<Error> error;
    EXPECT_EQ(checkAccountAndDetermineNextAction(nullptr, {}, &error), Unknown);
    EXPECT_EQ(error->code, -100);
    EXPECT_EQ(checkAccountAndDetermineNextAction("nobody", {}, &error), NoCertificate);
    setValue("encDsId", kGone);
    EXPECT_EQ(check(), NoEncodedDSID);
    setValues({{"encDsId", "d1"}, {"CertificateToken", "t"}});
    EXPECT_EQ(check(), CertificatePending);
    setValue("CertificateToken", kGone);
    EXPECT_EQ(checkOffline(), NoCertificate);
    EXPECT_EQ(server_.takeMethods(), "");
    EXPECT_EQ(check(), NoCertificate);
    EXPECT_EQ(server_.takeMethods(), "authenticate") << "nobody knows when it was last validated";
    server_.fault("authenticate", -20209);
    EXPECT_EQ(check(), PasswordInvalid);
    createAccount("d1");
    ASSERT_TRUE(removePasswordFromKeychainGivenPersistentRef(record().data("HashedPasswordRef")));
    EXPECT_EQ(check(), PasswordInaccessibleInKeychain);
    setValue("HashedPasswordRef", kGone);
    EXPECT_EQ(check(), PasswordInvalid);
}

TEST_F(NextActionTest, ACertificateIsJudgedByItsEntryAndItsDates) {
    struct Case {
        const char* what;
        Dictionary entry;
        AccountState offline;
        AccountState online;
        const char* methods;
    };
    constexpr const char* kValidated = "LastSuccessfulValidation";
    constexpr const char* kAttempt = "LastValidationAttempt";
    constexpr const char* kRenewal = "NextRenewalAttempt";
    constexpr const char* kAsked = "authenticate getMyInfo";
    const Case cases[] = {
        {"validated not long ago", {}, CertificateAssumedOK, CertificateAssumedOK, ""},
        {"marked", {{"Dirty", kOn}}, CertificateAssumedOK, CertificateOK, kAsked},
        {"never validated", {{kValidated, kGone}}, CertificateAssumedOK, CertificateOK, kAsked},
        {"validated in the future", {{kValidated, date(5)}}, CertificateAssumedOK, CertificateOK, kAsked},
        {"validated long ago", {{kValidated, date(-20 * kDay)}}, CertificateAssumedOK, CertificateOK, kAsked},
        {"tried 6 h ago",
         {{kValidated, date(-20 * kDay)}, {kAttempt, date(-21'600)}},
         CertificateAssumedOK,
         CertificateAssumedOK,
         ""},
        {"tried 13 h ago",
         {{kValidated, date(-20 * kDay)}, {kAttempt, date(-46'800)}},
         CertificateAssumedOK,
         CertificateOK,
         kAsked},
        {"expired", {{"Expires", date(-1)}}, CertificateExpired, CertificateExpired, ""},
        {"invalid",
         {{"CertStatus", "CERTIFICATE_INVALID"}, {"Expires", date(-1)}},
         CertificateRevoked,
         CertificateRevoked,
         ""},
        {"to be renewed", {{kRenewal, date(-1)}}, CertificateShouldBeRenewed, CertificateShouldBeRenewed, ""},
        {"to be renewed, evaluated",
         {{kRenewal, date(-1)}, {"Dirty", kOn}},
         CertificateShouldBeRenewed,
         CertificateShouldBeRenewed,
         kAsked},
        {"its last 36 hours",
         {{"Expires", date(129'000)}},
         CertificateShouldBeRenewed,
         CertificateShouldBeRenewed,
         ""},
        {"just before them", {{"Expires", date(130'000)}}, CertificateAssumedOK, CertificateAssumedOK, ""},
        {"no plan, no renewal",
         {{"Expires", date(100)}, {kRenewal, kGone}},
         CertificateAssumedOK,
         CertificateAssumedOK,
         ""},
        {"no number", {{"Dirty", kOn}, {"SerialNumber", kGone}}, CertificateAssumedOK, CertificateOK, ""},
    };
    prepare();
    const Dictionary fresh = certificateEntry();
    const auto restore = [&] {
        for (const auto& [key, value] : certificateEntry()) set({{key.view(), kGone}});
        set(fresh);
    };
    for (const Case& each : cases) {
        restore();
        set(each.entry);
        EXPECT_EQ(checkOffline(), each.offline) << each.what;
        EXPECT_EQ(server_.takeMethods(), "") << each.what;
        EXPECT_EQ(check(), each.online) << each.what;
        EXPECT_EQ(server_.takeMethods(), each.methods) << each.what;
        if (each.online == CertificateOK) {
            EXPECT_EQ(certificateEntry()["LastValidationAttempt"], date()) << each.what;
            EXPECT_EQ(certificateEntry()[kValidated], date()) << each.what;
        }
    }
    restore();
    EXPECT_EQ(check({{"CheckNetwork", kOn}, {"ForceValidation", kOn}}), CertificateOK);
    for (const auto& [interval, state] :
         {std::pair(Value::real(-200'000), CertificateShouldBeRenewed),
          std::pair(number(10), CertificateAssumedOK), std::pair(Value("x"), CertificateAssumedOK)}) {
        restore();
        set({{"Expires", date(129'500)}});
        EXPECT_EQ(check({{"PreExpirationInterval", interval}}), state) << testing::PrintToString(interval);
    }
}

TEST_F(NextActionTest, ACertificateIsEvaluatedUnderTheAuthority) {
    prepare();
    const auto evaluated = [this] {
        set({{"Dirty", kOn}, {"LastSuccessfulValidation", date(-5)}, {"LastValidationAttempt", kGone}});
        const AccountState state = check();
        EXPECT_EQ(certificateEntry()["LastSuccessfulValidation"] == date(),
                  state == CertificateOK || state == CertificateAssumedOK);
        EXPECT_EQ(certificateEntry().contains("LastValidationAttempt"), state != Unknown);
        return state;
    };
    EXPECT_EQ(evaluated(), CertificateOK);
    set({{"IntermediateCertificateReference", kGone}});
    EXPECT_EQ(evaluated(), CertificateRevoked) << "no path to the authority";
    trust(intermediate_);
    EXPECT_EQ(evaluated(), CertificateOK);
    trust(testing_support::TestAuthority("Intermediate"));
    EXPECT_EQ(evaluated(), CertificateRevoked);
    std::filesystem::remove_all(directory_.base() / "harbwell" / "identity-authority.pem");
    EXPECT_EQ(evaluated(), Unknown) << "nobody to ask";
    trust(root_);

    server_.answer("getMyInfo", Dictionary{{"encDsId", "d1"}, {"CertificateIsValid", flag(false)}});
    set({{"Dirty", kOn}});
    EXPECT_EQ(check(), CertificateRevoked) << "the server's word counts at once";
    EXPECT_EQ(certificateEntry()["CertStatus"], Value("CERTIFICATE_INVALID"));
}

TEST_F(NextActionTest, WhatCannotBeReadFromTheKeychainIsMissing) {
    struct Case {
        const char* key;
        Value reference;
        const char* line;
    };
    const Value unknown = Data(std::vector<uint8_t>{1});
    const Case cases[] = {
        {"CertificateReference", kGone,
         "get certificate from keychain for veltoID jane@velto.example because certRef=NULL"},
        {"CertificateReference", unknown,
         "get certificate from keychain from persistent reference for veltoID jane@velto.example certRef=$"},
        {"CertificatePrivateKeyReference", kGone,
         "get private key from keychain from persistent reference for veltoID jane@velto.example "
         "privateKeyRef=NULL"},
        {"CertificatePrivateKeyReference", unknown,
         "get private key from keychain from persistent reference for veltoID jane@velto.example certRef=$"},
    };
    prepare();
    for (const Case& each : cases) {
        const Value before = storedReference(each.key);
        set({{each.key, each.reference}});
        EXPECT_EQ(check(), NoCertificate) << each.line;
        EXPECT_EQ(log_.count(each.line), 1) << each.line;
        set({{each.key, before}});
    }
    EXPECT_EQ(check(), CertificateAssumedOK);
}

TEST_F(NextActionTest, TheAccountIsValidatedWhenItIsDue) {
    struct Case {
        const char* what;
        Dictionary values;
        const char* methods;
        /// What is left of the marks.
        Value forced;
        Value next;
    };
    constexpr const char* kValidated = "authenticate authenticate getMyInfo";
    constexpr const char* kDate = "ValidationDate";
    constexpr const char* kNext = "NextValidationDate";
    const Value soon = date(3'600);
    const Case cases[] = {
        {"not due", {}, "", {}, {}},
        {"forced", {{"ForceValidation", kOn}}, kValidated, {}, {}},
        {"planned", {{kNext, date()}}, kValidated, {}, {}},
        {"planned for later", {{kNext, date(5)}}, "", {}, date(5)},
        {"14 days old", {{kDate, date(-14 * kDay)}}, "", {}, {}},
        {"older", {{kDate, date(-14 * kDay - 1)}}, kValidated, {}, {}},
        {"older, tried already", {{kDate, date(-15 * kDay)}, {kNext, soon}}, "authenticate", {}, soon},
        {"unknown", {{kDate, kGone}}, "authenticate", {}, {}},
        {"embargo", {{"ForceValidation", kOn}, {"EarliestAllowedConnectionDate", date(9)}}, "", {}, {}},
    };
    prepare();
    for (const Case& each : cases) {
        setValues({{kDate, date()}, {kNext, kGone}, {"EarliestAllowedConnectionDate", kGone}});
        setValues(each.values);
        EXPECT_EQ(check(), CertificateAssumedOK) << each.what;
        EXPECT_EQ(server_.takeMethods(), each.methods) << each.what;
        EXPECT_EQ(record()["ForceValidation"], each.forced) << each.what;
        EXPECT_EQ(record()[kNext], each.next) << each.what;
    }
    setValues({{kDate, date(-15 * kDay)}, {kNext, kGone}, {"EarliestAllowedConnectionDate", kGone}});
    server_.refuse("authenticate", 503);
    EXPECT_EQ(check(), CertificateAssumedOK);
    EXPECT_EQ(record()[kNext], soon) << "a server that cannot be reached is tried again in an hour";
}

TEST_F(NextActionTest, ADueValidationRecordIsTheLastThingToLookFor) {
    struct Case {
        const char* what;
        Dictionary values;
        bool isDue;
    };
    constexpr const char* kNextCheck = "VeltoIDAccountValidationRecordNextCheckDateKey";
    constexpr const char* kData = "VeltoIDAccountValidationRecordData";
    constexpr const char* kAsOf = "VeltoIDAccountValidationRecordValidAsOfKey";
    constexpr const char* kDuration = "VeltoIDAccountValidationRecordSuggestedValidIntervalKey";
    const Value data = Data(std::vector<uint8_t>{1});
    const Case cases[] = {
        {"no record", {}, true},
        {"a date to come", {{kNextCheck, date(1)}}, false},
        {"a date that has come", {{kNextCheck, date()}, {kData, data}, {kAsOf, date()}}, true},
        {"valid", {{kData, data}, {kAsOf, date()}}, false},
        {"no data", {{kData, Data(std::vector<uint8_t>{})}, {kAsOf, date()}}, true},
        {"from tomorrow", {{kData, data}, {kAsOf, date(kDay)}}, false},
        {"from later", {{kData, data}, {kAsOf, date(kDay + 1)}}, true},
        {"three quarters of a month", {{kData, data}, {kAsOf, date(-22.5 * kDay)}}, false},
        {"more", {{kData, data}, {kAsOf, date(-22.5 * kDay - 1)}}, true},
        {"of its own time", {{kData, data}, {kAsOf, date(-76)}, {kDuration, number(100)}}, true},
    };
    for (const int32_t version : {100, 101}) {
        prepare(version);
        for (const Case& each : cases) {
            for (const char* key : {kNextCheck, kData, kAsOf, kDuration}) setValue(key, kGone);
            setValues(each.values);
            const bool isDue = version > 100 && each.isDue;
            EXPECT_EQ(check(), isDue ? ValidationRecordNeedsToBeUpdated : CertificateAssumedOK)
                << each.what << version;
        }
    }
}

}  // namespace
}  // namespace veltoid
