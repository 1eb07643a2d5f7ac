// What the examination of an account finds, and what it changes on the way.
#include "VeltoIDAuthenticationImpl/NextAction.h"

#include "TestSupport/CertificateFixture.h"
#include "VeltoIDAuthenticationImpl/ServerRequests.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

using enum AccountState;

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
        setInEntry({{"Dirty", kGone}});
        (void)server_.take();
    }
    static AccountState check(const Dictionary& options = {{"CheckNetwork", kOn}}) {
        return checkAccountAndDetermineNextAction(kName, options);
    }
    static AccountState checkOffline() { return check({}); }
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
    EXPECT_EQ(server_.takeMethods(), "") << "the request that follows signs in";
    setValue("CSRGenerationDate", date());
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
    constexpr const char* kAsked = "authenticate getMyInfo";
    // What is found, and, where that is another, what is found with the server's help.
    using Found = std::pair<AccountState, AccountState>;
    constexpr Found kGood = {CertificateAssumedOK, CertificateAssumedOK};
    constexpr Found kEvaluated = {CertificateAssumedOK, CertificateOK};
    constexpr Found kToBeRenewed = {CertificateShouldBeRenewed, CertificateShouldBeRenewed};
    constexpr Found kExpired = {CertificateExpired, CertificateExpired};
    constexpr Found kRevoked = {CertificateRevoked, CertificateRevoked};
    const Value longAgo = date(-20 * kDay);
    const Value past = date(-1);
    const std::tuple<const char*, Dictionary, Found, const char*> cases[] = {
        {"validated not long ago", {}, kGood, ""},
        {"marked", {{"Dirty", kOn}, {kValidated, date(-100)}}, kEvaluated, kAsked},
        {"marked, just issued", {{"Dirty", kOn}, {kValidated, date(-1)}}, kEvaluated, ""},
        {"never validated", {{kValidated, kGone}}, kEvaluated, kAsked},
        {"validated in the future", {{kValidated, date(5)}}, kEvaluated, kAsked},
        {"validated long ago", {{kValidated, longAgo}}, kEvaluated, kAsked},
        {"tried 6 h ago", {{kValidated, longAgo}, {kAttempt, date(-21'600)}}, kGood, ""},
        {"tried 13 h ago", {{kValidated, longAgo}, {kAttempt, date(-46'800)}}, kEvaluated, kAsked},
        {"expired", {{"Expires", past}}, kExpired, ""},
        {"invalid", {{"CertStatus", "CERTIFICATE_INVALID"}, {"Expires", past}}, kRevoked, ""},
        {"to be renewed", {{kRenewal, past}}, kToBeRenewed, ""},
        {"to be renewed, evaluated",
         {{kRenewal, past}, {"Dirty", kOn}, {kValidated, date(-100)}},
         kToBeRenewed,
         kAsked},
        {"its last 36 hours", {{"Expires", date(129'000)}}, kToBeRenewed, ""},
        {"just before them", {{"Expires", date(130'000)}}, kGood, ""},
        {"no plan, no renewal", {{"Expires", date(100)}, {kRenewal, kGone}}, kGood, ""},
        {"no number", {{"Dirty", kOn}, {"SerialNumber", kGone}}, kEvaluated, ""},
    };
    prepare();
    const Dictionary fresh = certificateEntry();
    const auto restore = [&] {
        for (const auto& [key, value] : certificateEntry()) setInEntry({{key.view(), kGone}});
        setInEntry(fresh);
    };
    for (const auto& [what, entry, found, methods] : cases) {
        SCOPED_TRACE(what);
        restore();
        setInEntry(entry);
        EXPECT_EQ(checkOffline(), found.first);
        EXPECT_EQ(server_.takeMethods(), "");
        EXPECT_EQ(check(), found.second);
        EXPECT_EQ(server_.takeMethods(), methods);
        if (found.second != CertificateOK) continue;
        for (const char* key : {kAttempt, kValidated}) EXPECT_EQ(certificateEntry()[key], date()) << key;
    }
    restore();
    EXPECT_EQ(check({{"CheckNetwork", kOn}, {"ForceValidation", kOn}}), CertificateOK);
    for (const auto& [interval, state] :
         {std::pair(Value::real(-200'000), CertificateShouldBeRenewed),
          std::pair(number(10), CertificateAssumedOK), std::pair(Value("x"), CertificateAssumedOK)}) {
        restore();
        setInEntry({{"Expires", date(129'500)}});
        EXPECT_EQ(check({{"PreExpirationInterval", interval}}), state) << testing::PrintToString(interval);
    }
}

TEST_F(NextActionTest, ACertificateIsEvaluatedUnderTheAuthority) {
    prepare();
    const auto evaluated = [this] {
        setInEntry({{"Dirty", kOn}, {kValidated, date(-5)}, {kAttempt, kGone}});
        const AccountState state = check();
        EXPECT_EQ(certificateEntry()[kValidated] == date(),
                  state == CertificateOK || state == CertificateAssumedOK);
        EXPECT_EQ(certificateEntry().contains(kAttempt), state != Unknown);
        return state;
    };
    EXPECT_EQ(evaluated(), CertificateOK);
    setInEntry({{"IntermediateCertificateReference", kGone}});
    EXPECT_EQ(evaluated(), CertificateRevoked) << "no path to the authority";
    trust(intermediate_);
    EXPECT_EQ(evaluated(), CertificateOK);
    trust(testing_support::TestAuthority("Intermediate"));
    EXPECT_EQ(evaluated(), CertificateRevoked);
    std::filesystem::remove_all(directory_.base() / "harbwell" / "identity-authority.pem");
    EXPECT_EQ(evaluated(), Unknown) << "nobody to ask";
    trust(root_);

    server_.answer("getMyInfo", Dictionary{{"encDsId", "d1"}, {"CertificateIsValid", kOff}});
    setInEntry({{"Dirty", kOn}, {kValidated, date(-100)}});
    EXPECT_EQ(check(), CertificateRevoked) << "the server's word counts at once";
    EXPECT_EQ(certificateEntry()["CertStatus"], Value("CERTIFICATE_INVALID"));
}

TEST_F(NextActionTest, WhatCannotBeReadFromTheKeychainIsMissing) {
    const Value unknown = Data(std::vector<uint8_t>{1});
    const std::string name = kName;
    const std::string byReference = " from keychain from persistent reference for veltoID " + name;
    const std::tuple<const char*, Value, std::string> cases[] = {
        {kCertificateReference, kGone,
         "get certificate from keychain for veltoID " + name + " because certRef=NULL"},
        {kCertificateReference, unknown, "get certificate" + byReference + " certRef=$"},
        {kKeyReference, kGone, "get private key" + byReference + " privateKeyRef=NULL"},
        {kKeyReference, unknown, "get private key" + byReference + " certRef=$"},
    };
    prepare();
    for (const auto& [key, reference, line] : cases) {
        const Value before = certificateEntry()[key];
        setInEntry({{key, reference}});
        EXPECT_EQ(check(), NoCertificate) << line;
        EXPECT_EQ(log_.count(line), 1) << line;
        setInEntry({{key, before}});
    }
    EXPECT_EQ(check(), CertificateAssumedOK);
}

TEST_F(NextActionTest, TheAccountIsValidatedWhenItIsDue) {
    constexpr const char* kAsked = "authenticate authenticate getMyInfo";
    constexpr const char* kDate = "ValidationDate";
    constexpr const char* kNext = "NextValidationDate";
    const Value soon = date(3'600);
    const struct {
        const char* what;
        Dictionary values;
        const char* methods;
        /// What is left of the marks.
        Value forced, next;
    } cases[] = {
        {"not due", {}, "", {}, {}},
        {"forced", {{"ForceValidation", kOn}}, kAsked, {}, {}},
        {"planned", {{kNext, date()}}, kAsked, {}, {}},
        {"planned for later", {{kNext, date(5)}}, "", {}, date(5)},
        {"14 days old", {{kDate, date(-14 * kDay)}}, "", {}, {}},
        {"older", {{kDate, date(-14 * kDay - 1)}}, kAsked, {}, {}},
        {"older, tried already", {{kDate, date(-15 * kDay)}, {kNext, soon}}, "authenticate", {}, soon},
        {"unknown", {{kDate, kGone}}, "authenticate", {}, {}},
        {"embargo", {{"ForceValidation", kOn}, {kEmbargo, date(9)}}, "", kOn, {}},
    };
    prepare();
    for (const auto& [what, values, methods, forced, next] : cases) {
        SCOPED_TRACE(what);
        setValues({{kDate, date()}, {kNext, kGone}, {kEmbargo, kGone}, {"ForceValidation", kGone}});
        setValues(values);
        EXPECT_EQ(check(), CertificateAssumedOK);
        EXPECT_EQ(server_.takeMethods(), methods);
        EXPECT_EQ(record()["ForceValidation"], forced);
        EXPECT_EQ(record()[kNext], next);
    }
    setValues({{kDate, date(-15 * kDay)}, {kNext, kGone}, {kEmbargo, kGone}, {"ForceValidation", kGone}});
    server_.refuse("authenticate", 503);
    EXPECT_EQ(check(), CertificateAssumedOK);
    EXPECT_EQ(record()[kNext], soon) << "a server that cannot be reached is tried again in an hour";
}

TEST_F(NextActionTest, ADueValidationRecordIsTheLastThingToLookFor) {
    const Value data = Data(std::vector<uint8_t>{1});
    const std::tuple<const char*, Dictionary, bool> cases[] = {
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
        for (const auto& [what, values, isDue] : cases) {
            SCOPED_TRACE(what + std::to_string(version));
            for (const char* key : {kNextCheck, kData, kAsOf, kDuration}) setValue(key, kGone);
            setValues(values);
            EXPECT_EQ(check(),
                      version > 100 && isDue ? ValidationRecordNeedsToBeUpdated : CertificateAssumedOK);
        }
    }
}

}  // namespace
}  // namespace veltoid
