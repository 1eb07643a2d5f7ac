#include "Platform/net/CurlExchange.h"

#include <curl/curl.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <string>

#include "Platform/crypto/OpenSSLLibrary.h"
#include "Platform/runtime/LazyLibrary.h"
#include "Platform/runtime/SystemLog.h"

namespace platform {
namespace {

// --- The library

// As macros with arguments they would stand in the way of the functions' own names.
#undef curl_easy_setopt
#undef curl_easy_getinfo

#define VELTOID_CURL_FUNCTIONS                                                                               \
    curl_easy_cleanup, curl_easy_getinfo, curl_easy_init, curl_easy_setopt, curl_easy_strerror, curl_free,   \
        curl_global_init, curl_multi_add_handle, curl_multi_cleanup, curl_multi_info_read, curl_multi_init,  \
        curl_multi_perform, curl_multi_poll, curl_multi_remove_handle, curl_multi_wakeup, curl_slist_append, \
        curl_slist_free_all, curl_url, curl_url_cleanup, curl_url_get, curl_url_set

constinit const LazyLibrary library("libcurl.so.4");
VELTOID_LAZY_FUNCTIONS(library, VELTOID_CURL_FUNCTIONS);

bool load() {
    const auto areProvided = [](const auto&... function) {
        // There are builds on other TLS libraries.
        return library.provides({function.name()..., "OPENSSL_init_crypto"});
    };
    if (!areProvided(VELTOID_CURL_FUNCTIONS)) return false;
    // Before the library makes use of it.
    openssl::prepare();
    if (curl_global_init(CURL_GLOBAL_DEFAULT) == CURLE_OK) return true;
    VELTOID_PLATFORM_LOG(Error, "cannot initialise the HTTPS client library");
    return false;
}

// --- The exchange

/// No exchange goes on longer, even if its owner has forgotten it.
constexpr long kMaxExchangeSeconds = 60;

/// A wake-up, a socket or one of the library's own timers ends a wait before.
constexpr int kPollMilliseconds = kMaxExchangeSeconds * 1000;

constexpr const char* kCertificateDirectory = "/etc/ssl/certs";
constexpr const char* kCertificateFileVariable = "SSL_CERT_FILE";

constexpr long kFirstFinalStatus = 200;

bool isFieldName(std::string_view name) {
    constexpr std::string_view kOthers = "!#$%&'*+-.^_`|~";
    const auto isTokenCharacter = [&](char c) {
        return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
               kOthers.find(c) != std::string_view::npos;
    };
    return !name.empty() && std::all_of(name.begin(), name.end(), isTokenCharacter);
}

/// Without characters that would end the field and start another.
bool isFieldValue(std::string_view value) {
    return std::none_of(value.begin(), value.end(), [](char c) {
        return (static_cast<unsigned char>(c) < ' ' && c != '\t') || c == '\x7F';
    });
}

/// The exchange in the library's terms.
class Transfer : public CurlExchange {
  public:
    Transfer(const HTTPRequest& request, HTTPSessionEvents& events)
        : events_(events), url_(request.url), easy_(curl_easy_init()), multi_(curl_multi_init()) {
        if (!easy_ || !multi_) {
            failure_ = CURLE_FAILED_INIT;
            return;
        }
        setTransportOptions();
        setTrustAnchors();
        setCallbacks();
        setRequest(request);
    }

    std::optional<HTTPError> run(const std::atomic<bool>& cancelled) override {
        if (failure_ != CURLE_OK) return errorOf(failure_);
        if (curl_multi_add_handle(multi_.get(), easy_.get()) != CURLM_OK) return errorOf(CURLE_FAILED_INIT);
        const bool ended = drive(cancelled);
        std::optional<HTTPError> error = ended ? outcome() : errorOf(CURLE_ABORTED_BY_CALLBACK);
        curl_multi_remove_handle(multi_.get(), easy_.get());
        return error;
    }

    void wakeUp() override {
        if (multi_) curl_multi_wakeup(multi_.get());
    }

  private:
    template <typename Value>
    void set(CURLoption option, Value value) {
        const CURLcode code = curl_easy_setopt(easy_.get(), option, value);
        if (failure_ == CURLE_OK) failure_ = code;
    }

