#include "VeltoIDAuthenticationImpl/AccountInformation.h"

#include "TestSupport/EngineFixture.h"
#include "TestSupport/TestAuthority.h"
#include "Values/DictionaryAccess.h"

namespace veltoid {
namespace {

class Information : public EngineTest {
  protected:
    /// A complete record, validated `age` seconds ago.
    void prepare(double age) {
        createAccount("d1");
        setValues({{"ValidatedEmail", kEmails},
                   {"ValidationDate", date(-age)},
                   {"ForceValidation", kGone},
                   {"NextValidationDate", kGone},
                   {"Dirty", kGone}});
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
    const std::tuple<const char*, double, Value, Value, bool> cases[] = {
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
        {"presumed is no number", 28'800, {}, "five", true},
        {"presumed is a text", 101, {}, "100", false},
    };
    for (const auto& [what, age, own, presumed, isFresh] : cases) {
        prepare(age);
        setValue("ValidForInterval", own);
        __VeltoIDDBSetMetaInfoValue(nullptr, "AccountPresumedValidInterval", presumed);
        EXPECT_EQ(get({{"SkipValidation", kOn}}), isFresh) << what;
    }
    prepare(0);
    setValue("ValidationDate", "today");
    EXPECT_FALSE(get({{"SkipValidation", kOn}}));
    EXPECT_EQ(error_->code, -100);
}

TEST_F(Information, IsAskedForWhenItMustBe) {
    enum class State { Fresh, Stale, Incomplete };
    using enum State;
    constexpr const char* kRecord = "ForceValidationRecordFetch";
    constexpr const char* kSerial = "ValidateCertificateSerialNumber";
    constexpr const char* kForce = "ForceValidation";
    constexpr const char* kSkip = "SkipValidation";
    constexpr const char* kDefer = "DeferValidation";
    constexpr const char* kAsked = "authenticate getMyInfo";
    constexpr const char* kTried = "authenticate";
    const Dictionary all = {{kSkip, kOn}, {kDefer, kOn}, {kRecord, kOn}, {kSerial, kOn}, {kForce, kOn}};
    const struct {
        const char* what;
        State state;
        Dictionary options;
        Server server;
        bool answers;
        const char* methods;
        bool marks;
    } cases[] = {
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
        {"skip before all", Stale, all, Server::Up, false, "", false},
        {"defer, fresh", Fresh, {{kDefer, kOn}}, Server::Up, true, "", true},
        {"defer, incomplete", Incomplete, {{kDefer, kOn}}, Server::Up, false, "", false},
        {"defer before force", Stale, {{kDefer, kOn}, {kForce, kOn}}, Server::Up, true, "", true},
        {"forced, no server", Fresh, {{kForce, kOn}}, Server::Down, true, kTried, false},
        {"stale, no server", Stale, {}, Server::Down, true, kTried, true},
        {"stale, no sign-in", Stale, {}, Server::NoSignIn, true, kTried, true},
        {"stale, no answer", Stale, {}, Server::NoAnswer, true, kAsked, false},
        {"stale, wrong password", Stale, {}, Server::RefusesPassword, true, kTried, true},
    };
    for (const auto& [what, state, options, server, answers, methods, marks] : cases) {
        SCOPED_TRACE(what);
        __VeltoIDDBRemoveVeltoIDAccount(kName);
        prepare(state == Stale ? 30'000 : 10);
        if (state == Incomplete) setValue("ValidatedEmail", {});
        serverIs(server);
        EXPECT_EQ(get(options), answers);
        EXPECT_EQ(server_.takeMethods(), methods);
        EXPECT_EQ(error_ ? error_->code : 0, answers ? 0 : -100);
        EXPECT_EQ(record()["ForceValidation"], marks ? kOn : Value());
        EXPECT_EQ(record()["NextValidationDate"], marks ? date() : Value());
        const bool validated = server == Server::Up && std::string_view(methods) == kAsked;
        EXPECT_EQ(record()["ValidationDate"] == date(), validated);
        EXPECT_EQ(record().contains("Dirty"), marks || validated || !hasPassword());
        EXPECT_EQ(hasPassword(), server != Server::RefusesPassword);
        EXPECT_EQ(info_.contains("encDsId"), answers && std::string_view(methods) != kTried)
            << "unknown when the sign-in failed";
    }
    setValue("NextValidationDate", date(77));
    ASSERT_TRUE(get({{kDefer, kOn}}));
    EXPECT_EQ(record()["NextValidationDate"], date(77)) << "a mark does not put off a planned validation";
}

TEST_F(Information, AnswersWhatRecordAndCertificateEntryHold) {
    prepare(10);
    setValues({{"FirstName", "Jane"},
               {"LastName", number(1)},
               {"EmailAddresess", Array{"a", "b"}},
               {"ValidatedPhones", "no list"},
               {"PrimaryEmail", "not told"}});
    const Dictionary ofRecord = {{"VeltoID", kName},          {"encDsId", "d1"},
                                 {"FirstName", "Jane"},       {"AllEmails", Array{"a", "b"}},
                                 {"ValidatedEmail", kEmails}, {"ValidationDate", date(-10)}};
    ASSERT_TRUE(get({}));
    EXPECT_EQ(info_, ofRecord);
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"Expires", date(5)}, {"SerialNumber", "7"}});
    __VeltoIDDBSetCertificateValue("d1", "CertificatePEM", "pem", Notify::No);
    __VeltoIDDBSetCertificateValue("d1", "Date", date(1), Notify::No);
    const Dictionary ofEntry = {{"CertificatePEM", "pem"},
                                {"CertificateExpiration", date(5)},
                                {"SerialNumber", "7"},
                                {"CertificateDate", date(1)}};
    for (const String& name : {String(kName), String()}) {
        ASSERT_TRUE(get({}, name)) << "without a name, of the first account";
        EXPECT_EQ(info_, mergeDictionaries(ofRecord, ofEntry, true));
    }
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
    const Value noBytes = Data(std::vector<uint8_t>{});
    const std::tuple<const char*, Dictionary, Value, Value, const char*> cases[] = {
        {"both", {}, "v1", kRecordData, "v1"},
        {"forced", {{"ForceValidationRecordFetch", kOn}}, "v1", kRecordData, ""},
        {"no identifier", {}, {}, kRecordData, ""},
        {"no data", {}, "v1", {}, ""},
        {"empty data", {}, "v1", noBytes, ""},
    };
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"SerialNumber", "7"}});
    for (const auto& [what, options, identifier, data, told] : cases) {
        SCOPED_TRACE(what);
        prepare(30'000);
        setValue(kIdentifier, identifier);
        setValue(kData, data);
        ASSERT_TRUE(get(options));
        const Dictionary sent = server_.take().back().parameters;
        EXPECT_EQ(sent["ClientVIDVRecordIdentifier"], Value(told));
        EXPECT_EQ(sent["CertificateSerialNumber"], Value("7"));
    }
}

