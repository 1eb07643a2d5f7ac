// Against a real TLS server.
#include "Platform/net/HTTPSession.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <mutex>
#include <thread>

#include "Platform/runtime/Clock.h"
#include "TestSupport/TestHTTPServer.h"

namespace platform {
namespace {

using namespace std::literals;

/// Collects the events of one exchange.
class Outcome : public HTTPSessionEvents {
  public:
    ChallengeAnswer challenge(const ProtectionSpace& space) override {
        challenged.push_back(space.host + " " + space.authenticationMethod +
                             (space.port > 0 ? "" : " no port"));
        return answer;
    }
    void responseHeader(int statusCode) override {
        const std::lock_guard lock(mutex);
        statuses.push_back(statusCode);
        begun.signal();
    }
    void bodyBytes(Bytes bytes) override { body += textOf(bytes); }
    void uploadProgress(uint64_t sent, uint64_t expected) override { progress.emplace_back(sent, expected); }
    void completed(const std::optional<HTTPError>& result) override {
        error = result;
        ++completions;
        queueLabel = WorkQueue::currentLabel() ? *WorkQueue::currentLabel() : "";
        over.signal();
    }

    ChallengeAnswer answer = ChallengeAnswer::PerformDefaultHandling;
    std::mutex mutex;
    std::vector<std::string> challenged;
    std::vector<int> statuses;
    std::string body;
    std::vector<std::pair<uint64_t, uint64_t>> progress;
    std::optional<HTTPError> error;
    std::atomic<int> completions = 0;
    std::string queueLabel;
    std::shared_ptr<HTTPSession> owned;
    Semaphore begun;
    Semaphore over;
};

HTTPRequest requestTo(std::string url) {
    HTTPRequest request;
    request.url = std::move(url);
    request.handlesCookies = false;
    return request;
}

std::shared_ptr<Outcome> exchange(const HTTPRequest& request,
                                  std::optional<WorkQueue> eventQueue = std::nullopt) {
    auto outcome = std::make_shared<Outcome>();
    const auto session = HTTPSession::create(outcome, std::move(eventQueue));
    if (!session) throw std::runtime_error("no HTTPS client");
    session->start(request);
    outcome->over.wait(kForever);
    return outcome;
}

TEST(HTTPSession, SendsExactlyTheRequestAndDeliversTheResponse) {
    const TestHTTPServer server;
    HTTPRequest request = requestTo(server.url("/echo"));
    request.method = "POST";
    request.body = std::string(3000, 'b').c_str();
    request.setHeaderField("content-type", "text/plain");
    request.setHeaderField("Content-Type", "text/xml");
    request.setHeaderField("Content-Length", "1");
    request.setHeaderField("Accept", "text/xml");
    request.setHeaderField("User-Agent", "test");
    request.setHeaderField("X-Empty", "");
    const auto outcome = exchange(request);
    EXPECT_FALSE(outcome->error);
    EXPECT_EQ(outcome->statuses, std::vector{200});
    const std::string host = server.url("", TestHTTPServer::Good).substr(strlen("https://"));
    EXPECT_EQ(outcome->body,
              R"(["POST", [["Host", ")" + host +
                  R"("], ["content-type", "text/xml"], ["Accept", "text/xml"], ["User-Agent", "test"], )"
                  R"(["X-Empty", ""], ["Content-Length", "3000"]], ")" +
                  std::string(3000, 'b') + "\"]");
    EXPECT_EQ(outcome->challenged, std::vector{"localhost ServerTrust"s});
    ASSERT_FALSE(outcome->progress.empty());
    EXPECT_EQ(outcome->progress.back(), std::pair(uint64_t{3000}, uint64_t{3000}));
}

TEST(HTTPSession, KeepsOutcomesApart) {
    constexpr int kPartial = 18;
    constexpr int kTooLarge = 63;
    constexpr int kNoAnswer = 52;
    const std::tuple<const char*, std::vector<int>, std::optional<int>, size_t> cases[] = {
        {"/status", {500}, std::nullopt, strlen("<html>oops</html>")},
        {"/empty", {204}, std::nullopt, 0},
        {"/half", {200}, std::nullopt, strlen("<methodResp")},
        {"/continue", {200}, std::nullopt, strlen("after")},
        {"/redirect", {302}, std::nullopt, 0},
        {"/limit", {200}, std::nullopt, kMaxHTTPResponseBytes},
        {"/announced", {}, kTooLarge, 0},
        {"/unannounced", {200}, kTooLarge, kMaxHTTPResponseBytes},
        {"/close-inside", {200}, kPartial, 4},
        {"/close-before", {}, kNoAnswer, 0},
    };
    const TestHTTPServer server;
    for (const auto& [path, statuses, error, bodyBytes] : cases) {
        SCOPED_TRACE(path);
        const auto outcome = exchange(requestTo(server.url(path)));
        EXPECT_EQ(outcome->statuses, statuses);
        EXPECT_EQ(outcome->error ? std::optional(outcome->error->code) : std::nullopt, error);
        if (error == kTooLarge) {
            EXPECT_LE(outcome->body.size(), bodyBytes);
        } else {
            EXPECT_EQ(outcome->body.size(), bodyBytes);
        }
    }
}