    void setTransportOptions() {
        set(CURLOPT_PROTOCOLS_STR, "https");
        set(CURLOPT_FOLLOWLOCATION, 0L);
        set(CURLOPT_SSLVERSION, static_cast<long>(CURL_SSLVERSION_TLSv1_2));
        set(CURLOPT_SSL_VERIFYPEER, 1L);
        set(CURLOPT_SSL_VERIFYHOST, 2L);
        // One exchange has no use for streams and their set-up.
        set(CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_1_1));
        set(CURLOPT_FRESH_CONNECT, 1L);
        set(CURLOPT_FORBID_REUSE, 1L);
        set(CURLOPT_SSL_SESSIONID_CACHE, 0L);
        set(CURLOPT_TCP_NODELAY, 1L);
        set(CURLOPT_NOSIGNAL, 1L);
        set(CURLOPT_NETRC, static_cast<long>(CURL_NETRC_IGNORED));
        set(CURLOPT_TIMEOUT, kMaxExchangeSeconds);
        set(CURLOPT_MAXFILESIZE_LARGE, static_cast<curl_off_t>(kMaxHTTPResponseBytes));
        // Proxies stay at the library's default: https_proxy and no_proxy of the environment are followed,
        // the TLS session going through the proxy's tunnel to the server itself. The tunnel's own header is
        // not the response's.
        set(CURLOPT_SUPPRESS_CONNECT_HEADERS, 1L);
    }

    void setTrustAnchors() {
        // The directory is looked up by hash when a chain is checked, while the bundle that the library is
        // built with would be parsed as a whole for every exchange.
        const char* file =
            std::getenv(kCertificateFileVariable);  // NOLINT(concurrency-mt-unsafe): nothing sets it
        const bool hasFile = file != nullptr && *file != '\0';
        set(CURLOPT_CAINFO, hasFile ? file : static_cast<const char*>(nullptr));
        set(CURLOPT_CAPATH, hasFile ? static_cast<const char*>(nullptr) : kCertificateDirectory);
    }

    void setCallbacks() {
        set(CURLOPT_SSL_CTX_FUNCTION, &Transfer::onTLSContext);
        set(CURLOPT_SSL_CTX_DATA, this);
        set(CURLOPT_HEADERFUNCTION, &Transfer::onHeader);
        set(CURLOPT_HEADERDATA, this);
        set(CURLOPT_WRITEFUNCTION, &Transfer::onBody);
        set(CURLOPT_WRITEDATA, this);
        set(CURLOPT_XFERINFOFUNCTION, &Transfer::onProgress);
        set(CURLOPT_XFERINFODATA, this);
        set(CURLOPT_NOPROGRESS, 0L);
    }

    void setRequest(const HTTPRequest& request) {
        set(CURLOPT_URL, request.url.c_str());
        if (request.method != "GET" || !request.body.empty()) {
            set(CURLOPT_POST, 1L);
            // Not copied: the body stays where it is wiped.
            set(CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(request.body.size()));
            set(CURLOPT_POSTFIELDS, request.body.data());
            if (request.method != "POST") set(CURLOPT_CUSTOMREQUEST, request.method.c_str());
        }
        for (const auto& [name, value] : request.headerFields) {
            // The library writes the body's true length.
            if (strcasecmp(name.c_str(), "Content-Length") != 0) addHeaderField(name, value);
        }
        // Without this, larger bodies wait a second for a server's leave to come.
        headerFields_.reset(curl_slist_append(headerFields_.release(), "Expect:"));
        set(CURLOPT_HTTPHEADER, headerFields_.get());
    }

    void addHeaderField(std::string_view name, std::string_view value) {
        if (!isFieldName(name) || !isFieldValue(value)) {
            if (failure_ == CURLE_OK) failure_ = CURLE_BAD_FUNCTION_ARGUMENT;
            return;
        }
        // To the library a name with a colon and nothing behind it means that the field is to be left out.
        const std::string line = std::string(name) + (value.empty() ? ";" : ": " + std::string(value));
        headerFields_.reset(curl_slist_append(headerFields_.release(), line.c_str()));
    }

    bool drive(const std::atomic<bool>& cancelled) {
        while (!cancelled) {
            int running = 0;
            if (curl_multi_perform(multi_.get(), &running) != CURLM_OK) return false;
            if (running == 0) return true;
            if (curl_multi_poll(multi_.get(), nullptr, 0, kPollMilliseconds, nullptr) != CURLM_OK)
                return false;
        }
        return false;
    }

    std::optional<HTTPError> outcome() {
        int left = 0;
        const CURLMsg* message = curl_multi_info_read(multi_.get(), &left);
        const CURLcode code =
            message != nullptr && message->msg == CURLMSG_DONE ? message->data.result : CURLE_FAILED_INIT;
        if (code == CURLE_OK) return std::nullopt;
        // A callback that ended the exchange knows better than the library why.
        return errorOf(failure_ != CURLE_OK ? failure_ : code);
    }

    static HTTPError errorOf(CURLcode code) { return {code, curl_easy_strerror(code)}; }

