#include "VeltoIDXMLServerCommunications/SignIn.h"

#include <thread>

#include "TestSupport/FakeIdentityServer.h"

namespace veltoid {
namespace {

const Value kOutOfDate =
    "The client on this machine is out of date and can not talk with the Velto ID server.";

class SignInTest : public ServerTest {
  protected:
    struct Outcome {
        Session session;
        String encDsId = "left over";
        std::optional<Dictionary> result = Dictionary{{"left", "over"}};
        std::optional<Error> error;

        int64_t code() const { return error ? error->code : 0; }
    };

    static Outcome signIn(const Dictionary& options = {}, const char* password = kPassword) {
        Outcome outcome;
        outcome.session = __VeltoIDSessionDoCreateSession(kName, password, options, &outcome.encDsId,
                                                          &outcome.result, &outcome.error);
        return outcome;
    }

    /// Signs in anew with this reply; whether it worked does not matter.
    Outcome signInWith(const Dictionary& reply) {
        server_.answer("authenticate", reply);
        return signIn({{"DoNotUseCachedSession", flag(true)}});
    }

    static std::string counts() {
        std::string text;
        for (const char* key : {"VeltoIDMetaConnectionAttemptCount", "VeltoIDXMLAuthenticateCount",
                                "VeltoIDXMLSessionReusedCount", "VeltoIDMetaSuccessfulConnectionCount",
                                "VeltoIDMetaUnsuccessfulConnectionCount"})
            text += std::to_string(count(key)) + " ";
        return text;
    }
};

TEST_F(SignInTest, ASignInYieldsASession) {
    createAccount("d1");
    const Dictionary reply = {{"encDsId", "d1"}, {"dsSession", "s1"}, {"Version", Value::int32(101)}};
    EXPECT_EQ(__VeltoIDSessionGetServerVersion(), 0);
    const Outcome outcome = signInWith(reply);
    ASSERT_NE(outcome.session, nullptr);
    EXPECT_EQ(outcome.encDsId, "d1");
    EXPECT_EQ(outcome.result, reply);
    EXPECT_EQ(outcome.error, std::nullopt);
    EXPECT_EQ(outcome.session->fSessionID, "s1");
    EXPECT_EQ(outcome.session->fEncDsId, "d1");
    EXPECT_EQ(outcome.session->fAccountName, kName);
    EXPECT_EQ(outcome.session->fPasswordHash, kPassword);
    EXPECT_EQ(outcome.session->fServerURL, "https://identity.velto.example/dsservices/dsxmlrpc");
    EXPECT_EQ(outcome.session->fCreated, now());
    EXPECT_EQ(outcome.session->fValidityDuration, 0);
    EXPECT_EQ(__VeltoIDSessionGetServerVersion(), 101);
    EXPECT_EQ(counts(), "1 1 0 1 0 ");
    EXPECT_EQ(meta("LastConnectAttempt"), date());
    EXPECT_EQ(meta("LastSuccessfulConnect"), date());
    signInWith({{"encDsId", "d1"}});
    EXPECT_EQ(__VeltoIDSessionGetServerVersion(), 0) << "a reply without version";
}

TEST_F(SignInTest, TellsTheServerWhoIsCalling) {
    __VeltoIDDBSetMetaInfoValue(nullptr, "UserUUID", "U");
    signInWith({{"encDsId", "d1"}});
    auto calls = server_.take();
    ASSERT_EQ(calls.size(), 1U);
    const Dictionary unknown = calls[0].parameters;
    EXPECT_EQ(unknown["veltoConnect"], Value(kName));
    EXPECT_EQ(unknown["pwdHash"], Value(kPassword));
    EXPECT_EQ(unknown["UserUUID"], Value("U"));
    EXPECT_EQ(unknown["ClientDateTime"], date());
    EXPECT_FALSE(unknown.contains("dsSession"));

    createAccount("d1");
    const std::set<std::string> before = keysOf(unknown);
    const auto added = [&] {
        signInWith({{"encDsId", "d1"}});
        Dictionary sent = server_.take().at(0).parameters;
        for (const std::string& key : before) sent.remove(key);
        return sent;
    };
    const Value uuid = record()["AccountUUID"];
    const Value stable = record()["AccountStableUUID"];
    EXPECT_EQ(added(),
              (Dictionary{{"AccountUUID", uuid}, {"machineUUID", uuid}, {"AccountStableUUID", stable}}));
    setValue("VeltoIDAccountValidationRecordIdentifierKey", "v1");
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"SerialNumber", "7"}});
    EXPECT_EQ(added(), (Dictionary{{"AccountUUID", uuid},
                                   {"machineUUID", uuid},
                                   {"AccountStableUUID", stable},
                                   {"ClientVIDVRecordIdentifier", "v1"},
                                   {"CertificateSerialNumber", "7"}}));
    for (const char* key : {"AccountUUID", "AccountStableUUID", "encDsId"}) setValue(key, number(1));
    setValue("VeltoIDAccountValidationRecordIdentifierKey", number(1));
    __VeltoIDDBSetMetaInfoValue(nullptr, "UserUUID", number(1));
    EXPECT_EQ(added(), Dictionary()) << "values of the wrong kind are not sent";
}

