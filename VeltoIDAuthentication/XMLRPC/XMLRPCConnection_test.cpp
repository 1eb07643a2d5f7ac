#include "XMLRPC/XMLRPCConnection.h"

#include <gtest/gtest.h>

#include "TestSupport/FakeHTTPSession.h"
#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/SimulatedClock.h"
#include "TestSupport/XMLRPCDocuments.h"
#include "XMLRPC/XMLRPCConnectionManager.h"

namespace veltoid {
namespace {

using platform::FakeHTTPAnswer;
using platform::HTTPError;

const std::string kDocument = document("<value>x</value>");
const std::string kFault = faultDocument("<value>x</value>");

const HTTPError kCut = {18, "cut"};

Error transportError(const HTTPError& error) {
    return {kTransportErrorDomain, error.code, {{kErrorDescriptionKey, error.description}}};
}

std::shared_ptr<XMLRPCRequest> someRequest() {
    auto request = std::make_shared<XMLRPCRequest>("https://server.example/rpc");
    request->setMethod("m", Dictionary{{"k", "v"}});
    request->setUserAgent("test");
    return request;
}

TEST(SynchronousSend, AResponseIsABodyOfAGoodStatus) {
    const HTTPError refused = {7, "refused"};
    const std::tuple<const char*, FakeHTTPAnswer, bool, Value, std::optional<Error>> cases[] = {
        {"200", {200, kDocument}, true, "x", {}},
        {"a body in pieces", {200, kDocument, {}, 7}, true, "x", {}},
        {"399", {399, kDocument}, true, "x", {}},
        {"400", {400, kDocument}, false, {}, {}},
        {"500 with a fault", {500, kFault}, false, {}, {}},
        {"an empty body", {200}, true, {}, {}},
        {"no XML", {200, "<html>"}, true, {}, {}},
        {"no connection", {0, {}, refused}, false, {}, transportError(refused)},
        {"an end inside the body", {200, kDocument, kCut}, false, {}, transportError(kCut)},
    };
    for (const auto& [what, answer, isResponse, object, expected] : cases) {
        SCOPED_TRACE(what);
        platform::FakeHTTPTransport transport;
        transport.enqueue(answer);
        std::optional<Error> error;
        const auto response = XMLRPCConnection::sendSynchronousXMLRPCRequest(*someRequest(), &error);
        EXPECT_EQ(response.has_value(), isResponse);
        EXPECT_EQ(response ? response->object() : Value(), object);
        EXPECT_EQ(error, expected);
        ASSERT_EQ(transport.requests().size(), 1U);
        EXPECT_EQ(transport.requests()[0].body, someRequest()->body());
        EXPECT_EQ(transport.sessionsCreated(), 1);
    }
}

TEST(SynchronousSend, SaysSoWhenThereIsNoClient) {
    platform::FakeHTTPTransport transport;
    transport.setAvailable(false);
    std::optional<Error> error;
    EXPECT_FALSE(XMLRPCConnection::sendSynchronousXMLRPCRequest(*someRequest(), &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain, String(kTransportErrorDomain));
}

/// A call on a queue of its own under a clock that stands still until it is told to go on.
class TimedSend : public testing::Test {
  protected:
    void send(double serverDelay) {
        transport_.enqueue({.body = kDocument, .delaySeconds = serverDelay});
        caller_.async([this] {
            hasResponse_ =
                XMLRPCConnection::sendSynchronousXMLRPCRequest(*someRequest(), &error_).has_value();
            isOver_ = true;
        });
        clock_.settle();
    }

    platform::SimulatedClock clock_;
    platform::FakeHTTPTransport transport_;
    const platform::WorkQueue caller_{"caller"};
    std::atomic<bool> isOver_ = false;
    std::atomic<bool> hasResponse_ = false;
    std::optional<Error> error_;
};

TEST_F(TimedSend, WaitsFiveSecondsAndDiscardsWhatComesLater) {
    send(6);
    clock_.advanceBy(4.9);
    EXPECT_FALSE(isOver_);
    clock_.advanceBy(0.2);
    EXPECT_TRUE(isOver_);
    EXPECT_FALSE(hasResponse_);
    EXPECT_FALSE(error_);
    EXPECT_EQ(transport_.sessionsCancelled(), 1);
    clock_.advanceBy(10);
    EXPECT_FALSE(hasResponse_);
}

TEST_F(TimedSend, GoesOnWhenTheDateIsSet) {
    send(3);
    clock_.jumpTo(clock_.now() + 86'400);
    EXPECT_FALSE(isOver_);
    clock_.advanceBy(3);
    EXPECT_TRUE(hasResponse_);
}

/// Writes down what it is told, and where.
class Recorder : public XMLRPCConnectionDelegate {
  public:
    void didReceiveResponse(const XMLRPCRequest& request, const XMLRPCResponse& response) override {
        note("response " + response.object().asString().text() + " to " + request.method().text());
    }
    void didFailWithError(const XMLRPCRequest&, const Error& error) override {
        note("failure " + error.domain.text() + " " + std::to_string(error.code));
    }
    void didSendBodyData(const XMLRPCRequest&, float fraction) override {
        note("sent " + std::to_string(fraction));
    }

    std::optional<bool> canAuthenticateAgainstProtectionSpace(
        const XMLRPCRequest&, const platform::ProtectionSpace& space) override {
        note("may authenticate at " + space.host);
        return canAuthenticate;
    }
    std::optional<platform::ChallengeAnswer> didReceiveAuthenticationChallenge(
        const XMLRPCRequest&, const platform::ProtectionSpace& space) override {
        note("challenge of " + space.host);
        return challengeAnswer;
    }

    void note(const std::string& line) {
        lines.push_back(line);
        if (!platform::WorkQueue::main().isCurrent()) lines.emplace_back("not on the main queue");
    }

    using Lines = std::vector<std::string>;
    Lines lines;
    std::optional<bool> canAuthenticate;
    std::optional<platform::ChallengeAnswer> challengeAnswer;
};

class AsynchronousConnection : public testing::Test {
  protected:
    String spawn(const FakeHTTPAnswer& answer) {
        transport_.enqueue(answer);
        const String identifier = manager_.spawnConnectionWithXMLRPCRequest(someRequest(), recorder_);
        // All events of a fake exchange come in one task of the main queue.
        platform::WorkQueue::main().sync([] {});
        return identifier;
    }

    Recorder::Lines linesOf(const FakeHTTPAnswer& answer) {
        recorder_->lines.clear();
        spawn(answer);
        EXPECT_EQ(manager_.numberOfActiveConnections(), 0U) << "a connection must close itself in the end";
        return recorder_->lines;
    }

    platform::FakeSystemLog log_;
    platform::FakeHTTPTransport transport_;
    XMLRPCConnectionManager& manager_ = XMLRPCConnectionManager::sharedManager();
    const std::shared_ptr<Recorder> recorder_ = std::make_shared<Recorder>();
};

TEST_F(AsynchronousConnection, TellsTheDelegateOfEveryOutcome) {
    using Lines = Recorder::Lines;
    EXPECT_EQ(linesOf({200, kDocument}), Lines{"response x to m"});
    EXPECT_EQ(linesOf({200}), Lines{});
    EXPECT_EQ(linesOf({304, kDocument}), Lines{});
    EXPECT_EQ(linesOf({404}), Lines{"failure HTTP 404"});
    EXPECT_EQ(linesOf({500, kDocument}), (Lines{"failure HTTP 500", "response x to m"}));
    EXPECT_EQ(linesOf({200, kDocument, kCut}), Lines{"failure HWTransportErrorDomain 18"});
    EXPECT_TRUE(log_.contains(", failed with the following error: cut"));
    EXPECT_EQ(linesOf({.body = kDocument, .progress = {{1, 4}, {4, 4}}}),
              (Lines{"sent 0.250000", "sent 1.000000", "response x to m"}));
}

TEST_F(AsynchronousConnection, HandsChallengesToADelegateThatTakesThem) {
    using platform::ChallengeAnswer;
    const std::string may = "may authenticate at server.example";
    const std::string challenge = "challenge of server.example";
    const std::string refused = "failure HWTransportErrorDomain 42";
    const std::tuple<std::optional<bool>, std::optional<ChallengeAnswer>, Recorder::Lines> cases[] = {
        {std::nullopt, std::nullopt, {may, challenge, "response x to m"}},
        {true, ChallengeAnswer::PerformDefaultHandling, {may, challenge, "response x to m"}},
        {true, ChallengeAnswer::Cancel, {may, challenge, refused}},
        {false, ChallengeAnswer::Cancel, {may, "response x to m"}},
    };
    const platform::ProtectionSpace space = {"server.example", 443, "ServerTrust"};
    for (const auto& [canAuthenticate, answer, lines] : cases) {
        recorder_->canAuthenticate = canAuthenticate;
        recorder_->challengeAnswer = answer;
        EXPECT_EQ(linesOf({.body = kDocument, .challenge = space}), lines);
    }
}

TEST_F(AsynchronousConnection, TheManagerHoldsConnectionsUntilTheyAreClosed) {
    const FakeHTTPAnswer never = {.delaySeconds = platform::kForever};
    const String first = spawn(never);
    const String second = spawn(never);
    const String third = spawn(never);
    EXPECT_EQ(manager_.numberOfActiveConnections(), 3U);
    EXPECT_EQ(manager_.activeConnectionIdentifiers().size(), 3U);
    const std::weak_ptr<XMLRPCConnection> connection = manager_.connectionForIdentifier(second);
    ASSERT_FALSE(connection.expired());
    EXPECT_EQ(connection.lock()->identifier(), second);
    EXPECT_EQ(connection.lock()->delegate(), recorder_);

    manager_.closeConnectionForIdentifier(second);
    manager_.closeConnectionForIdentifier(second);
    manager_.closeConnectionForIdentifier("unknown");
    EXPECT_EQ(transport_.sessionsCancelled(), 1);
    EXPECT_TRUE(connection.expired()) << "nothing may keep a closed connection";
    EXPECT_EQ(manager_.connectionForIdentifier(second), nullptr);
    EXPECT_NE(manager_.connectionForIdentifier(third), nullptr);

    manager_.closeConnections();
    EXPECT_EQ(transport_.sessionsCancelled(), 3);
    EXPECT_EQ(manager_.numberOfActiveConnections(), 0U);
    EXPECT_TRUE(recorder_->lines.empty());
}

}  // namespace
}  // namespace veltoid
