// HTTPS client sessions (libcurl, loaded on first use so that start-up does not pay for it).
//
// A session carries one exchange. No cookies, no redirects, no connection kept afterwards; TLS 1.2 or newer;
// the server's certificate and name are always verified, against the system's hashed certificate directory
// (looked up as needed) or the file that SSL_CERT_FILE names. Only https URLs are accepted.
#pragma once

#include <memory>
#include <optional>

#include "Platform/net/HTTPExchange.h"
#include "Platform/runtime/WorkQueue.h"

namespace platform {

/// All operations may be called from any thread.
class HTTPSession {
  public:
    virtual ~HTTPSession() = default;

    /// Null when the HTTPS client library cannot be loaded.
    static std::shared_ptr<HTTPSession> create(std::shared_ptr<HTTPSessionEvents> events,
                                               std::optional<WorkQueue> eventQueue = std::nullopt);

    /// Starts the one exchange of this session.
    virtual void start(HTTPRequest request) = 0;

    /// Ends a running exchange; no event is delivered once this has returned, except one already being
    /// handled.
    virtual void invalidateAndCancel() = 0;
};

/// Where a lifetime's sessions come from.
class HTTPSessionFactory {
  public:
    virtual ~HTTPSessionFactory() = default;
    virtual std::shared_ptr<HTTPSession> create(std::shared_ptr<HTTPSessionEvents> events,
                                                std::optional<WorkQueue> eventQueue) = 0;
};

/// Whether the library can be loaded. The first call, here or through HTTPSession, loads it for good and
/// takes some milliseconds; later ones only read the outcome. Any thread.
bool isHTTPSClientAvailable();

}  // namespace platform
