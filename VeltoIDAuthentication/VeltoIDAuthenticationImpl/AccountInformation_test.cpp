#include "VeltoIDAuthenticationImpl/AccountInformation.h"

#include "TestSupport/EngineFixture.h"
#include "TestSupport/TestAuthority.h"

namespace veltoid {
namespace {

class Information : public EngineTest {
  protected:
    /// A complete record, validated `age` seconds ago.
    void prepare(double age) {
        createAccount("d1");
        const Dictionary values = {{"ValidatedEmail", kEmails},
                                   {"ValidationDate", date(-age)},
                                   {"ForceValidation", Value::null()},
                                   {"NextValidationDate", Value::null()},
                                   {"Dirty", Value::null()}};
        setValues(values);
    }

    bool get(const Dictionary& options, const String& name = kName) {
        info_ = Dictionary();
        error_.reset();
        return __VeltoIDDoGetMyInfo(name, options, &info_, &error_);
    }

    Dictionary info_;
    std::optional<Error> error_;
};

TEST_F(Information, IsFreshForSomeTime) {
    struct Case {
        const char* what;
        double age;
        Value own;
        Value presumed;
        bool isFresh;
    };
    const Case cases[] = {
        {"now", 0, {}, {}, true},
        {"two hours", 7200, {}, {}, true},
        {"eight hours", 28'800, {}, {}, true},
        {"more", 28'801, {}, {}, false},
        {"from the future", -1, {}, {}, false},
        {"its own interval", 100, number(100), {}, true},
        {"its own interval is over", 101, number(100), {}, false},
        {"its own is too short", 60, number(30), {}, true},
        {"and still too short", 61, number(30), {}, false},
        {"its own is negative", 60, number(-5), {}, true},
        {"its own is too long", 28'801, number(1'000'000), {}, false},
        {"its own is no number", 28'800, "5", {}, true},
        {"presumed by the server", 100, {}, number(100), true},
        {"presumed, over", 101, {}, number(100), false},
        {"presumed caps its own", 31, number(50), number(30), false},
        {"presumed is no number", 28'800, {}, "5", true},
    };
    for (const Case& each : cases) {
        prepare(each.age);
        setValue("ValidForInterval", each.own);
        __VeltoIDDBSetMetaInfoValue(nullptr, "AccountPresumedValidInterval", each.presumed);
        EXPECT_EQ(get({{"SkipValidation", kOn}}), each.isFresh) << each.what;
    }
    prepare(0);
    setValue("ValidationDate", "today");
    EXPECT_FALSE(get({{"SkipValidation", kOn}}));
    EXPECT_EQ(error_->code, -100);
}

TEST_F(Information, IsAskedForWhenItMustBe) {
    enum class State { Fresh, Stale, Incomplete };
    using enum State;
    struct Case {
        const char* what;
        State state;
        Dictionary options;
        Server server;
        bool answers;
        const char* methods;
        bool marks;
    };
    constexpr const char* kRecord = "ForceValidationRecordFetch";
    constexpr const char* kSerial = "ValidateCertificateSerialNumber";
    constexpr const char* kForce = "ForceValidation";
    constexpr const char* kSkip = "SkipValidation";
    constexpr const char* kDefer = "DeferValidation";
    constexpr const char* kAsked = "authenticate getMyInfo";
    constexpr const char* kTried = "authenticate";
    const Dictionary skipBeforeAll = {
        {kSkip, kOn}, {kDefer, kOn}, {kRecord, kOn}, {kSerial, kOn}, {kForce, kOn}};
    const Case cases[] = {
        {"fresh", Fresh, {}, Server::Up, true, "", false},
        {"forced", Fresh, {{kForce, kOn}}, Server::Up, true, kAsked, false},
        {"record", Fresh, {{kRecord, kOn}}, Server::Up, true, kAsked, false},
        {"serial", Fresh, {{kSerial, kOn}}, Server::Up, true, kAsked, false},
        {"no Boolean", Fresh, {{kForce, number(1)}}, Server::Up, true, "", false},
        {"stale", Stale, {}, Server::Up, true, kAsked, false},
        {"incomplete", Incomplete, {}, Server::Up, true, kAsked, false},
        {"skip, fresh", Fresh, {{kSkip, kOn}}, Server::Up, true, "", false},
        {"skip, stale", Stale, {{kSkip, kOn}}, Server::Up, false, "", false},
        {"skip, incomplete", Incomplete, {{kSkip, kOn}}, Server::Up, false, "", false},
        {"skip before all", Stale, skipBeforeAll, Server::Up, false, "", false},
        {"defer, fresh", Fresh, {{kDefer, kOn}}, Server::Up, true, "", true},
        {"defer, incomplete", Incomplete, {{kDefer, kOn}}, Server::Up, false, "", false},
        {"defer before force", Stale, {{kDefer, kOn}, {kForce, kOn}}, Server::Up, true, "", true},
        {"forced, no server", Fresh, {{kForce, kOn}}, Server::Down, true, kTried, false},
        {"stale, no server", Stale, {}, Server::Down, true, kTried, true},
        {"stale, no sign-in", Stale, {}, Server::NoSignIn, true, kTried, true},
        {"stale, no answer", Stale, {}, Server::NoAnswer, true, kAsked, false},
        {"stale, wrong password", Stale, {}, Server::RefusesPassword, true, kTried, true},
    };
    for (const Case& each : cases) {
        __VeltoIDDBRemoveVeltoIDAccount(kName);
        prepare(each.state == Stale ? 30'000 : 10);
        if (each.state == Incomplete) setValue("ValidatedEmail", {});
        serverIs(each.server);
        EXPECT_EQ(get(each.options), each.answers) << each.what;
        EXPECT_EQ(server_.takeMethods(), each.methods) << each.what;
        EXPECT_EQ(error_ ? error_->code : 0, each.answers ? 0 : -100) << each.what;
        EXPECT_EQ(record()["ForceValidation"], each.marks ? kOn : Value()) << each.what;
        EXPECT_EQ(record()["NextValidationDate"], each.marks ? date() : Value()) << each.what;
        const bool validated = each.server == Server::Up && std::string_view(each.methods) == kAsked;
        EXPECT_EQ(record()["ValidationDate"] == date(), validated) << each.what;
        EXPECT_EQ(record().contains("Dirty"), each.marks || validated || !hasPassword()) << each.what;
        EXPECT_EQ(hasPassword(), each.server != Server::RefusesPassword) << each.what;
        EXPECT_EQ(info_.contains("encDsId"), each.answers && std::string_view(each.methods) != kTried)
            << each.what << ": unknown when the sign-in failed";
    }
    setValue("NextValidationDate", date(77));
    ASSERT_TRUE(get({{kDefer, kOn}}));
    EXPECT_EQ(record()["NextValidationDate"], date(77)) << "a mark does not put off a planned validation";
}

TEST_F(Information, AnswersWhatRecordAndCertificateEntryHold) {
    prepare(10);
    const Dictionary values = {{"FirstName", "Jane"},
                               {"LastName", number(1)},
                               {"EmailAddresess", Array{"a", "b"}},
                               {"ValidatedPhones", "no list"},
                               {"PrimaryEmail", "not told"}};
    setValues(values);
    const Dictionary expected = {{"VeltoID", kName},          {"encDsId", "d1"},
                                 {"FirstName", "Jane"},       {"AllEmails", Array{"a", "b"}},
                                 {"ValidatedEmail", kEmails}, {"ValidationDate", date(-10)}};
    ASSERT_TRUE(get({}));
    EXPECT_EQ(info_, expected);
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"Expires", date(5)}, {"SerialNumber", "7"}});
    __VeltoIDDBSetCertificateValue("d1", "CertificatePEM", "pem", Notify::No);
    __VeltoIDDBSetCertificateValue("d1", "Date", date(1), Notify::No);
    Dictionary withCertificate = expected;
    withCertificate.set("CertificatePEM", "pem");
    withCertificate.set("CertificateExpiration", date(5));
    withCertificate.set("SerialNumber", "7");
    withCertificate.set("CertificateDate", date(1));
    ASSERT_TRUE(get({}));
    EXPECT_EQ(info_, withCertificate);
    ASSERT_TRUE(get({}, nullptr)) << "without a name, of the first account";
    EXPECT_EQ(info_, withCertificate);
}

TEST_F(Information, WithoutAnAccountFails) {
    EXPECT_FALSE(get({}, nullptr));
    EXPECT_EQ(error_->code, -100);
    EXPECT_FALSE(get({}, "nobody"));
    EXPECT_EQ(error_->code, -108);
    EXPECT_EQ(server_.takeMethods(), "");
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("no password", nullptr, "d1"));
    EXPECT_FALSE(get({}, nullptr)) << "the first account is one with a password";
    Array names{"left over"};
    ASSERT_TRUE(__VeltoIDCopyVeltoIDs({}, &names));
    EXPECT_EQ(names, Array{"no password"});
    __VeltoIDDBRemoveVeltoIDAccount("no password");
    ASSERT_TRUE(__VeltoIDCopyVeltoIDs({}, &names, &error_));
    EXPECT_EQ(names, Array()) << "none is no error";
}

TEST_F(Information, TellsTheServerWhichRecordItHas) {
    struct Case {
        const char* what;
        Dictionary options;
        Value identifier;
        Value data;
        const char* sent;
    };
    const Value noBytes = Data(std::vector<uint8_t>{});
    const Case cases[] = {
        {"both", {}, "v1", kRecordData, "v1"},
        {"forced", {{"ForceValidationRecordFetch", kOn}}, "v1", kRecordData, ""},
        {"no identifier", {}, {}, kRecordData, ""},
        {"no data", {}, "v1", {}, ""},
        {"empty data", {}, "v1", noBytes, ""},
    };
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"SerialNumber", "7"}});
    for (const Case& each : cases) {
        prepare(30'000);
        setValue(kIdentifier, each.identifier);
        setValue(kData, each.data);
        ASSERT_TRUE(get(each.options)) << each.what;
        const Dictionary sent = server_.take().back().parameters;
        EXPECT_EQ(sent["ClientVIDVRecordIdentifier"], Value(each.sent)) << each.what;
        EXPECT_EQ(sent["CertificateSerialNumber"], Value("7")) << each.what;
    }
}

TEST_F(Information, ChangesThatClientsSeeArePosted) {
    struct Case {
        const char* what;
        Dictionary before;
        Dictionary answer;
        bool isPosted;
    };
    const auto newRecord = [this](const char* identifier) {
        return Dictionary{{kIdentifier, identifier}, {kData, kRecordData}, {kNextCheck, date()}};
    };
    const Case cases[] = {
        {"the same", {{"FirstName", "A"}}, {{"FirstName", "A"}}, false},
        {"a first name", {{"FirstName", "A"}}, {{"FirstName", "B"}}, true},
        {"a last name", {{"LastName", "A"}}, {{"LastName", "B"}}, true},
        {"addresses", {{"EmailAddresess", Array{"a"}}}, {{"AllEmails", Array{"b"}}}, true},
        {"validated addresses", {{"ValidatedEmail", Array{"a"}}}, {{"ValidatedEmail", Array()}}, true},
        {"validated phones", {{"ValidatedPhones", Array{"a"}}}, {{"ValidatedPhones", Array{"b"}}}, true},
        {"something new", {}, {{"FirstName", "B"}}, false},
        {"something gone", {{"FirstName", "A"}}, {}, false},
        {"something unseen", {{"PrimaryEmail", "a"}}, {{"PrimaryEmail", "b"}}, false},
        {"another record", {{kIdentifier, "v1"}}, newRecord("v2"), true},
        {"the same record", {{kIdentifier, "v1"}}, newRecord("v1"), false},
        {"a first record", {}, newRecord("v1"), false},
        {"a record's identifier alone", {{kIdentifier, "v1"}}, {{kIdentifier, "v2"}}, false},
    };
    for (const Case& each : cases) {
        __VeltoIDDBRemoveVeltoIDAccount(kName);
        prepare(30'000);
        setValue("ValidatedEmail", {});
        setValues(each.before);
        setValue("ForceValidation", kOn);
        setValue("NextValidationDate", date());
        updateAccountWithGetMyInfoResult(kName, each.answer);
        EXPECT_EQ(takePosted(), each.isPosted ? "changed " : "") << each.what;
        EXPECT_FALSE(record().contains("ForceValidation") || record().contains("NextValidationDate"))
            << each.what;
        EXPECT_EQ(record()["ValidationDate"], date()) << each.what;
        for (const auto& [key, value] : each.answer)
            EXPECT_EQ(record()[key == "AllEmails" ? "EmailAddresess" : key.view()], value) << each.what;
    }
    updateAccountWithGetMyInfoResult("nobody", {{"FirstName", "A"}});
    EXPECT_EQ(takePosted(), "changed ") << "there was no record before";
    EXPECT_FALSE(__VeltoIDDBCopyVeltoIDAccount("nobody", nullptr));
}

TEST_F(Information, TheServersWordOnTheCertificateGoesIntoItsEntry) {
    prepare(0);
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"CertStatus", "CERT_ISSUED"}, {"Expires", date(1e6)}});
    updateAccountWithGetMyInfoResult(kName, {{"encDsId", "d1"}, {"FirstName", "A"}});
    EXPECT_FALSE(certificateEntry().contains("LastSuccessfulValidation"));
    updateAccountWithGetMyInfoResult(kName, {{"encDsId", "d1"}, {"CertificateIsValid", kOn}});
    EXPECT_EQ(certificateEntry()["LastSuccessfulValidation"], date());
    EXPECT_EQ(certificateEntry()["CertStatus"], Value("CERT_ISSUED"));
    updateAccountWithGetMyInfoResult(kName, {{"encDsId", "d1"}, {"CertificateIsValid", kOff}});
    EXPECT_EQ(certificateEntry()["CertStatus"], Value("CERTIFICATE_INVALID"));
    EXPECT_EQ(certificateEntry()["Expires"], date());
    EXPECT_EQ(log_.count("Marking certificate for Velto ID " + std::string(kName) +
                         " dsID=\"d1\"as invalid because the server said CertificateIsValid = false. (false"),
              1);
    updateAccountWithGetMyInfoResult(kName, {{"CertificateIsValid", kOff}});
}