TEST_F(Information, ChangesThatClientsSeeArePosted) {
    const auto newRecord = [this](const char* identifier) {
        return Dictionary{{kIdentifier, identifier}, {kData, kRecordData}, {kNextCheck, date()}};
    };
    const std::tuple<const char*, Dictionary, Dictionary, bool> cases[] = {
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
    for (const auto& [what, before, answer, isPosted] : cases) {
        SCOPED_TRACE(what);
        __VeltoIDDBRemoveVeltoIDAccount(kName);
        prepare(30'000);
        setValues({{"ValidatedEmail", kGone}, {"ForceValidation", kOn}, {"NextValidationDate", date()}});
        setValues(before);
        updateAccountWithGetMyInfoResult(kName, answer);
        EXPECT_EQ(takePosted(), isPosted ? "changed " : "");
        EXPECT_FALSE(record().contains("ForceValidation") || record().contains("NextValidationDate"));
        EXPECT_EQ(record()["ValidationDate"], date());
        for (const auto& [key, value] : answer)
            EXPECT_EQ(record()[key == "AllEmails" ? "EmailAddresess" : key.view()], value);
    }
    updateAccountWithGetMyInfoResult("nobody", {{"FirstName", "A"}});
    EXPECT_EQ(takePosted(), "changed ") << "there was no record before";
    EXPECT_FALSE(__VeltoIDDBCopyVeltoIDAccount("nobody", nullptr));
}

TEST_F(Information, TheServersWordOnTheCertificateGoesIntoItsEntry) {
    prepare(0);
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"CertStatus", "CERT_ISSUED"}, {"Expires", date(1e6)}});
    updateAccountWithGetMyInfoResult(kName, {{"encDsId", "d1"}, {"FirstName", "A"}});
    EXPECT_FALSE(certificateEntry().contains(kValidated));
    updateAccountWithGetMyInfoResult(kName, {{"encDsId", "d1"}, {"CertificateIsValid", kOn}});
    EXPECT_EQ(certificateEntry()[kValidated], date());
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
    const std::string asText = "<key>ValidAsOf</key><string>2025-06-14 16:00:00 -0800</string>";
    const std::string day = "<key>SuggestValidDuration</key><real>86400</real>";
    const std::string noNumber = "<key>SuggestValidDuration</key><real>nan</real>";
    const Value start = Value::date(1'749'945'600);
    const Value due = Value::date(1'749'945'600 + 64'800);
    const Value length = number(86'400);
    const Value given = date(99);
    const struct {
        const char* what;
        Data data;
        Value given, nextCheck, validAsOf, duration;
    } cases[] = {
        {"all of it", signedRecord(asOf + day), {}, due, start, length},
        {"no duration", signedRecord(asOf), {}, start, start, {}},
        {"no date", signedRecord(day), {}, {}, {}, length},
        {"a text", signedRecord(asText), {}, start, start, {}},
        {"no dictionary", Data(authority.sign("<plist><array/></plist>")), {}, {}, {}, {}},
        {"not signed so", signedRecord(asOf + day, false), {}, {}, {}, {}},
        {"no record", Data(std::vector<uint8_t>{1}), {}, {}, {}, {}},
        {"the server's date", signedRecord(asOf + day), given, given, start, length},
        {"only the server's", signedRecord(asOf, false), given, given, {}, {}},
        {"no number", signedRecord(asOf + noNumber), {}, start, start, {}},
    };
    for (const auto& [what, data, given, nextCheck, validAsOf, duration] : cases) {
        SCOPED_TRACE(what);
        __VeltoIDDBRemoveVeltoIDAccount(kName);
        prepare(0);
        setValues({{kIdentifier, "old"}, {kData, kRecordData}, {kNextCheck, date(7)}});
        updateAccountWithGetMyInfoResult(kName, {{kIdentifier, "new"}, {kData, data}, {kNextCheck, given}});
        EXPECT_EQ(record()[kNextCheck], nextCheck);
        EXPECT_EQ(record()[kData], nextCheck.isAbsent() ? Value() : Value(data));
        EXPECT_EQ(record().contains(kIdentifier), !nextCheck.isAbsent());
        EXPECT_EQ(record()[kAsOf], validAsOf);
        EXPECT_EQ(record()[kDuration], duration);
        EXPECT_EQ(takePosted(), "changed ");
    }
}

}  // namespace
}  // namespace veltoid