TEST_F(SignInTest, TheNearestServerURLIsCalled) {
    createAccount();
    server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
    const auto called = [&](const Value& option = {}) {
        signIn({{"ServerURL", option}, {"DoNotUseCachedSession", flag(true)}});
        const auto calls = server_.take();
        return calls.empty() ? "none" : calls[0].url;
    };
    EXPECT_EQ(called(), "https://identity.velto.example/dsservices/dsxmlrpc");
    __VeltoIDDBSetMetaInfoValue(nullptr, "ServerURL", "https://meta.example");
    EXPECT_EQ(called(), "https://meta.example");
    setValue("ServerURL", "https://record.example");
    EXPECT_EQ(called(), "https://record.example");
    EXPECT_EQ(called("https://option.example"), "https://option.example");
    EXPECT_EQ(called(Value::url("https://url.example")), "https://url.example");
    EXPECT_EQ(called(number(5)), "https://record.example");
}

TEST_F(SignInTest, ReusesASessionWhileItIsValid) {
    createAccount();
    server_.answer("authenticate", Dictionary{{"encDsId", "d1"}, {"dsSessionValidityDuration", number(100)}});
    const auto callsOf = [&](const Dictionary& options, const char* password = kPassword) {
        Outcome outcome = signIn(options, password);
        EXPECT_NE(outcome.session, nullptr);
        EXPECT_EQ(outcome.encDsId, "d1");
        const size_t calls = server_.take().size();
        EXPECT_EQ(outcome.result.has_value(), calls > 0);
        return calls;
    };
    EXPECT_EQ(callsOf({}), 1U);
    clock_.advanceBy(50);
    EXPECT_EQ(callsOf({}), 0U);
    EXPECT_EQ(counts(), "1 1 1 2 0 ");
    EXPECT_EQ(meta("LastConnectAttempt"), date()) << "a reused session counts as a connection";
    EXPECT_EQ(callsOf({{"ServerURL", "https://other.example"}}), 1U);
    EXPECT_EQ(callsOf({}, "another password"), 1U);
    setValue("ClientTooOld", flag(true));
    EXPECT_EQ(callsOf({}), 0U) << "the server is not contacted";
    setValue("ClientTooOld", {});
    EXPECT_EQ(callsOf({{"DoNotUseCachedSession", flag(true)}}), 1U);
    clock_.advanceBy(100);
    EXPECT_EQ(callsOf({}), 1U);
}

TEST_F(SignInTest, TheServerIsLeftAloneWhileItMustBe) {
    createAccount();
    server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
    struct Case {
        const char* what;
        Value tooOld;
        Value embargo;
        int64_t code;
    };
    const Case cases[] = {
        {"nothing", {}, {}, 0},
        {"too old", flag(true), {}, -104},
        {"not too old", flag(false), {}, 0},
        {"too old, but no Boolean", number(1), {}, 0},
        {"embargo", {}, date(10), -103},
        {"embargo is over", {}, date(-1), 0},
        {"embargo ends now", {}, date(), 0},
        {"embargo that is no date", {}, "tomorrow", 0},
        {"both", flag(true), date(10), -104},
    };
    for (const Case& each : cases) {
        setValue("ClientTooOld", each.tooOld);
        setValue("EarliestAllowedConnectionDate", each.embargo);
        const Outcome outcome = signIn();
        EXPECT_EQ(outcome.session != nullptr, each.code == 0) << each.what;
        EXPECT_EQ(outcome.code(), each.code) << each.what;
        EXPECT_EQ(server_.take().size(), each.code == 0 ? 1U : 0U) << each.what;
        EXPECT_EQ(outcome.error && outcome.error->userInfo[kErrorFailureReasonKey] == kOutOfDate,
                  each.code == -104)
            << each.what;
    }
    EXPECT_EQ(counts(), "6 6 0 6 3 ");
    EXPECT_EQ(log_.count("Not connecting to VeltoID authentication server because clientTooOld = true"), 2);
    EXPECT_EQ(log_.count("there is an earliest-allowed-connection-date set for this account " +
                         std::string(kName) + ", "),
              1);
    EXPECT_FALSE(log_.contains("Didn't succeed with .authenticate"));
}

