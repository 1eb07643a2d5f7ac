#include "XMLRPC/XMLRPCConnection.h"

#include <mutex>

#include "Platform/runtime/Clock.h"
#include "Platform/runtime/SystemLog.h"
#include "XMLRPC/XMLRPCConnectionManager.h"
#include "XMLRPC/XMLRPCHelpers.h"

namespace veltoid {
namespace {

constexpr int kNotModifiedStatus = 304;

Error transportError(const platform::HTTPError& error) {
    return {kTransportErrorDomain, error.code, {{kErrorDescriptionKey, error.description}}};
}

Error noClientError() { return transportError({0, "the HTTPS client library cannot be loaded"}); }

/// What one synchronous call and the HTTP session's delivery thread share: whoever comes first, the outcome
/// or the end of the wait, closes it for the other.
class SynchronousExchange : public platform::HTTPSessionEvents {
  public:
    // On the delivery thread, one after the other.
    void responseHeader(int statusCode) override { statusCode_ = statusCode; }
    void bodyBytes(platform::Bytes bytes) override { body_.insert(body_.end(), bytes.begin(), bytes.end()); }

    void completed(const std::optional<platform::HTTPError>& error) override {
        std::optional<XMLRPCResponse> response;
        if (!error && statusCode_ < kFirstHTTPErrorStatus) response.emplace(std::move(body_));
        const std::lock_guard lock(mutex_);
        if (isOver_) return;
        isOver_ = true;
        response_ = std::move(response);
        if (error) error_ = transportError(*error);
        over_.signal();
    }

    void giveUp() {
        const std::lock_guard lock(mutex_);
        if (isOver_) return;
        isOver_ = true;
        over_.signal();
    }

    /// Ends with `completed` or `giveUp`.
    void wait() const { (void)over_.wait(platform::kForever); }

    std::optional<XMLRPCResponse> takeResponse(ErrorOut error) {
        const std::lock_guard lock(mutex_);
        if (error_) fillError(error, std::move(error_));
        return std::move(response_);
    }

  private:
    int statusCode_ = 0;
    platform::SecretBytes body_;

    const platform::Semaphore over_;
    std::mutex mutex_;
    bool isOver_ = false;
    std::optional<XMLRPCResponse> response_;
    std::optional<Error> error_;
};

void logLine(platform::LogPriority priority, const std::string& text, int line, std::string_view function) {
    const std::string* queue = platform::WorkQueue::currentLabel();
    platform::SystemLog::shared().write(priority, text,
                                        {__FILE_NAME__, line, function, queue ? *queue : std::string_view()});
}

}  // namespace

std::optional<XMLRPCResponse> XMLRPCConnection::sendSynchronousXMLRPCRequest(const XMLRPCRequest& request,
                                                                             ErrorOut error) {
    const auto exchange = std::make_shared<SynchronousExchange>();
    const auto session = platform::HTTPSession::create(exchange);
    if (!session) {
        fillError(error, noClientError());
        return std::nullopt;
    }
    // A timer of its own rather than a wait with a limit: that one also ends when the date is set, and
    // setting the date is no reason to give up a call.
    platform::Clock& clock = platform::Clock::shared();
    const auto timer = clock.callAfter(kSynchronousTimeoutSeconds, platform::Clock::Use::Wait,
                                       [exchange] { exchange->giveUp(); });
    session->start(request.request());
    exchange->wait();
    clock.cancel(timer);
    session->invalidateAndCancel();
    return exchange->takeResponse(error);
}

std::shared_ptr<XMLRPCConnection> XMLRPCConnection::initWithXMLRPCRequest(
    std::shared_ptr<XMLRPCRequest> request, std::shared_ptr<XMLRPCConnectionDelegate> delegate,
    XMLRPCConnectionManager& manager) {
    auto connection =
        std::make_shared<XMLRPCConnection>(Private(), std::move(request), std::move(delegate), manager);
    const std::shared_ptr<platform::HTTPSessionEvents> events(connection, connection.get());
    connection->mySession = platform::HTTPSession::create(events, platform::WorkQueue::main());
    const std::string name = connection->myIdentifier.text();
    if (!connection->mySession) {
        logLine(platform::LogPriority::Error, "The session, " + name + ", could not be established!",
                __LINE__, __func__);
        return nullptr;
    }
    logLine(platform::LogPriority::Notice, "The session, " + name + ", has been established!", __LINE__,
            __func__);
    return connection;
}

XMLRPCConnection::XMLRPCConnection(Private, std::shared_ptr<XMLRPCRequest> request,
                                   std::shared_ptr<XMLRPCConnectionDelegate> delegate,
                                   XMLRPCConnectionManager& manager)
    : myManager(manager),
      myRequest(std::move(request)),
      myIdentifier(stringByGeneratingUUID()),
      myDelegate(std::move(delegate)) {}

void XMLRPCConnection::start() { mySession->start(myRequest->request()); }

void XMLRPCConnection::cancel() { mySession->invalidateAndCancel(); }

void XMLRPCConnection::close() { myManager.closeConnectionForIdentifier(myIdentifier); }

platform::ChallengeAnswer XMLRPCConnection::challenge(const platform::ProtectionSpace& space) {
    constexpr auto kDefault = platform::ChallengeAnswer::PerformDefaultHandling;
    if (!myDelegate->canAuthenticateAgainstProtectionSpace(*myRequest, space).value_or(true)) return kDefault;
    return myDelegate->didReceiveAuthenticationChallenge(*myRequest, space).value_or(kDefault);
}

void XMLRPCConnection::responseHeader(int statusCode) {
    myData.clear();
    if (statusCode >= kFirstHTTPErrorStatus) {
        myDelegate->didFailWithError(*myRequest, {kHTTPErrorDomain, statusCode, {}});
    } else if (statusCode == kNotModifiedStatus) {
        close();
    }
}

void XMLRPCConnection::bodyBytes(platform::Bytes bytes) {
    myData.insert(myData.end(), bytes.begin(), bytes.end());
}

void XMLRPCConnection::uploadProgress(uint64_t sent, uint64_t expected) {
    if (expected > 0)
        myDelegate->didSendBodyData(*myRequest, static_cast<float>(sent) / static_cast<float>(expected));
}

void XMLRPCConnection::completed(const std::optional<platform::HTTPError>& error) {
    if (error) return sessionBecameInvalid(transportError(*error));
    if (!myData.empty()) myDelegate->didReceiveResponse(*myRequest, XMLRPCResponse(std::move(myData)));
    close();
}

void XMLRPCConnection::sessionBecameInvalid(const Error& error) {
    logLine(platform::LogPriority::Error,
            "The connection, " + myIdentifier.text() +
                ", failed with the following error: " + error.userInfo.string(kErrorDescriptionKey).text(),
            __LINE__, __func__);
    myDelegate->didFailWithError(*myRequest, error);
    close();
}

}  // namespace veltoid
