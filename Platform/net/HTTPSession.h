// HTTPS client sessions (libcurl, loaded on first use so that start-up does not pay for it).
//
// A session carries one exchange. No cookies, no redirects, no connection kept afterwards; TLS 1.2 or newer;
// the server's certificate and name are always verified, against the system's hashed certificate directory
// (looked up as needed) or the file that SSL_CERT_FILE names. Only https URLs are accepted.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Platform/runtime/SecureMemory.h"
#include "Platform/runtime/WorkQueue.h"

namespace platform {

/// The largest response body that is accepted; a larger one fails the exchange.
inline constexpr size_t kMaxHTTPResponseBytes = 16U << 20U;

struct HTTPRequest {
    std::string url;
    std::string method = "GET";
    /// One value per name; names are compared without regard to case.
    std::vector<std::pair<std::string, std::string>> headerFields;
    SecretText body;
    bool handlesCookies = true;

    /// Replaces an earlier value of that name.
    void setHeaderField(std::string_view name, std::string_view value);
    /// Null when the field is not set.
    const std::string* headerField(std::string_view name) const;
};

/// Why an exchange did not complete: the domain names the layer, the text never holds request or response
/// content.
struct HTTPError {
    int64_t code = 0;
    std::string description;
};

/// What a server-trust challenge is about.
struct ProtectionSpace {
    std::string host;
    int port = 0;
    std::string authenticationMethod;
};

enum class ChallengeAnswer { PerformDefaultHandling, Cancel };

/// Receives the events of one exchange on the session's event queue, or on its delivery thread when it has
/// none.
class HTTPSessionEvents {
  public:
    virtual ~HTTPSessionEvents() = default;
    virtual ChallengeAnswer challenge(const ProtectionSpace&) {
        return ChallengeAnswer::PerformDefaultHandling;
    }
    virtual void responseHeader(int statusCode) = 0;
    virtual void bodyBytes(Bytes bytes) = 0;
    virtual void uploadProgress(uint64_t /*sent*/, uint64_t /*expected*/) {}
    /// Last event of a started exchange, called exactly once unless the session was cancelled before.
    virtual void completed(const std::optional<HTTPError>& error) = 0;
};

/// All operations may be called from any thread.
class HTTPSession {
  public:
    using Factory = std::function<std::shared_ptr<HTTPSession>(std::shared_ptr<HTTPSessionEvents>,
                                                               std::optional<WorkQueue> eventQueue)>;

    virtual ~HTTPSession() = default;

    /// Null when the HTTPS client library cannot be loaded.
    static std::shared_ptr<HTTPSession> create(std::shared_ptr<HTTPSessionEvents> events,
                                               std::optional<WorkQueue> eventQueue = std::nullopt);

    /// Tests only: sessions come from `factory` until it is replaced by an empty one.
    static void replaceFactory(Factory factory);

    /// Starts the one exchange of this session.
    virtual void start(HTTPRequest request) = 0;

    /// Ends a running exchange; no event is delivered once this has returned, except one already being
    /// handled.
    virtual void invalidateAndCancel() = 0;
};

}  // namespace platform
