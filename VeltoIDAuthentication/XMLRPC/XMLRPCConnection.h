// Carries XML-RPC requests over HTTPS: one call that waits, and an event-driven connection that reports to a
// delegate.
#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "Platform/net/HTTPSession.h"
#include "Values/Error.h"
#include "XMLRPC/XMLRPCRequest.h"
#include "XMLRPC/XMLRPCResponse.h"

namespace veltoid {

/// How long a synchronous call waits for the server.
inline constexpr double kSynchronousTimeoutSeconds = 5.0;

/// Who calls, for platforms whose HTTP sessions carry an identity context. Linux has none: sessions go
/// without.
inline constexpr const char* kIdentityContextIdentifier = "com.velto.harbwell.veltoidauthagent";

/// The exchange did not take place; the code is the HTTPS client library's.
inline constexpr std::string_view kTransportErrorDomain = "HWTransportErrorDomain";
/// The server answered with a status of 400 or above; the code is the status.
inline constexpr std::string_view kHTTPErrorDomain = "HTTP";

/// The first status that is a failure.
inline constexpr int kFirstHTTPErrorStatus = 400;

/// Told how an event-driven connection went, on the main queue. An optional operation that is not offered
/// returns none.
class XMLRPCConnectionDelegate {
  public:
    virtual ~XMLRPCConnectionDelegate() = default;

    /// The exchange completed with a body.
    virtual void didReceiveResponse(const XMLRPCRequest& request, const XMLRPCResponse& response) = 0;
    /// The exchange failed, or the HTTP status was 400 or above.
    virtual void didFailWithError(const XMLRPCRequest& request, const Error& error) = 0;

    /// Bytes sent divided by bytes expected.
    virtual void didSendBodyData(const XMLRPCRequest&, float /*fraction*/) {}
    /// Whether this delegate takes challenges of that space; after false it is not asked further.
    virtual std::optional<bool> canAuthenticateAgainstProtectionSpace(const XMLRPCRequest&,
                                                                      const platform::ProtectionSpace&) {
        return std::nullopt;
    }
    virtual std::optional<platform::ChallengeAnswer> didReceiveAuthenticationChallenge(
        const XMLRPCRequest&, const platform::ProtectionSpace&) {
        return std::nullopt;
    }
};

/// The event-driven form. Its HTTP session reports to it on the main queue. It reports its end (failure,
/// status 304, completion) to its owner, which then lets go of it.
class XMLRPCConnection : private platform::HTTPSessionEvents,
                         public std::enable_shared_from_this<XMLRPCConnection> {
    struct Private {};

  public:
    /// Sends the request and waits for the answer, at most kSynchronousTimeoutSeconds; a later one is
    /// discarded. None when the exchange failed (`error` says why), when the status was 400 or above or
    /// nothing came in time (`error` is not touched). Blocks; any thread that may.
    static std::optional<XMLRPCResponse> sendSynchronousXMLRPCRequest(const XMLRPCRequest& request,
                                                                      ErrorOut error);

    /// Called with the connection's identifier when it has ended, on the main queue.
    using EndHandler = std::function<void(const String& identifier)>;

    /// A connection that has not started yet; null when there is no HTTP session to be had.
    static std::shared_ptr<XMLRPCConnection> initWithXMLRPCRequest(
        std::shared_ptr<XMLRPCRequest> request, std::shared_ptr<XMLRPCConnectionDelegate> delegate,
        EndHandler whenEnded);

    XMLRPCConnection(Private, std::shared_ptr<XMLRPCRequest> request,
                     std::shared_ptr<XMLRPCConnectionDelegate> delegate, EndHandler whenEnded);

    const String& identifier() const { return identifier_; }
    const std::shared_ptr<XMLRPCConnectionDelegate>& delegate() const { return delegate_; }

    /// Sends the request. Once.
    void start();

    /// Ends the exchange; the delegate hears nothing further, except what it is being told already.
    void cancel();

  private:
    platform::ChallengeAnswer challenge(const platform::ProtectionSpace& space) override;
    void responseHeader(int statusCode) override;
    void bodyBytes(platform::Bytes bytes) override;
    void uploadProgress(uint64_t sent, uint64_t expected) override;
    void completed(const std::optional<platform::HTTPError>& error) override;

    void sessionBecameInvalid(const Error& error);

    const EndHandler whenEnded_;
    const std::shared_ptr<XMLRPCRequest> request_;
    const String identifier_;
    platform::SecretBytes data_;
    std::shared_ptr<platform::HTTPSession> session_;
    const std::shared_ptr<XMLRPCConnectionDelegate> delegate_;
};

}  // namespace veltoid
