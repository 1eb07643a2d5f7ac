// The account engine against a real database and keychain, an identity server that is told what to answer,
// and simulated time.
#include <functional>

#include "Platform/FakeNotifications.h"
#include "Tests/Support/TestAuthority.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AddForget.h"
#include "VeltoIDAuthenticationImpl/Breadcrumbs.h"
#include "VeltoIDAuthenticationImpl/FindPerson.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"
#include "VeltoIDAuthenticationImpl/PasswordVerification.h"
#include "VeltoIDAuthenticationImpl/ServerErrorHandling.h"
#include "VeltoIDKeychainItems/Passwords.h"
#include "VeltoIDXMLServerCommunications/FakeIdentityServer.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

const Value kOn = flag(true);
const Value kOff = flag(false);
const Array kEmails{"jane@velto.example"};

// Keys of records.
constexpr const char* kIdentifier = "VeltoIDAccountValidationRecordIdentifierKey";
constexpr const char* kData = "VeltoIDAccountValidationRecordData";
constexpr const char* kNextCheck = "VeltoIDAccountValidationRecordNextCheckDateKey";
constexpr const char* kEmbargo = "EarliestAllowedConnectionDate";
const Value kRecordData = Data(std::vector<uint8_t>{1, 2});

enum class Server { Up, Down, NoSignIn, NoAnswer, RefusesPassword };

class EngineTest : public ServerTest {
  protected:
    void SetUp() override {
        ServerTest::SetUp();
        serverIs(Server::Up);
    }

    void serverIs(Server state) {
        server_.answer("authenticate", Dictionary{{"encDsId", "d1"}, {"Version", Value::int32(101)}});
        server_.answer("getMyInfo",
                       Dictionary{{"encDsId", "d1"}, {"firstNm", "Jane"}, {"ValidatedEmail", kEmails}});
        if (state == Server::Down) server_.refuse("authenticate", 503);
        if (state == Server::NoSignIn) server_.answer("authenticate", Dictionary());
        if (state == Server::NoAnswer) server_.fault("getMyInfo", -5);
        if (state == Server::RefusesPassword) server_.fault("authenticate", -20101);
    }

    /// An entry that is of use.
    static void storeCertificateEntry(const char* encDsId) {
        const Data reference(std::vector<uint8_t>{1});
        __VeltoIDDBSetCertificateInfo(encDsId, Dictionary{{"CertificateReference", reference}});
        __VeltoIDDBSetCertificateValue(encDsId, "CertificatePrivateKeyReference", reference, false);
    }

    /// What was posted since the last time: "added/removed", "changed".
    std::string takePosted() {
        std::string text;
        for (const std::string& name : notifications_.take()) {
            if (name == "HWVeltoIDAccountConfigurationAddedOrRemovedNotification") text += "added/removed ";
            if (name == "HWVeltoIDAccountConfigurationChangeNotification") text += "changed ";
        }
        return text;
    }

    platform::FakeNotifications notifications_;
};

// --- Adding

class Adding : public EngineTest {
  protected:
    bool add(const Dictionary& options = {}, const String& password = kPassword) {
        encDsId_ = nullptr;
        accountRecord_.reset();
        error_.reset();
        return __VeltoIDDoAddVeltoID(kName, password, options, &encDsId_, &accountRecord_, &error_);
    }

    String encDsId_;
    std::optional<Dictionary> accountRecord_;
    std::optional<Error> error_;
};

TEST_F(Adding, StoresTheAccountWhateverTheServerSays) {
    struct Case {
        const char* what;
        Dictionary options;
        Server server;
        const char* methods;
        bool signsIn;
        bool succeeds;
    };
    const Dictionary noInformation = {{"VeltoIDOptionsDoNotFetchVeltoIDAuthenticationRecord", kOn}};
    constexpr const char* kAll = "authenticate authenticate getMyInfo";
    const Case cases[] = {
        {"no options", {}, Server::Up, kAll, true, true},
        {"no information", noInformation, Server::Up, "authenticate", true, true},
        {"no sign-in", {{"DoNotCheckPassword", kOn}}, Server::Up, "", false, true},
        {"an option of the wrong kind", {{"DoNotCheckPassword", number(1)}}, Server::Up, kAll, true, true},
        {"no information to be had", {}, Server::NoAnswer, kAll, true, true},
        {"no server", {}, Server::Down, "authenticate", false, false},
        {"wrong password", {}, Server::RefusesPassword, "authenticate", false, false},
    };
    for (const Case& each : cases) {
        serverIs(each.server);
        EXPECT_TRUE(add(each.options)) << each.what;
        EXPECT_EQ(error_, std::nullopt) << each.what;
        EXPECT_EQ(server_.takeMethods(), each.methods) << each.what;
        EXPECT_EQ(encDsId_, each.signsIn ? String("d1") : String()) << each.what;
        EXPECT_EQ(record().string("encDsId"), encDsId_) << each.what;
        EXPECT_EQ(accountRecord_, each.succeeds ? std::optional(record()) : std::nullopt) << each.what;
        EXPECT_EQ(hasPassword(), each.server != Server::RefusesPassword) << each.what;
        const std::string line = std::string("VeltoIDAuth: Adding account ") + kName +
                                 (each.succeeds ? " succeeded." : " failed, ERROR:");
        EXPECT_NE(log_.lines().back().text.find(line), std::string::npos) << each.what;
        EXPECT_TRUE(takePosted().ends_with("added/removed ")) << each.what;
        __VeltoIDDBRemoveVeltoIDAccount(kName);
    }
}

