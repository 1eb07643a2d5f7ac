// One HTTPS exchange on libcurl: how a request is put to the library, and what comes back. Internal to the
// HTTPS client.
#pragma once

#include <atomic>
#include <memory>

#include "Platform/CurlLibrary.h"
#include "Platform/HTTPSession.h"

namespace platform {

/// Made, run and destroyed on one thread, except for wakeUp.
class CurlExchange {
  public:
    /// Request and events must outlive the exchange.
    CurlExchange(const CurlLibrary& curl, const HTTPRequest& request, HTTPSessionEvents& events);
    CurlExchange(const CurlExchange&) = delete;
    CurlExchange& operator=(const CurlExchange&) = delete;

    /// Runs until the exchange has ended or `cancelled` is set, telling the events everything but the
    /// completion. None when the response arrived whole, whatever its status.
    std::optional<HTTPError> run(const std::atomic<bool>& cancelled);

    /// Makes `run` look at `cancelled`. Any thread.
    void wakeUp();

  private:
    struct EasyDeleter {
        const CurlLibrary* curl;
        void operator()(CURL* handle) const { curl->easyCleanup(handle); }
    };
    struct MultiDeleter {
        const CurlLibrary* curl;
        void operator()(CURLM* handle) const { curl->multiCleanup(handle); }
    };
    struct ListDeleter {
        const CurlLibrary* curl;
        void operator()(curl_slist* list) const { curl->slistFreeAll(list); }
    };

    template <typename Value>
    void set(CURLoption option, Value value);
    template <typename Deliver>
    bool delivered(Deliver deliver) noexcept;

    void setTransportOptions();
    void setTrustAnchors();
    void setCallbacks();
    void setRequest(const HTTPRequest& request);
    void addHeaderField(std::string_view name, std::string_view value);

    bool drive(const std::atomic<bool>& cancelled);
    std::optional<HTTPError> outcome();
    HTTPError errorOf(CURLcode code) const;
    ProtectionSpace protectionSpace() const;

    // The library's callbacks.
    static CURLcode onTLSContext(CURL*, void* context, void* exchange) noexcept;
    static size_t onHeader(char* line, size_t size, size_t count, void* exchange) noexcept;
    static size_t onBody(char* bytes, size_t size, size_t count, void* exchange) noexcept;
    static int onProgress(void* exchange, curl_off_t, curl_off_t, curl_off_t expected,
                          curl_off_t sent) noexcept;

    const CurlLibrary& curl_;
    HTTPSessionEvents& events_;
    const std::string& url_;
    std::unique_ptr<curl_slist, ListDeleter> headerFields_;
    std::unique_ptr<CURL, EasyDeleter> easy_;
    std::unique_ptr<CURLM, MultiDeleter> multi_;
    /// The first thing that went wrong on this side of the library.
    CURLcode failure_ = CURLE_OK;
    bool wasChallenged_ = false;
    bool hasHeader_ = false;
    size_t bodyBytes_ = 0;
    curl_off_t reportedSent_ = 0;
};

}  // namespace platform
