#include "VeltoIDXMLServerCommunications/Session.h"

#include "Platform/runtime/SystemVersion.h"
#include "TestSupport/FakeIdentityServer.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"

namespace veltoid {
namespace {

class SessionTest : public ServerTest {
  protected:
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
    const std::tuple<const char*, double, double, String, bool> cases[] = {
        {"new", 0, 100, "d", true},
        {"at the last moment", 99.5, 100, "d", true},
        {"over", 100, 100, "d", false},
        {"no validity", 0, 0, "d", false},
        {"from the future", -1, 100, "d", false},
        {"without encDsId", 0, 100, nullptr, false},
        {"spoiled", now(), 1e12, "d", false},
    };
    for (const auto& [what, age, validity, encDsId, isKept] : cases) {
        (void)session(encDsId, age, validity);
        EXPECT_EQ(takeID(), isKept ? "s1" : "none") << what;
        EXPECT_EQ(takeID(), "none") << what;
    }
}

TEST_F(SessionTest, IsFoundByAccountPasswordAndServer) {
    (void)session();
    for (const String& wrong : {String("other"), String()}) {
        EXPECT_EQ(takeCachedSession(wrong, kPassword, kURL), nullptr);
        EXPECT_EQ(takeCachedSession(kName, wrong, kURL), nullptr);
        EXPECT_EQ(takeCachedSession(kName, kPassword, wrong), nullptr);
    }
    EXPECT_EQ(takeID(), "s1");
}

TEST_F(SessionTest, TheOldestThatIsStillValidComesFirst) {
    (void)session("d", 0, 10, "short");
    (void)session("d", 0, 100, "first");
    (void)session("d", 0, 100, "second");
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
    EXPECT_EQ(told({{kAccountSwitch, kOn}}), "") << "there is no account";
    createAccount();
    EXPECT_EQ(told(), "");
    EXPECT_EQ(told({{kAccountSwitch, number(1)}, {kMetaSwitch, "true"}}), "") << "only Booleans count";
    EXPECT_EQ(told({{kAccountSwitch, kOn}, {kMetaSwitch, kOn}}), "meta account");
    __VeltoIDDBSetMetaInfoValue(nullptr, kMetaSwitch, kOn);
    EXPECT_EQ(told(), "meta ");
    __VeltoIDDBSetMetaInfoValue(kName, kMetaSwitch, kOff);
    __VeltoIDDBSetMetaInfoValue(kName, kAccountSwitch, kOn);
    EXPECT_EQ(told(), "account") << "the account's own switch comes first";
    EXPECT_EQ(createCallParameters(kName, nullptr, {})["AccountInformation"], Value(record()));
}

class CommandsTest : public SessionTest {
  protected:
    void SetUp() override {
        SessionTest::SetUp();
        setProcessHooks(
            {.scheduleRequestedLaunch = [this](double date) { relaunches_.push_back(date - now()); },
             .endProcess = [] { _exit(EXIT_SUCCESS); }});
    }

    /// The session after a call that got this reply.
    Session after(const Dictionary& reply) {
        server_.answer("m", reply);
        Session called = session("d1", 0, 7);
        std::optional<Dictionary> result;
        EXPECT_TRUE(xmlInvoke(*called, std::string(kVeltoIDMethodPrefix) + "m", {}, &result, nullptr));
        EXPECT_TRUE(result.has_value());
        return called;
    }