TEST_F(Adding, FetchesTheValidationRecordAnew) {
    createAccount();
    setValue(kIdentifier, "v1");
    setValue(kData, Data(std::vector<uint8_t>{1}));
    ASSERT_TRUE(add({{"ForceValidationRecordFetch", kOff}}));
    const auto calls = server_.take();
    ASSERT_EQ(calls.back().method, "getMyInfo");
    EXPECT_EQ(calls.back().parameters["ClientVIDVRecordIdentifier"], Value("")) << "as if there were none";
    EXPECT_EQ(record()["FirstName"], Value("Jane"));
}

TEST_F(Adding, AnAccountWithItsCertificateOnTheWayIsNotSignedInAgain) {
    createAccount("d1");
    const auto readd = [&](const Dictionary& options = {}) {
        EXPECT_TRUE(add(options, "new hash"));
        return server_.takeMethods();
    };
    setValue("CertificateToken", "t");
    EXPECT_EQ(readd(), "");
    EXPECT_EQ(__VeltoIDDBCopyHashedPassword(record()), "new hash");
    EXPECT_EQ(encDsId_, "d1");
    EXPECT_EQ(accountRecord_, record());
    EXPECT_EQ(takePosted(), "added/removed ");
    EXPECT_EQ(
        log_.count("VeltoIDAuth: Already existing account " + std::string(kName) + " re-added; succeeded."),
        1);
    EXPECT_NE(readd({{"ForceCertificateCreation", kOn}}), "");

    setValue("CertificateToken", {});
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"CertStatus", "CERT_ISSUED"}});
    EXPECT_EQ(readd(), "");
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"CertStatus", "CERTIFICATE_INVALID"}});
    EXPECT_NE(readd(), "");
    setValue("CertificateToken", "t");
    setValue("encDsId", {});
    EXPECT_EQ(readd(), "");
    EXPECT_EQ(log_.count(" re-added; failed, "), 1) << "it has no encDsId";
}

// --- Forgetting

TEST_F(EngineTest, ForgettingTakesEverythingAlong) {
    createAccount("d1");
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("other", nullptr, "other"));
    for (const char* encDsId : {"d1", "other"}) storeCertificateEntry(encDsId);
    const Data reference = record().data("HashedPasswordRef");
    std::optional<Error> error;
    EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}, &error));
    EXPECT_EQ(error, std::nullopt);
    EXPECT_EQ(takePosted(), "added/removed changed ");
    EXPECT_FALSE(__VeltoIDDBCopyVeltoIDAccount(kName, nullptr));
    EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
    EXPECT_TRUE(__VeltoIDDBCopyCertificateInfo("other", nullptr));
    EXPECT_FALSE(copyPasswordFromKeychainGivenPersistentRef(reference, nullptr));
    EXPECT_TRUE(log_.contains("VeltoIDAuth: Forgetting account " + std::string(kName) + "."));

    EXPECT_FALSE(__VeltoIDForgetVeltoID(kName, {}, &error));
    EXPECT_EQ(error->code, -100);
    EXPECT_EQ(takePosted(), "changed ");
    error.reset();
    EXPECT_FALSE(__VeltoIDForgetVeltoID(nullptr, {}, &error));
    EXPECT_EQ(error->code, -100);
    EXPECT_EQ(takePosted(), "");
}

TEST_F(EngineTest, ForgettingKeepsACertificateThatAnotherAccountShares) {
    createAccount("d1");
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount("other", "hash", "d1"));
    storeCertificateEntry("d1");
    const Data reference = record().data("HashedPasswordRef");
    EXPECT_TRUE(__VeltoIDForgetVeltoID(kName, {}));
    EXPECT_TRUE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
    EXPECT_FALSE(copyPasswordFromKeychainGivenPersistentRef(reference, nullptr));
    EXPECT_TRUE(__VeltoIDForgetVeltoID("other", {}));
    EXPECT_FALSE(__VeltoIDDBCopyCertificateInfo("d1", nullptr));
}