TEST_F(Information, AValidationRecordIsKeptWithTheDateToLookAtItAgain) {
    const testing_support::TestAuthority authority;
    const auto signedRecord = [&](const std::string& entries, bool isGood = true) {
        auto bytes = authority.sign("<plist><dict>" + entries + "</dict></plist>");
        if (!isGood) bytes.back() ^= 1;
        return Data(bytes);
    };
    const std::string asOf = "<key>ValidAsOf</key><date>2025-06-15T00:00:00Z</date>";
    const std::string day = "<key>SuggestValidDuration</key><real>86400</real>";
    constexpr double kAsOf = 1'749'945'600;
    const Value none;
    struct Case {
        const char* what;
        Data data;
        Value given;
        Value nextCheck;
        Value validAsOf;
        Value duration;
    };
    const Value validAsOf = Value::date(kAsOf);
    const Case cases[] = {
        {"all of it", signedRecord(asOf + day), none, Value::date(kAsOf + 64'800), validAsOf, number(86'400)},
        {"no duration", signedRecord(asOf), none, validAsOf, validAsOf, none},
        {"no date", signedRecord(day), none, none, none, number(86'400)},
        {"a text", signedRecord("<key>ValidAsOf</key><string>2025-06-14 16:00:00 -0800</string>"), none,
         validAsOf, validAsOf, none},
        {"no dictionary", Data(authority.sign("<plist><array/></plist>")), none, none, none, none},
        {"not signed so", signedRecord(asOf + day, false), none, none, none, none},
        {"no record", Data(std::vector<uint8_t>{1}), none, none, none, none},
        {"the server's date", signedRecord(asOf + day), date(99), date(99), validAsOf, number(86'400)},
        {"only the server's", signedRecord(asOf, false), date(99), date(99), none, none},
        {"no number", signedRecord(asOf + "<key>SuggestValidDuration</key><real>nan</real>"), none, validAsOf,
         validAsOf, none},
    };
    for (const Case& each : cases) {
        __VeltoIDDBRemoveVeltoIDAccount(kName);
        prepare(0);
        setValues({{kIdentifier, "old"}, {kData, kRecordData}, {kNextCheck, date(7)}});
        updateAccountWithGetMyInfoResult(
            kName, {{kIdentifier, "new"}, {kData, each.data}, {kNextCheck, each.given}});
        EXPECT_EQ(record()[kNextCheck], each.nextCheck) << each.what;
        EXPECT_EQ(record()[kData], each.nextCheck.isAbsent() ? none : Value(each.data)) << each.what;
        EXPECT_EQ(record().contains(kIdentifier), !each.nextCheck.isAbsent()) << each.what;
        EXPECT_EQ(record()["VeltoIDAccountValidationRecordValidAsOfKey"], each.validAsOf) << each.what;
        EXPECT_EQ(record()["VeltoIDAccountValidationRecordSuggestedValidIntervalKey"], each.duration)
            << each.what;
        EXPECT_EQ(takePosted(), "changed ") << each.what;
    }
}

}  // namespace
}  // namespace veltoid
