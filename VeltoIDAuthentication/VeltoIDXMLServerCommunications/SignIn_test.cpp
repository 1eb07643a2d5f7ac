#include "VeltoIDXMLServerCommunications/SignIn.h"

#include "TestSupport/FakeIdentityServer.h"
#include "TestSupport/SideBySide.h"
#include "Values/DictionaryAccess.h"

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
        return signIn({{"DoNotUseCachedSession", kOn}});
    }

    /// As that, with the encDsId "d1" besides.
    Outcome signInTold(const Dictionary& commands) {
        return signInWith(*mergeDictionaries(commands, Dictionary{{"encDsId", "d1"}}, true));
    }

    static void setTooOld(const Value& isTooOld) {
        setValue("ClientTooOld", isTooOld);
        setValue("ClientTooOldVersion", Value::real(kVeltoIDDBAccessorVersion));
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
    const auto calls = server_.take();
    ASSERT_EQ(calls.size(), 1U);
    const Dictionary unknown = calls[0].parameters;
    for (const auto& [key, value] : {std::pair("veltoConnect", Value(kName)),
                                     {"pwdHash", kPassword},
                                     {"UserUUID", "U"},
                                     {"ClientDateTime", date()},
                                     {"dsSession", {}}})
        EXPECT_EQ(unknown[key], value) << key;

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
    Dictionary expected = {{"AccountUUID", uuid}, {"machineUUID", uuid}, {"AccountStableUUID", stable}};
    EXPECT_EQ(added(), expected);
    setValue(kIdentifier, "v1");
    __VeltoIDDBSetCertificateInfo("d1", Dictionary{{"SerialNumber", "7"}});
    expected.set("ClientVIDVRecordIdentifier", "v1");
    expected.set("CertificateSerialNumber", "7");
    EXPECT_EQ(added(), expected);
    for (const char* key : {"AccountUUID", "AccountStableUUID", "encDsId"}) setValue(key, number(1));
    setValue(kIdentifier, number(1));
    __VeltoIDDBSetMetaInfoValue(nullptr, "UserUUID", number(1));
    EXPECT_EQ(added(), Dictionary()) << "values of the wrong kind are not sent";
}