// --- Account information

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
    __VeltoIDDBSetCertificateValue("d1", "CertificatePEM", "pem", false);
    __VeltoIDDBSetCertificateValue("d1", "Date", date(1), false);
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

// --- People and breadcrumbs

TEST_F(EngineTest, PeopleAreFoundOnBehalfOfAnAccount) {
    const auto find = [this](const String& name, const String& password) {
        std::optional<Error> error;
        std::optional<Array> results;
        const bool found =
            __VeltoIDDoFindPerson(name, password, {{"email", Array{"a"}}}, {}, &results, &error);
        EXPECT_EQ(found, !error);
        EXPECT_EQ(results, found ? std::optional(Array{"somebody"}) : std::nullopt);
        return error ? error->code : 0;
    };
    server_.answer("findPerson", Dictionary{{"matches", Array{"somebody"}}});
    EXPECT_EQ(find(nullptr, "any"), -2) << "no account at all";
    EXPECT_EQ(find("nobody", nullptr), -100);
    EXPECT_EQ(find("nobody", "any"), 0) << "the server knows better";
    createAccount("d1");
    (void)server_.take();
    EXPECT_EQ(find(nullptr, nullptr), 0);
    EXPECT_EQ(server_.take().front().parameters["pwdHash"], Value(kPassword));
    EXPECT_EQ(find(kName, "given"), 0);
    EXPECT_EQ(server_.take().front().parameters["pwdHash"], Value("given"));
    serverIs(Server::RefusesPassword);
    EXPECT_EQ(find(nullptr, nullptr), -101);
    EXPECT_FALSE(hasPassword());
}

TEST_F(EngineTest, ABreadcrumbIsStoredAndFetched) {
    const Data data(platform::bytesOf("ABC"));
    std::optional<Error> error;
    server_.answer("saveBreadcrumbEk", Dictionary{{"x", "y"}});
    server_.answer("fetchBreadcrumbEk", Dictionary{{"ek", "QUJD"}});
    EXPECT_TRUE(__VeltoIDDoSetBreadcrumb(kName, kPassword, "k", data, {}, &error));
    EXPECT_EQ(__VeltoIDDoCopyBreadcrumb(kName, kPassword, "k", {}, &error), data);
    EXPECT_EQ(error, std::nullopt);
    server_.answer("fetchBreadcrumbEk", Dictionary{{"x", "y"}});
    EXPECT_FALSE(__VeltoIDDoCopyBreadcrumb(kName, kPassword, "k", {}, &error));
    EXPECT_EQ(error->code, -100);
    server_.fault("saveBreadcrumbEk", -20209);
    EXPECT_FALSE(__VeltoIDDoSetBreadcrumb(kName, kPassword, "k", data, {}, &error));
    EXPECT_EQ(error->code, -102);
    (void)server_.take();
    EXPECT_FALSE(__VeltoIDDoCopyBreadcrumb(kName, nullptr, "k", {}, &error));
    EXPECT_EQ(error->code, -100);
    EXPECT_EQ(server_.takeMethods(), "");
}

// --- Errors of the server, passwords

TEST_F(EngineTest, VerifyingAPasswordAlwaysAsksTheServer) {
    server_.answer("authenticate",
                   Dictionary{{"encDsId", "d1"}, {"dsSessionValidityDuration", number(1000)}});
    const auto verify = [](const String& name, const String& password) {
        std::optional<Error> error;
        const bool verified =
            __VeltoIDDoVerifyPassword(name, password, {{"DoNotUseCachedSession", kOff}}, &error);
        EXPECT_EQ(verified, !error.has_value());
        return error ? error->code : 0;
    };
    EXPECT_EQ(verify(kName, kPassword), 0);
    EXPECT_EQ(verify(kName, kPassword), 0);
    EXPECT_NE(__VeltoIDSessionDoCreateSession(kName, kPassword, {}), nullptr);
    EXPECT_EQ(server_.takeMethods(), "authenticate authenticate authenticate") << "nor is a session kept";
    EXPECT_FALSE(__VeltoIDDBCopyVeltoIDAccount(kName, nullptr));
    server_.fault("authenticate", -20101);
    EXPECT_EQ(verify(kName, kPassword), -101);
    server_.refuse("authenticate", 500);
    EXPECT_EQ(verify(kName, kPassword), -100);
    EXPECT_EQ(verify(nullptr, kPassword), -99);
    EXPECT_EQ(verify(kName, nullptr), -99);
    EXPECT_EQ(server_.takeMethods(), "authenticate authenticate");
}

// --- What an account needs next

