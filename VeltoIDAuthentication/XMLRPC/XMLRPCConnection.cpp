#include "XMLRPC/XMLRPCConnection.h"

#include <mutex>

#include "Platform/runtime/Clock.h"
#include "Platform/runtime/SystemLog.h"
#include "XMLRPC/XMLRPCHelpers.h"

namespace veltoid {
namespace {

constexpr int kNotModifiedStatus = 304;

Error transportError(const platform::HTTPError& error) {
    return {kTransportErrorDomain, error.code, {{kErrorDescriptionKey, error.description}}};
}

Error noClientError() { return transportError({0, "the HTTPS client library cannot be loaded"}); }

/// What one synchronous call and the HTTP session's delivery thread share. The first of two events decides:
/// the outcome of the exchange, or the end of the wait; the later one has no effect.
class SynchronousExchange : public platform::HTTPSessionEvents {
  public:
    // On the delivery thread, one after the other.
    void responseHeader(int statusCode) override { statusCode_ = statusCode; }
    void bodyBytes(platform::Bytes bytes) override { body_.insert(body_.end(), bytes.begin(), bytes.end()); }

    void completed(const std::optional<platform::HTTPError>& error) override {
        std::optional<XMLRPCResponse> response;
        if (!error && statusCode_ < kFirstHTTPErrorStatus) response.emplace(std::move(body_));
        end(std::move(response), error ? std::optional(transportError(*error)) : std::nullopt);
    }

    void giveUp() { end({}, {}); }

    /// Ends with `completed` or `giveUp`.
    void wait() const { (void)over_.wait(platform::kForever); }

    std::optional<XMLRPCResponse> takeResponse(ErrorOut error) {
        const std::lock_guard lock(mutex_);
        if (error_) fillError(error, std::move(error_));
        return std::move(response_);
    }

  private:
    void end(std::optional<XMLRPCResponse> response, std::optional<Error> error) {
        const std::lock_guard lock(mutex_);
        if (isOver_) return;
        isOver_ = true;
        response_ = std::move(response);
        error_ = std::move(error);
        over_.signal();
    }

    int statusCode_ = 0;
    platform::SecretBytes body_;

    const platform::Semaphore over_;
    std::mutex mutex_;
    bool isOver_ = false;
    std::optional<XMLRPCResponse> response_;
    std::optional<Error> error_;
};

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
    EndHandler whenEnded) {
    auto connection = std::make_shared<XMLRPCConnection>(Private(), std::move(request), std::move(delegate),
                                                         std::move(whenEnded));
    const std::shared_ptr<platform::HTTPSessionEvents> events(connection, connection.get());
    connection->session_ = platform::HTTPSession::create(events, platform::WorkQueue::main());
    const std::string name = connection->identifier_.text();
    if (!connection->session_) {
        VELTOID_PLATFORM_LOG(Error, "The session, " + name + ", could not be established!");
        return nullptr;
    }
    VELTOID_PLATFORM_LOG(Notice, "The session, " + name + ", has been established!");
    return connection;
}

XMLRPCConnection::XMLRPCConnection(Private, std::shared_ptr<XMLRPCRequest> request,
                                   std::shared_ptr<XMLRPCConnectionDelegate> delegate, EndHandler whenEnded)
    : whenEnded_(std::move(whenEnded)),
      request_(std::move(request)),
      identifier_(stringByGeneratingUUID()),
      delegate_(std::move(delegate)) {}

void XMLRPCConnection::start() { session_->start(request_->request()); }

void XMLRPCConnection::cancel() { session_->invalidateAndCancel(); }

platform::ChallengeAnswer XMLRPCConnection::challenge(const platform::ProtectionSpace& space) {
    constexpr auto kDefault = platform::ChallengeAnswer::PerformDefaultHandling;
    if (!delegate_->canAuthenticateAgainstProtectionSpace(*request_, space).value_or(true)) return kDefault;
    return delegate_->didReceiveAuthenticationChallenge(*request_, space).value_or(kDefault);
}

void XMLRPCConnection::responseHeader(int statusCode) {
    data_.clear();
    if (statusCode >= kFirstHTTPErrorStatus) {
        delegate_->didFailWithError(*request_, {kHTTPErrorDomain, statusCode, {}});
    } else if (statusCode == kNotModifiedStatus) {
        whenEnded_(identifier_);
    }
}

void XMLRPCConnection::bodyBytes(platform::Bytes bytes) {
    data_.insert(data_.end(), bytes.begin(), bytes.end());
}

void XMLRPCConnection::uploadProgress(uint64_t sent, uint64_t expected) {
    if (expected > 0)
        delegate_->didSendBodyData(*request_, static_cast<float>(sent) / static_cast<float>(expected));
}

void XMLRPCConnection::completed(const std::optional<platform::HTTPError>& error) {
    if (error) return sessionBecameInvalid(transportError(*error));
    if (!data_.empty()) delegate_->didReceiveResponse(*request_, XMLRPCResponse(std::move(data_)));
    whenEnded_(identifier_);
}

void XMLRPCConnection::sessionBecameInvalid(const Error& error) {
    VELTOID_PLATFORM_LOG(Error, "The connection, " + identifier_.text() +
                                    ", failed with the following error: " +
                                    error.userInfo.string(kErrorDescriptionKey).text());
    delegate_->didFailWithError(*request_, error);
    whenEnded_(identifier_);
}

}  // namespace veltoid
