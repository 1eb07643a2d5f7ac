// One HTTPS exchange on libcurl: how a request is put to the library, and what comes back. Internal to the
// HTTPS client.
#pragma once

#include <atomic>
#include <memory>
#include <optional>

#include "Platform/net/HTTPExchange.h"

namespace platform {

/// Made, run and destroyed on one thread, except for wakeUp.
class CurlExchange {
  public:
    /// Whether the library and all the functions that are in use could be loaded; the first call loads it,
    /// for the life of the process. Any thread.
    static bool isLibraryAvailable();

    /// Only when the library is available. Request and events must outlive the exchange.
    static std::unique_ptr<CurlExchange> create(const HTTPRequest& request, HTTPSessionEvents& events);
    virtual ~CurlExchange() = default;

    /// Runs until the exchange has ended or `cancelled` is set, telling the events everything but the
    /// completion. None when the response arrived whole, whatever its status.
    virtual std::optional<HTTPError> run(const std::atomic<bool>& cancelled) = 0;

    /// Makes `run` look at `cancelled`. Any thread.
    virtual void wakeUp() = 0;
};

}  // namespace platform
