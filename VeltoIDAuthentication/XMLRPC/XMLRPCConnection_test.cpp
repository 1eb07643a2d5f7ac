#include "XMLRPC/XMLRPCConnection.h"

#include <gtest/gtest.h>

#include "TestSupport/FakeHTTPSession.h"
#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/SimulatedClock.h"
#include "XMLRPC/XMLRPCConnectionManager.h"

namespace veltoid {
namespace {

using platform::FakeHTTPAnswer;
using platform::HTTPError;

const std::string kDocument =
    "<methodResponse><params><param><value>x</value></param></params></methodResponse>";
const std::string kFault = "<methodResponse><fault><value>x</value></fault></methodResponse>";

FakeHTTPAnswer answer(int status, const std::string& body = {},
                      std::optional<HTTPError> error = std::nullopt) {
    FakeHTTPAnswer result;
    result.status = status;
    result.body = body;
    result.error = std::move(error);
    return result;
}

Error transportError(int64_t code, const char* text) {
    return {kTransportErrorDomain, code, {{kErrorDescriptionKey, text}}};
}

std::shared_ptr<XMLRPCRequest> someRequest() {
    auto request = std::make_shared<XMLRPCRequest>("https://server.example/rpc");
    request->setMethod("m", Dictionary{{"k", "v"}});
    request->setUserAgent("test");
    return request;
}

TEST(SynchronousSend, AResponseIsABodyOfAGoodStatus) {
    FakeHTTPAnswer inPieces = answer(200, kDocument);
    inPieces.pieceBytes = 7;
    const std::tuple<const char*, FakeHTTPAnswer, bool, Value, std::optional<Error>> cases[] = {
        {"200", answer(200, kDocument), true, "x", {}},
        {"a body in pieces", inPieces, true, "x", {}},
        {"399", answer(399, kDocument), true, "x", {}},
        {"400", answer(400, kDocument), false, {}, {}},
        {"500 with a fault", answer(500, kFault), false, {}, {}},
        {"an empty body", answer(200), true, {}, {}},
        {"no XML", answer(200, "<html>"), true, {}, {}},
        {"no connection", answer(0, {}, HTTPError{7, "refused"}), false, {}, transportError(7, "refused")},
        {"an end inside the body",
         answer(200, kDocument, HTTPError{18, "cut"}),
         false,
         {},
         transportError(18, "cut")},
    };
    for (const auto& [what, answer, isResponse, object, wantedError] : cases) {
        SCOPED_TRACE(what);
        platform::FakeHTTPTransport transport;
        transport.enqueue(answer);
        std::optional<Error> error;
        const auto response = XMLRPCConnection::sendSynchronousXMLRPCRequest(*someRequest(), &error);
        EXPECT_EQ(response.has_value(), isResponse);
        EXPECT_EQ(response ? response->object() : Value(), object);
        EXPECT_EQ(error, wantedError);
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
        FakeHTTPAnswer late = answer(200, kDocument);
        late.delaySeconds = serverDelay;
        transport_.enqueue(late);
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
    EXPECT_EQ(linesOf(answer(200, kDocument)), Lines{"response x to m"});
    EXPECT_EQ(linesOf(answer(200)), Lines{});
    EXPECT_EQ(linesOf(answer(304, kDocument)), Lines{});
    EXPECT_EQ(linesOf(answer(404)), Lines{"failure HTTP 404"});
    EXPECT_EQ(linesOf(answer(500, kDocument)), (Lines{"failure HTTP 500", "response x to m"}));
    EXPECT_EQ(linesOf(answer(200, kDocument, HTTPError{18, "cut"})),
              Lines{"failure HWTransportErrorDomain 18"});
    EXPECT_TRUE(log_.contains(", failed with the following error: cut"));
    FakeHTTPAnswer slow = answer(200, kDocument);
    slow.progress = {{1, 4}, {4, 4}};
    EXPECT_EQ(linesOf(slow), (Lines{"sent 0.250000", "sent 1.000000", "response x to m"}));
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
    FakeHTTPAnswer challenging = answer(200, kDocument);
    challenging.challenge = platform::ProtectionSpace{"server.example", 443, "ServerTrust"};
    for (const auto& [canAuthenticate, answer, lines] : cases) {
        recorder_->canAuthenticate = canAuthenticate;
        recorder_->challengeAnswer = answer;
        EXPECT_EQ(linesOf(challenging), lines);
    }
}

TEST_F(AsynchronousConnection, TheManagerHoldsConnectionsUntilTheyAreClosed) {
    FakeHTTPAnswer never;
    never.delaySeconds = platform::kForever;
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
