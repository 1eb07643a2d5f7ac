#include "VeltoIDXMLServerCommunications/Session.h"

#include "Platform/runtime/SystemVersion.h"
#include "TestSupport/FakeIdentityServer.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"

namespace veltoid {
namespace {

constexpr const char* kURL = "https://server.example/rpc";

class SessionTest : public ServerTest {
  protected:
    Session session(double age = 0, double validity = 100, const String& encDsId = "d1",
                    const String& id = "s") const {
        return Session(new VeltoIDAuthenticationSessionInfo{kName, kPassword, kURL, id, now() - age, validity,
                                                            encDsId, copySessionQueueForAccount(kName)});
    }

    static std::string takeID() {
        const IdleSession taken = takeCachedSession(kName, kPassword, kURL);
        return taken ? taken->fSessionID.text() : "none";
    }
};

TEST_F(SessionTest, EachAccountHasOneQueue) {
    const auto queue = copySessionQueueForAccount("a");
    EXPECT_EQ(queue.label(), "queue.session.");
    EXPECT_TRUE(queue == copySessionQueueForAccount(String("a")));
    EXPECT_FALSE(queue == copySessionQueueForAccount("A"));
}

TEST_F(SessionTest, IsKeptWhileTheServerLetsItBeReused) {
    struct Case {
        const char* what;
        double age;
        double validity;
        const char* encDsId;
        bool isKept;
    };
    const Case cases[] = {
        {"new", 0, 100, "d", true},
        {"at the last moment", 99.5, 100, "d", true},
        {"over", 100, 100, "d", false},
        {"no validity", 0, 0, "d", false},
        {"from the future", -1, 100, "d", false},
        {"without encDsId", 0, 100, nullptr, false},
        {"spoiled", now(), 1e12, "d", false},
    };
    for (const Case& each : cases) {
        (void)session(each.age, each.validity, each.encDsId ? String(each.encDsId) : String());
        EXPECT_EQ(takeID(), each.isKept ? "s" : "none") << each.what;
        EXPECT_EQ(takeID(), "none") << each.what;
    }
}

TEST_F(SessionTest, IsFoundByAccountPasswordAndServer) {
    (void)session();
    EXPECT_EQ(takeCachedSession("other", kPassword, kURL), nullptr);
    EXPECT_EQ(takeCachedSession(kName, "other", kURL), nullptr);
    EXPECT_EQ(takeCachedSession(kName, kPassword, "other"), nullptr);
    EXPECT_EQ(takeCachedSession(nullptr, kPassword, kURL), nullptr);
    EXPECT_EQ(takeCachedSession(kName, nullptr, kURL), nullptr);
    EXPECT_EQ(takeCachedSession(kName, kPassword, nullptr), nullptr);
    EXPECT_EQ(takeID(), "s");
}

TEST_F(SessionTest, TheOldestThatIsStillValidComesFirst) {
    (void)session(0, 10, "d", "short");
    (void)session(0, 100, "d", "first");
    (void)session(0, 100, "d", "second");
    clock_.advanceBy(20);
    IdleSession first = takeCachedSession(kName, kPassword, kURL);
    ASSERT_NE(first, nullptr);
    EXPECT_EQ(first->fSessionID, "first");
    EXPECT_EQ(takeID(), "second");
    clock_.advanceBy(70);
    (void)Session(first.release());
    clock_.advanceBy(20);
    EXPECT_EQ(takeID(), "none") << "use does not prolong it";
}

// --- Calls and the commands in their replies

TEST_F(SessionTest, ParametersOfEveryCall) {
    const std::set<std::string> always = {"ClientTime", "TamrixVersion", "VeltoIDAuthProtocolVersion"};
    const Dictionary parameters = createCallParameters(kName, nullptr, {});
    std::set<std::string> keys = always;
    if (platform::systemVersion().productName) keys.insert("ProductName");
    if (platform::systemVersion().buildVersion) keys.insert("SystemVersion");
    EXPECT_EQ(keysOf(parameters), keys);
    EXPECT_EQ(parameters["VeltoIDAuthProtocolVersion"], number(101));
    EXPECT_EQ(parameters["TamrixVersion"], Value("727.8"));
    EXPECT_EQ(parameters["ClientTime"], date());
    EXPECT_EQ(createCallParameters(kName, "id", {})["dsSession"], Value("id"));
}

TEST_F(SessionTest, TheServerIsToldMoreWhenItHasAskedForIt) {
    constexpr const char* kMetaSwitch = "VeltoIDMetaSendServerMetaInformationItems";
    constexpr const char* kAccountSwitch = "VeltoIDMetaSendServerAccountInformationItems";
    const auto told = [](const Dictionary& options = {}) {
        const Dictionary parameters = createCallParameters(kName, nullptr, options);
        return std::string(parameters.contains("MetaInformation") ? "meta " : "") +
               (parameters.contains("AccountInformation") ? "account" : "");
    };
    EXPECT_EQ(told({{kAccountSwitch, flag(true)}}), "") << "there is no account";
    createAccount();
    EXPECT_EQ(told(), "");
    EXPECT_EQ(told({{kAccountSwitch, number(1)}, {kMetaSwitch, "true"}}), "") << "only Booleans count";
    EXPECT_EQ(told({{kAccountSwitch, flag(true)}, {kMetaSwitch, flag(true)}}), "meta account");
    __VeltoIDDBSetMetaInfoValue(nullptr, kMetaSwitch, flag(true));
    EXPECT_EQ(told(), "meta ");
    __VeltoIDDBSetMetaInfoValue(kName, kMetaSwitch, flag(false));
    __VeltoIDDBSetMetaInfoValue(kName, kAccountSwitch, flag(true));
    EXPECT_EQ(told(), "account") << "the account's own switch comes first";
    EXPECT_EQ(createCallParameters(kName, nullptr, {})["AccountInformation"], Value(record()));
}

class CommandsTest : public SessionTest {
  protected:
    void SetUp() override {
        SessionTest::SetUp();
        setProcessHooks({.scheduleRelaunch = [this](double date) { relaunches_.push_back(date - now()); },
                         .endProcess = [] { _exit(EXIT_SUCCESS); }});
    }