    std::vector<double> relaunches_;
};

TEST_F(CommandsTest, ValidityOfTheSession) {
    const std::pair<Value, double> cases[] = {{number(60), 60},
                                              {Value::real(1.5), 1.5},
                                              {number(0), 0},
                                              {number(-60), 0},
                                              {"90", 90},
                                              {"2.5", 2.5},
                                              {"-5", 0},
                                              {"inf", 0},
                                              {"none", 0},
                                              {kOn, 7},
                                              {Array{number(1)}, 7},
                                              {date(), 7},
                                              {{}, 7}};
    for (const auto& [given, validity] : cases)
        EXPECT_EQ(after({{"dsSessionValidityDuration", given}})->fValidityDuration, validity)
            << testing::PrintToString(given);
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

TEST_F(CommandsTest, NoReplyMovesTheServerOrRenamesTheAccount) {
    createAccount();
    __VeltoIDDBSetMetaInfoValue(nullptr, "ServerURL", "https://meta.example");
    setValue("ServerURL", "https://record.example");
    int lines = 0;
    for (const Value& address : {Value("https://evil.example"), Value("NULL")}) {
        const Dictionary changes = {{"ServerURL", address}, {"X", "taken"}};
        for (const Dictionary& reply :
             {Dictionary{{"NewURL", address}}, Dictionary{{"MetaInformation", changes}},
              Dictionary{{"NewURL", address}, {"AccountInformation", changes}}}) {
            after(reply);
            EXPECT_EQ(meta("ServerURL"), Value("https://meta.example"));
            EXPECT_EQ(record()["ServerURL"], Value("https://record.example"));
            EXPECT_EQ(log_.count("Ignoring a new server URL in a reply"), ++lines);
        }
    }
    EXPECT_EQ(meta("X"), Value("taken"));
    EXPECT_EQ(record()["X"], Value("taken"));

    const std::pair<Value, Value> names[] = {
        {"JANE@velto.example", "JANE@velto.example"}, {number(1), number(1)}, {kName, {}}, {"NULL", {}}};
    for (const auto& [given, kept] : names) {
        after({{"AccountInformation", Dictionary{{"VeltoID", given}}}});
        EXPECT_EQ(record()["VeltoID"], Value(kName));
        EXPECT_EQ(record()["ServerVeltoID"], kept);
    }
}

TEST_F(CommandsTest, ARelaunchIsScheduled) {
    for (const Value& none : {Value(), number(0), number(-5), Value("3600"), Value::real(0.5), kOn})
        after({{"NextLaunchTimeInterval", none}});
    EXPECT_TRUE(relaunches_.empty());
    EXPECT_FALSE(log_.contains("NextLaunchTimeInterval"));
    for (const Value& some : {number(1), number(3600), Value::real(60)})
        after({{"NextLaunchTimeInterval", some}});
    EXPECT_EQ(relaunches_, (std::vector<double>{15, 3600, 60}));
    const char* line = "Received 'NextLaunchTimeInterval' == 3600 from server, so setting NextLaunchDate to ";
    EXPECT_EQ(log_.count(line), 1);
}

TEST_F(CommandsTest, FlushAndExitEndsTheProcessWithEverythingWritten) {
    platform::ChildProcess process([this] {
        after({{"MetaInformation", Dictionary{{"X", "last words"}}}, {"FlushAndExit", kOn}});
        return false;
    });
    EXPECT_TRUE(process.succeeded());
    EXPECT_EQ(meta("X"), Value("last words"));
    after({{"FlushAndExit", kOff}});
    after({{"FlushAndExit", number(1)}});
}

// --- Faults

TEST_F(SessionTest, FaultsBecomeTheAgentsErrors) {
    const Error transport{"transport", 7, {}};
    const auto faultOf = [](int64_t code) { return Error{kXMLErrorDomain, code, {}}; };
    const Error sameCodeElsewhere{kIdentityErrorDomain, -20101, {}};
    const auto with = [](std::set<std::string> keys) {
        keys.insert({"function", "file", "line"});
        return keys;
    };
    const std::string kReason(kErrorFailureReasonKey);
    const std::string kText(kErrorDescriptionKey);
    const std::string kCause(kErrorUnderlyingErrorKey);
    constexpr const char* kCode = "XMLFaultCode";
    constexpr const char* kResponse = "XMLResponse";
    const Dictionary some;
    constexpr const char* kDisabled = "This Velto ID has been disabled for security reasons.";
    constexpr const char* kIncorrect = "The Velto ID account or password are incorrect.";
    const struct {
        const char* what;
        std::optional<Error> given;
        std::optional<Dictionary> response;
        int64_t code;
        const char* reason;
        bool removesPassword;
        std::set<std::string> userInfo;
    } cases[] = {
        {"account", faultOf(-20101), {}, -101, kIncorrect, true, with({kReason, kCause, kCode})},
        {"password", faultOf(-20283), some, -101, kIncorrect, true,
         with({kReason, kCause, kCode, kResponse})},
        {"disabled", faultOf(-20209), {}, -102, kDisabled, true, with({kReason, kText, kCause, kCode})},
        {"another fault", faultOf(-4164), {}, -100, nullptr, false, with({kText, kCause, kCode})},
        {"another domain", sameCodeElsewhere, {}, -100, nullptr, false, with({kText, kCause})},
        {"the transport", transport, some, -100, nullptr, false, with({kText, kCause, kResponse})},
        {"a response", {}, some, -100, nullptr, false, with({kText, kResponse})},
        {"nothing", {}, {}, -100, nullptr, false, with({kText})},
    };
    for (const auto& [what, given, response, code, reason, removesPassword, userInfo] : cases) {
        SCOPED_TRACE(what);
        createAccount();
        const Error error = copyAndHandleXMLErrorResponse(kName, kPassword, response, given);
        EXPECT_EQ(error.domain, kIdentityErrorDomain);
        EXPECT_EQ(error.code, code);
        EXPECT_EQ(error.userInfo[kErrorFailureReasonKey], reason ? Value(reason) : Value());
        EXPECT_EQ(keysOf(error.userInfo), userInfo);
        EXPECT_EQ(error.userInfo["function"], Value("copyAndHandleXMLErrorResponse"));
        EXPECT_EQ(error.userInfo[kErrorUnderlyingErrorKey], given ? Value(*given) : Value());
        EXPECT_EQ(hasPassword(), !removesPassword);
    }
    const auto informationOn = [&](int64_t code) {
        return copyAndHandleXMLErrorResponse(kName, kPassword, {}, faultOf(code)).userInfo;
    };
    EXPECT_EQ(
        informationOn(-20209)[kText],
        Value("Go to https://account.velto.example for information on how to re-enable this Velto ID."));
    EXPECT_EQ(informationOn(-1)[kCode], number(-1));
}

}  // namespace
}  // namespace veltoid