TEST_F(SignInTest, AnEmbargoInTheReplyHoldsForTheNextSignIn) {
    constexpr const char* kBefore = "DoNotConnectBeforeX";
    constexpr const char* kFor = "DoNotConnectForX";
    struct Case {
        const char* what;
        Dictionary reply;
        /// Seconds from now.
        std::optional<double> embargo;
    };
    const Case cases[] = {
        {"for some time", {{kFor, Value::int32(600)}}, 600},
        {"for no time", {{kFor, Value::int32(0)}}, {}},
        {"until a date", {{kBefore, date(50)}}, 50},
        {"until a past date", {{kBefore, date(-50)}}, {}},
        {"the date comes first", {{kBefore, date(50)}, {kFor, Value::int32(5)}}, 50},
        {"a past date, too", {{kBefore, date(-50)}, {kFor, Value::int32(5)}}, {}},
        {"a date in words", {{kBefore, "2100-01-01T00:00:00Z"}}, 4'102'444'800 - now()},
        {"no date", {{kBefore, "soon"}, {kFor, Value::int32(5)}}, 5},
    };
    createAccount();
    for (const Case& each : cases) {
        setValue("EarliestAllowedConnectionDate", {});
        Dictionary reply = each.reply;
        reply.set("encDsId", "d1");
        const Outcome outcome = signInWith(reply);
        EXPECT_NE(outcome.session, nullptr) << each.what;
        EXPECT_EQ(outcome.error, std::nullopt) << each.what;
        EXPECT_EQ(record()["EarliestAllowedConnectionDate"], each.embargo ? date(*each.embargo) : Value())
            << each.what;
        EXPECT_EQ(signIn().code(), each.embargo ? -103 : 0) << each.what;
    }
    setValue("EarliestAllowedConnectionDate", {});
    EXPECT_NE(signInWith({{"encDsId", "d1"}, {"ClientTooOld", flag(true)}}).session, nullptr);
    EXPECT_EQ(record()["ClientTooOld"], flag(true));
    EXPECT_EQ(signIn().code(), -104);
}

TEST_F(SignInTest, Failures) {
    struct Case {
        const char* what;
        std::function<void()> prepare;
        int64_t code;
        bool keepsPassword;
    };
    const auto answers = [this](const Value& reply) {
        return [this, reply] { server_.answer("authenticate", reply); };
    };
    const auto faults = [this](int64_t code) {
        return [this, code] { server_.fault("authenticate", code); };
    };
    const Case cases[] = {
        {"wrong password", faults(-20101), -101, false},
        {"disabled", faults(-20209), -102, false},
        {"another fault", faults(-5), -100, true},
        {"no server", [this] { server_.refuse("authenticate", 503); }, -100, true},
        {"no encDsId", answers(Dictionary{{"dsSession", "s"}}), -104, true},
        {"an encDsId of the wrong kind", answers(Dictionary{{"encDsId", Value::int32(1)}}), -104, true},
        {"no encDsId under embargo", answers(Dictionary{{"DoNotConnectForX", Value::int32(9)}}), -103, true},
        {"no encDsId, too old", answers(Dictionary{{"ClientTooOld", flag(true)}}), -103, true},
        {"no dictionary", answers("hello"), 1, true},
    };
    int64_t failures = 0;
    for (const Case& each : cases) {
        createAccount();
        setValue("EarliestAllowedConnectionDate", {});
        setValue("ClientTooOld", {});
        each.prepare();
        const Outcome outcome = signIn();
        EXPECT_EQ(outcome.session, nullptr) << each.what;
        EXPECT_EQ(outcome.encDsId, String()) << each.what;
        EXPECT_EQ(outcome.result, std::nullopt) << each.what;
        EXPECT_EQ(outcome.code(), each.code) << each.what;
        EXPECT_EQ(outcome.error->domain, kIdentityErrorDomain) << each.what;
        EXPECT_EQ(hasPassword(), each.keepsPassword) << each.what;
        EXPECT_EQ(count("VeltoIDMetaUnsuccessfulConnectionCount"), ++failures) << each.what;
    }
    EXPECT_EQ(counts(), "9 5 0 0 9 ");
    EXPECT_EQ(log_.count("Didn't succeed with .authenticate, and error is "), 9);
    EXPECT_TRUE(meta("LastConnectAttempt").isAbsent());
    EXPECT_FALSE(log_.contains(kPassword));
}

TEST_F(SignInTest, AnotherEncDsIdMakesCertificatesAndRecordVoid) {
    createAccount("old");
    setValue("VeltoIDAccountValidationRecordIdentifierKey", "v1");
    for (const char* encDsId : {"old", "new"})
        __VeltoIDDBSetCertificateInfo(encDsId,
                                      Dictionary{{"CertStatus", "CERT_ISSUED"}, {"Expires", date(1e6)}});
    signInWith({{"encDsId", "old"}});
    EXPECT_EQ(certificateEntry("old")["CertStatus"], Value("CERT_ISSUED"));
    EXPECT_TRUE(record().contains("VeltoIDAccountValidationRecordIdentifierKey"));

    EXPECT_EQ(signInWith({{"encDsId", "new"}}).encDsId, "new");
    EXPECT_EQ(
        log_.count("Got back a different encDSID for our account, \"new\" vs \"old\" so disabling the certs "
                   "and VeltoIDValidationRecord on this account."),
        1);
    for (const char* encDsId : {"old", "new"})
        EXPECT_EQ(certificateEntry(encDsId)["CertStatus"], Value("CERTIFICATE_INVALID")) << encDsId;
    EXPECT_EQ(certificateEntry("new")["Expires"], date());
    EXPECT_EQ(certificateEntry("old")["Expires"], date(1e6));
    EXPECT_FALSE(record().contains("VeltoIDAccountValidationRecordIdentifierKey"));
}

TEST_F(SignInTest, TheServersWordOnTheCertificate) {
    constexpr const char* kIsValid = "CertificateIsValid";
    constexpr const char* kIsNotValid = "CertificateNoLongerValid";
    struct Case {
        const char* what;
        Dictionary reply;
        bool isValidated;
        bool isInvalid;
    };
    const Case cases[] = {
        {"no word", {}, false, false},
        {"valid", {{kIsValid, flag(true)}}, true, false},
        {"valid anyway", {{kIsValid, flag(true)}, {kIsNotValid, "x"}}, true, false},
        {"not valid", {{kIsValid, flag(false)}}, false, true},
        {"valid in the wrong kind", {{kIsValid, "true"}}, false, true},
        {"no longer valid", {{kIsNotValid, flag(false)}}, false, true},
    };
    createAccount("d1");
    for (const Case& each : cases) {
        __VeltoIDDBRemoveCertificateInfo("d1");
        __VeltoIDDBSetCertificateInfo("d1",
                                      Dictionary{{"CertStatus", "CERT_ISSUED"}, {"Expires", date(1e6)}});
        Dictionary reply = each.reply;
        reply.set("encDsId", "d1");
        signInWith(reply);
        const Dictionary entry = certificateEntry("d1");
        EXPECT_EQ(entry["LastSuccessfulValidation"], each.isValidated ? date() : Value()) << each.what;
        EXPECT_EQ(entry["CertStatus"], Value(each.isInvalid ? "CERTIFICATE_INVALID" : "CERT_ISSUED"))
            << each.what;
        EXPECT_EQ(entry["Expires"], each.isInvalid ? date() : date(1e6)) << each.what;
    }
}

TEST_F(SignInTest, AnotherValidationRecordIsFetchedAgain) {
    struct Case {
        Value stored;
        Value given;
        bool isDropped;
    };
    const Case cases[] = {{"v1", "v1", false},
                          {"v1", "v2", true},
                          {{}, "v2", true},
                          {"v1", {}, false},
                          {"v1", Value::int32(5), false}};
    createAccount("d1");
    for (const Case& each : cases) {
        setValue("VeltoIDAccountValidationRecordIdentifierKey", each.stored);
        setValue("VeltoIDAccountValidationRecordNextCheckDateKey", date(100));
        signInWith({{"encDsId", "d1"}, {"VeltoIDRecordIdentifier", each.given}});
        EXPECT_EQ(record()["VeltoIDAccountValidationRecordIdentifierKey"],
                  each.isDropped ? Value() : each.stored);
        EXPECT_EQ(record().contains("VeltoIDAccountValidationRecordNextCheckDateKey"), !each.isDropped)
            << testing::PrintToString(each.stored) << testing::PrintToString(each.given);
    }
}

TEST_F(SignInTest, SignInsOfOneAccountDoNotOverlapAndThoseOfOthersDo) {
    server_.answer("authenticate", Dictionary{{"encDsId", "d1"}, {"dsSessionValidityDuration", number(100)}});
    std::vector<std::thread> threads;
    for (int i = 0; i < 6; ++i) {
        threads.emplace_back([i] {
            const String name = i % 2 == 0 ? "even" : "odd";
            for (int round = 0; round < 10; ++round)
                (void)__VeltoIDSessionDoCreateSession(name, kPassword, {});
        });
    }
    for (std::thread& thread : threads) thread.join();
    for (const char* name : {"even", "odd"}) {
        const auto counted = [&](const char* key) { return meta(key, name).asInt64().value_or(0); };
        EXPECT_EQ(counted("VeltoIDXMLAuthenticateCount") + counted("VeltoIDXMLSessionReusedCount"), 30)
            << name;
        EXPECT_EQ(counted("VeltoIDMetaSuccessfulConnectionCount"), 30) << name;
    }
}

}  // namespace
}  // namespace veltoid
