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
    CurlExchange(const HTTPRequest& request, HTTPSessionEvents& events);
    ~CurlExchange();
    CurlExchange(const CurlExchange&) = delete;
    CurlExchange& operator=(const CurlExchange&) = delete;

    /// Runs until the exchange has ended or `cancelled` is set, telling the events everything but the
    /// completion. None when the response arrived whole, whatever its status.
    std::optional<HTTPError> run(const std::atomic<bool>& cancelled);

    /// Makes `run` look at `cancelled`. Any thread.
    void wakeUp();

  private:
    class Transfer;
    std::unique_ptr<Transfer> transfer_;
};

}  // namespace platform