    /// The session after a call that got this reply.
    Session after(const Dictionary& reply) {
        server_.answer("m", reply);
        Session called = session(0, 7);
        std::optional<Dictionary> result;
        EXPECT_TRUE(xmlInvoke(*called, std::string(kVeltoIDMethodPrefix) + "m", {}, &result, nullptr));
        EXPECT_TRUE(result.has_value());
        return called;
    }

    std::vector<double> relaunches_;
};

TEST_F(CommandsTest, ValidityOfTheSession) {
    struct Case {
        Value given;
        double validity;
    };
    const Case cases[] = {
        {number(60), 60},
        {Value::real(1.5), 1.5},
        {number(0), 0},
        {number(-60), 0},
        {"90", 90},
        {"2.5", 2.5},
        {"-5", 0},
        {"inf", 0},
        {"none", 0},
        {flag(true), 7},
        {Array{number(1)}, 7},
        {date(), 7},
        {{}, 7},
    };
    for (const Case& each : cases)
        EXPECT_EQ(after({{"dsSessionValidityDuration", each.given}})->fValidityDuration, each.validity)
            << testing::PrintToString(each.given);
}

TEST_F(CommandsTest, MetaAndAccountInformationAreStored) {
    createAccount();
    __VeltoIDDBSetMetaInfoValue(nullptr, "X", "old");
    setValue("X", "old");
    (void)takeSignals();
    const Dictionary changes = {{"X", "NULL"}, {"Y", number(5)}};
    after({{"MetaInformation", changes}, {"AccountInformation", changes}});
    EXPECT_TRUE(meta("X").isAbsent());
    EXPECT_EQ(meta("Y"), number(5));
    EXPECT_FALSE(record().contains("X"));
    EXPECT_EQ(record()["Y"], number(5));
    EXPECT_EQ(takeSignals(), 0);
    after({{"MetaInformation", "NULL"}, {"AccountInformation", Array()}});
    EXPECT_EQ(meta("Y"), number(5));
}

TEST_F(CommandsTest, ARelaunchIsScheduled) {
    for (const Value& none : {Value(), number(0), number(-5), Value("3600"), Value::real(0.5), flag(true)})
        after({{"NextLaunchTimeInterval", none}});
    EXPECT_TRUE(relaunches_.empty());
    EXPECT_FALSE(log_.contains("NextLaunchTimeInterval"));
    for (const Value& some : {number(1), number(3600), Value::real(60)})
        after({{"NextLaunchTimeInterval", some}});
    EXPECT_EQ(relaunches_, (std::vector<double>{1, 3600, 60}));
    EXPECT_EQ(
        log_.count("Received 'NextLaunchTimeInterval' == 3600 from server, so setting NextLaunchDate to "),
        1);
}

TEST_F(CommandsTest, FlushAndExitEndsTheProcessWithEverythingWritten) {
    platform::ChildProcess process([this] {
        after({{"MetaInformation", Dictionary{{"X", "last words"}}}, {"FlushAndExit", flag(true)}});
        return false;
    });
    EXPECT_TRUE(process.succeeded());
    EXPECT_EQ(meta("X"), Value("last words"));
    after({{"FlushAndExit", flag(false)}});
    after({{"FlushAndExit", number(1)}});
}

// --- Faults

TEST_F(SessionTest, FaultsBecomeTheAgentsErrors) {
    const Error transport{"transport", 7, {}};
    struct Case {
        const char* what;
        std::optional<Error> error;
        std::optional<Dictionary> response;
        int64_t code;
        const char* reason;
        bool removesPassword;
        std::set<std::string> userInfo;
    };
    const auto faultOf = [](int64_t code) { return Error{kXMLErrorDomain, code, {}}; };
    const Error sameCodeElsewhere{kIdentityErrorDomain, -20101, {}};
    const std::set<std::string> place = {"function", "file", "line"};
    const auto with = [&](std::set<std::string> keys) {
        keys.insert(place.begin(), place.end());
        return keys;
    };
    const std::string kReason(kErrorFailureReasonKey);
    const std::string kText(kErrorDescriptionKey);
    const std::string kCause(kErrorUnderlyingErrorKey);
    constexpr const char* kDisabled = "This Velto ID has been disabled for security reasons.";
    constexpr const char* kIncorrect = "The Velto ID account or password are incorrect.";
    const Case cases[] = {
        {"account", faultOf(-20101), {}, -101, kIncorrect, true, with({kReason, kCause, "XMLFaultCode"})},
        {"password", faultOf(-20283), Dictionary(), -101, kIncorrect, true,
         with({kReason, kCause, "XMLFaultCode", "XMLResponse"})},
        {"disabled",
         faultOf(-20209),
         {},
         -102,
         kDisabled,
         true,
         with({kReason, kText, kCause, "XMLFaultCode"})},
        {"another fault", faultOf(-4164), {}, -100, nullptr, false, with({kCause, "XMLFaultCode"})},
        {"another domain", sameCodeElsewhere, {}, -100, nullptr, false, with({kCause})},
        {"the transport", transport, Dictionary(), -100, nullptr, false, with({kCause, "XMLResponse"})},
        {"a response", {}, Dictionary(), -100, nullptr, false, with({"XMLResponse"})},
        {"nothing", {}, {}, -100, nullptr, false, place},
    };
    for (const Case& each : cases) {
        createAccount();
        const Error error = copyAndHandleXMLErrorResponse(kName, kPassword, each.response, each.error);
        EXPECT_EQ(error.domain, kIdentityErrorDomain) << each.what;
        EXPECT_EQ(error.code, each.code) << each.what;
        EXPECT_EQ(error.userInfo[kErrorFailureReasonKey], each.reason ? Value(each.reason) : Value())
            << each.what;
        EXPECT_EQ(keysOf(error.userInfo), each.userInfo) << each.what;
        EXPECT_EQ(error.userInfo["function"], Value("copyAndHandleXMLErrorResponse")) << each.what;
        EXPECT_EQ(error.userInfo[kErrorUnderlyingErrorKey], each.error ? Value(*each.error) : Value())
            << each.what;
        EXPECT_EQ(hasPassword(), !each.removesPassword) << each.what;
    }
    EXPECT_EQ(
        copyAndHandleXMLErrorResponse(kName, kPassword, {}, faultOf(-20209)).userInfo[kErrorDescriptionKey],
        Value("Go to https://account.velto.example for information on how to re-enable this Velto ID."));
    EXPECT_EQ(copyAndHandleXMLErrorResponse(kName, kPassword, {}, faultOf(-1)).userInfo["XMLFaultCode"],
              number(-1));
}

}  // namespace
}  // namespace veltoid