TEST(HTTPSession, TalksOnlyToServersThatItCanVerify) {
    constexpr int kBadCertificate = 60;
    constexpr int kNoSuchProtocol = 1;
    constexpr int kNoTLS = 35;
    const std::tuple<const char*, TestHTTPServer::Kind, const char*, int> cases[] = {
        {"a name that the certificate lacks", TestHTTPServer::WrongName, "https", kBadCertificate},
        {"an authority that nobody trusts", TestHTTPServer::Stranger, "https", kBadCertificate},
        {"no TLS behind https", TestHTTPServer::Plain, "https", kNoTLS},
        {"plain http", TestHTTPServer::Plain, "http", kNoSuchProtocol},
        {"a protocol of files", TestHTTPServer::Plain, "ftp", kNoSuchProtocol},
    };
    const TestHTTPServer server;
    for (const auto& [what, kind, scheme, code] : cases) {
        SCOPED_TRACE(what);
        const auto outcome = exchange(requestTo(server.url("/echo", kind, scheme)));
        ASSERT_TRUE(outcome->error);
        EXPECT_EQ(outcome->error->code, code);
        EXPECT_FALSE(outcome->error->description.empty());
        EXPECT_TRUE(outcome->body.empty());
    }
    // Without the variable the system's authorities count, and none of those knows this server's.
    unsetenv("SSL_CERT_FILE");
    const auto outcome = exchange(requestTo(server.url("/echo")));
    ASSERT_TRUE(outcome->error);
    EXPECT_EQ(outcome->error->code, kBadCertificate);
}

TEST(HTTPSession, RefusesHeaderFieldsThatWouldEndAndStartAnother) {
    constexpr int kBadArgument = 43;
    const std::pair<const char*, const char*> fields[] = {
        {"X-Field", "a\r\nX-Other: b"}, {"X-Field\nX-Other", "a"}, {"X Field", "a"}, {"", "a"}};
    for (const auto& [name, value] : fields) {
        HTTPRequest request = requestTo("https://localhost:1/");
        request.setHeaderField(name, value);
        const auto outcome = exchange(request);
        ASSERT_TRUE(outcome->error) << name;
        EXPECT_EQ(outcome->error->code, kBadArgument) << name;
    }
}

TEST(HTTPSession, AChallengeThatIsTurnedDownEndsTheExchange) {
    const TestHTTPServer server;
    auto outcome = std::make_shared<Outcome>();
    outcome->answer = ChallengeAnswer::Cancel;
    const auto session = HTTPSession::create(outcome);
    session->start(requestTo(server.url("/echo")));
    outcome->over.wait(kForever);
    EXPECT_TRUE(outcome->error);
    EXPECT_TRUE(outcome->statuses.empty());
}

TEST(HTTPSession, DeliversOnTheEventQueueInOrder) {
    const TestHTTPServer server;
    const auto outcome = exchange(requestTo(server.url("/limit")), WorkQueue("events"));
    EXPECT_EQ(outcome->queueLabel, "events");
    EXPECT_EQ(outcome->statuses, std::vector{200});
    EXPECT_EQ(outcome->body.size(), kMaxHTTPResponseBytes);
}

/// Waits until nobody holds the session any more: its exchange has ended and can report nothing further.
void waitUntilOver(std::shared_ptr<HTTPSession>& session) {
    const std::weak_ptr<HTTPSession> observed = session;
    session.reset();
    while (!observed.expired()) std::this_thread::yield();
}

TEST(HTTPSession, ACancelledExchangeEndsAtOnceAndInSilence) {
    constexpr auto kMuchLessThanAnExchangeMayTake = 20s;
    const TestHTTPServer server;
    const auto outcome = std::make_shared<Outcome>();
    auto session = HTTPSession::create(outcome);
    session->start(requestTo(server.url("/silence")));
    outcome->begun.wait(kForever);
    const auto before = std::chrono::steady_clock::now();
    session->invalidateAndCancel();
    session->start(requestTo(server.url("/half")));
    waitUntilOver(session);
    EXPECT_LT(std::chrono::steady_clock::now() - before, kMuchLessThanAnExchangeMayTake);
    EXPECT_EQ(outcome->completions, 0);
    EXPECT_EQ(outcome->statuses, std::vector{200});
}

}  // namespace
}  // namespace platform