    ProtectionSpace protectionSpace() const {
        ProtectionSpace space{{}, 0, "ServerTrust"};
        const LazyOwner<CURLU, curl_url_cleanup> url(curl_url());
        if (curl_url_set(url.get(), CURLUPART_URL, url_.c_str(), 0) != CURLUE_OK) return space;
        const auto read = [&](CURLUPart which, unsigned flags) {
            char* part = nullptr;
            const CURLUcode code = curl_url_get(url.get(), which, &part, flags);
            const LazyOwner<char, curl_free> owner(part);
            return code == CURLUE_OK ? std::string(part) : std::string();
        };
        space.host = read(CURLUPART_HOST, 0);
        space.port = std::atoi(read(CURLUPART_PORT, CURLU_DEFAULT_PORT).c_str());
        return space;
    }

    /// Whether the receiver took the event: nothing may be thrown through the library's frames.
    template <typename Deliver>
    bool delivered(Deliver deliver) noexcept {
        try {
            deliver(events_);
            return true;
        } catch (...) {
            failure_ = CURLE_ABORTED_BY_CALLBACK;
            return false;
        }
    }

    /// The TLS session is about to begin. Whatever the answer, the server's certificate is verified.
    static CURLcode onTLSContext(CURL*, void*, void* exchange) noexcept {
        auto& self = *static_cast<Transfer*>(exchange);
        if (std::exchange(self.wasChallenged_, true)) return CURLE_OK;
        ChallengeAnswer answer = ChallengeAnswer::Cancel;
        self.delivered([&](HTTPSessionEvents& events) { answer = events.challenge(self.protectionSpace()); });
        if (answer == ChallengeAnswer::PerformDefaultHandling) return CURLE_OK;
        self.failure_ = CURLE_ABORTED_BY_CALLBACK;
        return CURLE_ABORTED_BY_CALLBACK;
    }

    /// Called for every line of every header; the empty line that ends the final one is the event.
    static size_t onHeader(char* line, size_t size, size_t count, void* exchange) noexcept {
        auto& self = *static_cast<Transfer*>(exchange);
        const std::string_view text(line, size * count);
        if (self.hasHeader_ || text.find_first_not_of("\r\n") != std::string_view::npos) return text.size();
        long status = 0;
        curl_easy_getinfo(self.easy_.get(), CURLINFO_RESPONSE_CODE, &status);
        if (status < kFirstFinalStatus) return text.size();
        self.hasHeader_ = true;
        const bool taken = self.delivered(
            [=](HTTPSessionEvents& events) { events.responseHeader(static_cast<int>(status)); });
        return taken ? text.size() : 0;
    }

    static size_t onBody(char* bytes, size_t size, size_t count, void* exchange) noexcept {
        auto& self = *static_cast<Transfer*>(exchange);
        const std::string_view piece(bytes, size * count);
        self.bodyBytes_ += piece.size();
        if (self.bodyBytes_ > kMaxHTTPResponseBytes) {
            self.failure_ = CURLE_FILESIZE_EXCEEDED;
            return 0;
        }
        return self.delivered([=](HTTPSessionEvents& events) { events.bodyBytes(bytesOf(piece)); })
                   ? piece.size()
                   : 0;
    }

    static int onProgress(void* exchange, curl_off_t, curl_off_t, curl_off_t expected,
                          curl_off_t sent) noexcept {
        auto& self = *static_cast<Transfer*>(exchange);
        if (sent <= self.reportedSent_) return 0;
        self.reportedSent_ = sent;
        const bool taken = self.delivered([=](HTTPSessionEvents& events) {
            events.uploadProgress(static_cast<uint64_t>(sent),
                                  static_cast<uint64_t>(std::max(expected, sent)));
        });
        return taken ? 0 : 1;
    }

    HTTPSessionEvents& events_;
    const std::string& url_;
    LazyOwner<curl_slist, curl_slist_free_all> headerFields_;
    LazyOwner<CURL, curl_easy_cleanup> easy_;
    LazyOwner<CURLM, curl_multi_cleanup> multi_;
    /// The first thing that went wrong on this side of the library.
    CURLcode failure_ = CURLE_OK;
    bool wasChallenged_ = false;
    bool hasHeader_ = false;
    size_t bodyBytes_ = 0;
    curl_off_t reportedSent_ = 0;
};

}  // namespace

bool CurlExchange::isLibraryAvailable() {
    static const bool isAvailable = load();
    return isAvailable;
}

std::unique_ptr<CurlExchange> CurlExchange::create(const HTTPRequest& request, HTTPSessionEvents& events) {
    return std::make_unique<Transfer>(request, events);
}

}  // namespace platform