TEST_F(SignInTest, TheNearestServerURLIsCalled) {
    createAccount();
    server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
    const auto called = [&](const Value& option = {}) {
        signIn({{"ServerURL", option}, {"DoNotUseCachedSession", kOn}});
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
    EXPECT_EQ(meta("LastConnectAttempt"), date(-50)) << "a reused session is no contact with the server";
    EXPECT_EQ(callsOf({{"ServerURL", "https://other.example"}}), 1U);
    EXPECT_EQ(callsOf({}, "another password"), 1U);
    setTooOld(kOn);
    EXPECT_EQ(callsOf({}), 0U) << "the server is not contacted";
    setValue("ClientTooOld", {});
    EXPECT_EQ(callsOf({{"DoNotUseCachedSession", kOn}}), 1U);
    clock_.advanceBy(100);
    EXPECT_EQ(callsOf({}), 1U);
}

TEST_F(SignInTest, TheServerIsLeftAloneWhileItMustBe) {
    createAccount();
    server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
    const std::tuple<const char*, Value, Value, int64_t> cases[] = {
        {"nothing", {}, {}, 0},
        {"too old", kOn, {}, -104},
        {"not too old", kOff, {}, 0},
        {"too old, but no Boolean", number(1), {}, 0},
        {"embargo", {}, date(10), -103},
        {"embargo is over", {}, date(-1), 0},
        {"embargo ends now", {}, date(), 0},
        {"embargo that is no date", {}, "tomorrow", 0},
        {"both", kOn, date(10), -104},
    };
    for (const auto& [what, tooOld, embargo, code] : cases) {
        SCOPED_TRACE(what);
        setTooOld(tooOld);
        setValue(kEmbargo, embargo);
        const Outcome outcome = signIn();
        EXPECT_EQ(outcome.session != nullptr, code == 0);
        EXPECT_EQ(outcome.code(), code);
        EXPECT_EQ(server_.take().size(), code == 0 ? 1U : 0U);
        EXPECT_EQ(outcome.error && outcome.error->userInfo[kErrorFailureReasonKey] == kOutOfDate,
                  code == -104);
    }
    EXPECT_EQ(counts(), "6 6 0 6 3 ");
    EXPECT_EQ(log_.count("Not connecting to VeltoID authentication server because clientTooOld = true"), 2);
    const std::string embargo = "there is an earliest-allowed-connection-date set for this account ";
    EXPECT_EQ(log_.count(embargo + kName + ", "), 1);
    EXPECT_FALSE(log_.contains("Didn't succeed with .authenticate"));
}

TEST_F(SignInTest, AnEmbargoInTheReplyHoldsForTheNextSignIn) {
    constexpr const char* kBefore = "DoNotConnectBeforeX";
    constexpr const char* kFor = "DoNotConnectForX";
    const struct {
        const char* what;
        Dictionary commands;
        /// Seconds from now.
        std::optional<double> embargo;
    } cases[] = {
        {"for some time", {{kFor, Value::int32(600)}}, 600},
        {"for no time", {{kFor, Value::int32(0)}}, {}},
        {"until a date", {{kBefore, date(50)}}, 50},
        {"until a past date", {{kBefore, date(-50)}}, {}},
        {"the date comes first", {{kBefore, date(50)}, {kFor, Value::int32(5)}}, 50},
        {"a past date, too", {{kBefore, date(-50)}, {kFor, Value::int32(5)}}, {}},
        {"a date in words", {{kBefore, "2025-06-20T00:00:00Z"}}, 1'750'377'600 - now()},
        {"a date that nobody believes", {{kBefore, "2100-01-01T00:00:00Z"}}, 14 * kDay},
        {"no date", {{kBefore, "soon"}, {kFor, Value::int32(5)}}, 5},
    };
    createAccount();
    for (const auto& [what, commands, embargo] : cases) {
        SCOPED_TRACE(what);
        setValue(kEmbargo, {});
        const Outcome outcome = signInTold(commands);
        EXPECT_NE(outcome.session, nullptr);
        EXPECT_EQ(outcome.error, std::nullopt);
        EXPECT_EQ(record()[kEmbargo], embargo ? date(*embargo) : Value());
        EXPECT_EQ(signIn().code(), embargo ? -103 : 0);
    }
    setValue(kEmbargo, {});
    EXPECT_NE(signInTold({{"ClientTooOld", kOn}}).session, nullptr);
    EXPECT_EQ(record()["ClientTooOld"], kOn);
    EXPECT_EQ(signIn().code(), -104);
}

TEST_F(SignInTest, ATooOldClientIsOneOfThisVersionUntilTheAccountIsAddedAgain) {
    createAccount();
    server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
    for (const Value& version : {Value(), Value::real(700), Value("727.8")}) {
        setValues({{"ClientTooOld", kOn}, {"ClientTooOldVersion", version.isAbsent() ? kGone : version}});
        EXPECT_EQ(signIn().code(), 0) << testing::PrintToString(version);
    }
    signInTold({{"ClientTooOld", kOn}});
    EXPECT_EQ(signIn().code(), -104);
    ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount(kName, nullptr, "d1"));
    EXPECT_EQ(signIn().code(), -104) << "nobody has given the password again";
    createAccount();
    EXPECT_EQ(signIn().code(), 0);
}

TEST_F(SignInTest, Failures) {
    const auto answers = [this](const Value& reply) {
        return [this, reply] { server_.answer("authenticate", reply); };
    };
    const auto faults = [this](int64_t code) {
        return [this, code] { server_.fault("authenticate", code); };
    };
    const auto yields = [this](const platform::FakeHTTPAnswer& answer) {
        return [this, answer] { server_.set("authenticate", answer); };
    };
    constexpr const char* kRefuses = "The server refuses this version of the agent";
    constexpr const char* kNoIdentifier = "The server's answer to the sign-in lacks the account's encDsId";
    constexpr const char* kNoAnswer = "The server's answer cannot be understood";
    const struct {
        const char* what;
        std::function<void()> prepare;
        int64_t code;
        bool keepsPassword;
        const char* text;
    } cases[] = {
        {"wrong password", faults(-20101), -101, false, "The Velto ID account or password are incorrect."},
        {"disabled", faults(-20209), -102, false, "This Velto ID has been disabled for security reasons."},
        {"another fault", faults(-5), -100, true, "The server answered with the fault -5: because"},
        {"a status", yields({503}), -100, true, "The server did not answer, or not with success"},
        {"no server", yields({.status = 0, .error = platform::HTTPError{7, "no connection"}}), -100, true,
         "The server cannot be reached: no connection"},
        {"closed", yields({.status = 0, .error = platform::HTTPError{52, "empty"}}), -100, true,
         "The server closed the connection without an answer: empty"},
        {"no encDsId", answers(Dictionary{{"dsSession", "s"}}), -104, true, kNoIdentifier},
        {"an encDsId of the wrong kind", answers(Dictionary{{"encDsId", Value::int32(1)}}), -104, true,
         kNoIdentifier},
        {"no encDsId under embargo", answers(Dictionary{{"DoNotConnectForX", Value::int32(9)}}), -103, true,
         "The server has asked not to be contacted for a while"},
        {"no encDsId, too old", answers(Dictionary{{"ClientTooOld", kOn}}), -103, true, kRefuses},
        {"no dictionary", answers("hello"), 1, true, kNoAnswer},
        {"no XML-RPC", yields({200, "<html>Welcome"}), 1, true, kNoAnswer},
    };
    int64_t failures = 0;
    for (const auto& [what, prepare, code, keepsPassword, text] : cases) {
        SCOPED_TRACE(what);
        createAccount();
        setValue(kEmbargo, {});
        setValue("ClientTooOld", {});
        prepare();
        const Outcome outcome = signIn();
        EXPECT_EQ(outcome.session, nullptr);
        EXPECT_EQ(outcome.encDsId, String());
        EXPECT_EQ(outcome.result, std::nullopt);
        EXPECT_EQ(outcome.code(), code);
        EXPECT_EQ(outcome.error->domain, kIdentityErrorDomain);
        const Dictionary& said = outcome.error->userInfo;
        EXPECT_EQ(said[code == -101 || code == -102 ? kErrorFailureReasonKey : kErrorDescriptionKey],
                  Value(text));
        EXPECT_TRUE(said.contains("function") && said.contains("file") && said.contains("line"));
        EXPECT_NE(log_.lines().back().text.find(text), std::string::npos);
        EXPECT_EQ(hasPassword(), keepsPassword);
        EXPECT_EQ(count("VeltoIDMetaUnsuccessfulConnectionCount"), ++failures);
    }
    EXPECT_EQ(counts(), "12 6 0 0 12 ");
    EXPECT_EQ(log_.count("Didn't succeed with .authenticate, and error is "), 12);
    EXPECT_TRUE(meta("LastConnectAttempt").isAbsent());
    EXPECT_FALSE(log_.contains(kPassword));
}

TEST_F(SignInTest, AnotherEncDsIdMakesCertificatesAndRecordVoid) {
    createAccount("old");
    setValue(kIdentifier, "v1");
    for (const char* encDsId : {"old", "new"})
        __VeltoIDDBSetCertificateInfo(encDsId,
                                      Dictionary{{"CertStatus", "CERT_ISSUED"}, {"Expires", date(1e6)}});
    signInWith({{"encDsId", "old"}});
    EXPECT_EQ(certificateEntry("old")["CertStatus"], Value("CERT_ISSUED"));
    EXPECT_TRUE(record().contains(kIdentifier));

    EXPECT_EQ(signInWith({{"encDsId", "new"}}).encDsId, "new");
    EXPECT_EQ(
        log_.count("Got back a different encDSID for our account, \"new\" vs \"old\" so disabling the certs "
                   "and VeltoIDValidationRecord on this account."),
        1);
    for (const char* encDsId : {"old", "new"})
        EXPECT_EQ(certificateEntry(encDsId)["CertStatus"], Value("CERTIFICATE_INVALID")) << encDsId;
    EXPECT_EQ(certificateEntry("new")["Expires"], date());
    EXPECT_EQ(certificateEntry("old")["Expires"], date(1e6));
    EXPECT_FALSE(record().contains(kIdentifier));
}

TEST_F(SignInTest, TheServersWordOnTheCertificate) {
    constexpr const char* kIsValid = "CertificateIsValid";
    constexpr const char* kIsNotValid = "CertificateNoLongerValid";
    const std::tuple<const char*, Dictionary, bool, bool> cases[] = {
        {"no word", {}, false, false},
        {"valid", {{kIsValid, kOn}}, true, false},
        {"valid anyway", {{kIsValid, kOn}, {kIsNotValid, "x"}}, true, false},
        {"not valid", {{kIsValid, kOff}}, false, true},
        {"valid in the wrong kind", {{kIsValid, "true"}}, false, true},
        {"no longer valid", {{kIsNotValid, kOff}}, false, true},
    };
    createAccount("d1");
    for (const auto& [what, commands, isValidated, isInvalid] : cases) {
        SCOPED_TRACE(what);
        __VeltoIDDBRemoveCertificateInfo("d1");
        __VeltoIDDBSetCertificateInfo("d1",
                                      Dictionary{{"CertStatus", "CERT_ISSUED"}, {"Expires", date(1e6)}});
        signInTold(commands);
        const Dictionary entry = certificateEntry("d1");
        EXPECT_EQ(entry["LastSuccessfulValidation"], isValidated ? date() : Value());
        EXPECT_EQ(entry["CertStatus"], Value(isInvalid ? "CERTIFICATE_INVALID" : "CERT_ISSUED"));
        EXPECT_EQ(entry["Expires"], isInvalid ? date() : date(1e6));
    }
}

TEST_F(SignInTest, AnotherValidationRecordIsFetchedAgain) {
    const std::tuple<Value, Value, bool> cases[] = {{"v1", "v1", false},
                                                    {"v1", "v2", true},
                                                    {{}, "v2", true},
                                                    {"v1", {}, false},
                                                    {"v1", Value::int32(5), false}};
    createAccount("d1");
    for (const auto& [stored, given, isDropped] : cases) {
        setValue(kIdentifier, stored);
        setValue(kNextCheck, date(100));
        signInWith({{"encDsId", "d1"}, {"VeltoIDRecordIdentifier", given}});
        EXPECT_EQ(record()[kIdentifier], isDropped ? Value() : stored);
        EXPECT_EQ(record().contains(kNextCheck), !isDropped)
            << testing::PrintToString(stored) << testing::PrintToString(given);
    }
}

TEST_F(SignInTest, TheServersVersionIsKnownAfterARestart) {
    createAccount();
    signInWith({{"encDsId", "d1"}, {"Version", Value::int32(101)}});
    __VeltoIDDBSynchronize();
    platform::TestLifetime::restart();
    __VeltoIDDBSetUsePreferences(true);
    EXPECT_EQ(__VeltoIDSessionGetServerVersion(), 101);
}

TEST_F(SignInTest, SignInsOfOneAccountDoNotOverlapAndThoseOfOthersDo) {
    server_.answer("authenticate", Dictionary{{"encDsId", "d1"}, {"dsSessionValidityDuration", number(100)}});
    for (const char* name : {"even", "odd"}) __VeltoIDDBCreateVeltoIDAccount(name, kPassword, nullptr);
    platform::sideBySide(6, [](int i) {
        const String name = i % 2 == 0 ? "even" : "odd";
        for (int round = 0; round < 10; ++round) (void)__VeltoIDSessionDoCreateSession(name, kPassword, {});
    });
    for (const char* name : {"even", "odd"}) {
        const auto counted = [&](const char* key) { return meta(key, name).asInt64().value_or(0); };
        EXPECT_EQ(counted("VeltoIDXMLAuthenticateCount") + counted("VeltoIDXMLSessionReusedCount"), 30)
            << name;
        EXPECT_EQ(counted("VeltoIDMetaSuccessfulConnectionCount"), 30) << name;
    }
}

}  // namespace
}  // namespace veltoid