TEST_F(EngineTest, TheNextActionIsTheEarliestOfManyDates) {
    constexpr double kFortnight = 1'209'600;
    struct Case {
        const char* what;
        Dictionary values;
        std::optional<Dictionary> entry;
        /// Seconds from now.
        std::optional<double> next;
        bool isNewServer = false;
    };
    const Value none = Value::null();
    constexpr const char* kRequested = "CSRGenerationDate";
    constexpr const char* kRenewal = "NextRenewalAttempt";
    constexpr const char* kFetch = "NextCertificateFetchDate";
    const auto in = [this](double seconds) { return date(seconds); };
    const Dictionary entry;
    const Case cases[] = {
        {"nothing foreseen", {}, entry, {}},
        {"dirty", {{"Dirty", kOn}}, entry, 0},
        {"no encDsId", {{"encDsId", none}}, {}, 0},
        {"tried", {{"encDsId", none}, {"LastConnectAttempt", in(-100)}, {kFetch, in(999)}}, {}, 200},
        {"forced validation", {{"ForceValidation", kOn}, {"NextValidationDate", in(50)}}, entry, 0},
        {"next validation", {{"NextValidationDate", in(50)}, {"ValidationDate", in(0)}}, entry, 50},
        {"last validation", {{"ValidationDate", in(-100)}}, entry, kFortnight - 100},
        {"embargo", {{kEmbargo, in(1000)}, {"ForceValidation", kOn}, {"Dirty", kOn}}, entry, 1000},
        {"embargo, expiry", {{kEmbargo, in(99)}}, Dictionary{{"Expires", in(9)}, {kRenewal, in(5)}}, 9},
        {"embargo, no certificate", {{kEmbargo, in(1000)}}, {}, 1000},
        {"embargo is over", {{kEmbargo, in(-1)}, {"ClientTooOld", kOn}}, entry, {}},
        {"too old", {{"ClientTooOld", kOn}, {"ForceValidation", kOn}}, {}, 3'153'600'000},
        {"an expiry", {}, Dictionary{{"Expires", in(500)}}, 500},
        {"a renewal", {}, Dictionary{{"Expires", in(500)}, {kRenewal, in(400)}}, 400},
        {"a validated certificate", {}, Dictionary{{"LastSuccessfulValidation", in(-50)}}, kFortnight - 50},
        {"no certificate", {}, {}, 0},
        {"a fetch", {{kFetch, in(30)}, {kRequested, in(-10)}}, {}, 30},
        {"a request", {{kRequested, in(-10)}}, {}, 3590},
        {"an interval", {{kRequested, in(-10)}, {"CSRGenerationInterval", number(60)}}, {}, 50},
        {"a request from the future", {{kRequested, in(10)}}, {}, 0},
        {"an old server's record", {{kNextCheck, in(40)}}, entry, {}},
        {"a record", {{kNextCheck, in(40)}}, entry, 40, true},
        {"a record, no date", {{kIdentifier, "v"}}, entry, {}, true},
        {"no record", {}, entry, 0, true},
    };
    for (const Case& each : cases) {
        const bool isNewServer = each.isNewServer;
        server_.answer("authenticate",
                       Dictionary{{"encDsId", "d1"}, {"Version", Value::int32(isNewServer ? 101 : 100)}});
        __VeltoIDDoVerifyPassword("somebody", kPassword, {});
        ASSERT_EQ(__VeltoIDSessionGetServerVersion(), isNewServer ? 101 : 100);
        __VeltoIDDBRemoveVeltoIDAccount(kName);
        createAccount("d1");
        setValue("Dirty", {});
        setValues(each.values);
        __VeltoIDDBRemoveCertificateInfo("d1");
        if (each.entry) {
            __VeltoIDDBSetCertificateInfo("d1", std::nullopt);
            for (const auto& [key, value] : *each.entry)
                __VeltoIDDBSetCertificateValue("d1", key, value, false);
        }
        std::optional<double> next = -1;
        EXPECT_TRUE(copyNextActionDateForAccount(kName, &next)) << each.what;
        EXPECT_EQ(next ? Value::date(*next) : Value(), each.next ? date(*each.next) : Value()) << each.what;
    }
    __VeltoIDDBSetMetaInfoValue(nullptr, "AccountValidationInterval", number(100));
    setValue("ValidationDate", date(-30));
    setValue(kIdentifier, "v");
    std::optional<double> next;
    EXPECT_TRUE(copyNextActionDateForAccount(kName, &next));
    EXPECT_EQ(next, now() + 70);
    EXPECT_FALSE(copyNextActionDateForAccount("nobody", &next));
    EXPECT_EQ(next, std::nullopt);
    ASSERT_TRUE(__VeltoIDDBRemovePassword(kName));
    EXPECT_FALSE(copyNextActionDateForAccount(kName, &next)) << "without a password nothing can be done";
}

}  // namespace
}  // namespace veltoid
