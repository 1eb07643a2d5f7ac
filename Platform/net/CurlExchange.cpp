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

// The functions that are in use.
#define VELTOID_CURL_FUNCTIONS(each)                                                                        \
    each(curl_easy_cleanup) each(curl_easy_getinfo) each(curl_easy_init) each(curl_easy_setopt)             \
        each(curl_easy_strerror) each(curl_free) each(curl_multi_add_handle) each(curl_multi_cleanup)       \
            each(curl_multi_info_read) each(curl_multi_init) each(curl_multi_perform) each(curl_multi_poll) \
                each(curl_multi_remove_handle) each(curl_multi_wakeup) each(curl_slist_append)              \
                    each(curl_slist_free_all) each(curl_url) each(curl_url_cleanup) each(curl_url_get)      \
                        each(curl_url_set)

#define VELTOID_CURL_NAME(function) #function,
#define VELTOID_CURL_FUNCTION(function) VELTOID_LAZY_FUNCTION(library, function);

constinit const LazyLibrary library("libcurl.so.4");
VELTOID_LAZY_FUNCTION(library, curl_global_init);
VELTOID_CURL_FUNCTIONS(VELTOID_CURL_FUNCTION)

bool load() {
    // There are builds on other TLS libraries.
    if (!library.provides(
            {VELTOID_CURL_FUNCTIONS(VELTOID_CURL_NAME) "curl_global_init", "OPENSSL_init_crypto"}))
        return false;
    // Before the library makes use of it.
    openssl::prepare();
    if (curl_global_init(CURL_GLOBAL_DEFAULT) == CURLE_OK) return true;
    VELTOID_PLATFORM_LOG(Error, "cannot initialise the HTTPS client library");
    return false;
}

// --- The exchange

/// No exchange goes on longer, even if its owner has forgotten it.
constexpr long kLongestExchangeSeconds = 60;

/// A wake-up, a socket or one of the library's own timers ends a wait before.
constexpr int kPollMilliseconds = kLongestExchangeSeconds * 1000;

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

}  // namespace

/// The exchange itself, in the library's terms.
class CurlExchange::Transfer {
  public:
    /// Request and events must outlive the exchange.
    Transfer(const HTTPRequest& request, HTTPSessionEvents& events);
    Transfer(const Transfer&) = delete;
    Transfer& operator=(const Transfer&) = delete;

    /// Runs until the exchange has ended or `cancelled` is set, telling the events everything but the
    /// completion. None when the response arrived whole, whatever its status.
    std::optional<HTTPError> run(const std::atomic<bool>& cancelled);

    /// Makes `run` look at `cancelled`. Any thread.
    void wakeUp();

  private:
    struct EasyDeleter {
        void operator()(CURL* handle) const { curl_easy_cleanup(handle); }
    };
    struct MultiDeleter {
        void operator()(CURLM* handle) const { curl_multi_cleanup(handle); }
    };
    struct ListDeleter {
        void operator()(curl_slist* list) const { curl_slist_free_all(list); }
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

CurlExchange::Transfer::Transfer(const HTTPRequest& request, HTTPSessionEvents& events)
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

template <typename Value>
void CurlExchange::Transfer::set(CURLoption option, Value value) {
    const CURLcode code = curl_easy_setopt(easy_.get(), option, value);
    if (failure_ == CURLE_OK) failure_ = code;
}

void CurlExchange::Transfer::setTransportOptions() {
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
    set(CURLOPT_TIMEOUT, kLongestExchangeSeconds);
    set(CURLOPT_MAXFILESIZE_LARGE, static_cast<curl_off_t>(kMaxHTTPResponseBytes));
    // Proxies stay at the library's default: https_proxy and no_proxy of the environment are followed, the
    // TLS session going through the proxy's tunnel to the server itself. The tunnel's own header is not the
    // response's.
    set(CURLOPT_SUPPRESS_CONNECT_HEADERS, 1L);
}

void CurlExchange::Transfer::setTrustAnchors() {
    // The directory is looked up by hash when a chain is checked, while the bundle that the library is built
    // with would be parsed as a whole for every exchange.
    const char* file =
        std::getenv(kCertificateFileVariable);  // NOLINT(concurrency-mt-unsafe): nothing sets it
    const bool hasFile = file != nullptr && *file != '\0';
    set(CURLOPT_CAINFO, hasFile ? file : static_cast<const char*>(nullptr));
    set(CURLOPT_CAPATH, hasFile ? static_cast<const char*>(nullptr) : kCertificateDirectory);
}

void CurlExchange::Transfer::setCallbacks() {
    set(CURLOPT_SSL_CTX_FUNCTION, &CurlExchange::Transfer::onTLSContext);
    set(CURLOPT_SSL_CTX_DATA, this);
    set(CURLOPT_HEADERFUNCTION, &CurlExchange::Transfer::onHeader);
    set(CURLOPT_HEADERDATA, this);
    set(CURLOPT_WRITEFUNCTION, &CurlExchange::Transfer::onBody);
    set(CURLOPT_WRITEDATA, this);
    set(CURLOPT_XFERINFOFUNCTION, &CurlExchange::Transfer::onProgress);
    set(CURLOPT_XFERINFODATA, this);
    set(CURLOPT_NOPROGRESS, 0L);
}

void CurlExchange::Transfer::setRequest(const HTTPRequest& request) {
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

void CurlExchange::Transfer::addHeaderField(std::string_view name, std::string_view value) {
    if (!isFieldName(name) || !isFieldValue(value)) {
        if (failure_ == CURLE_OK) failure_ = CURLE_BAD_FUNCTION_ARGUMENT;
        return;
    }
    // To the library a name with a colon and nothing behind it means that the field is to be left out.
    const std::string line = std::string(name) + (value.empty() ? ";" : ": " + std::string(value));
    headerFields_.reset(curl_slist_append(headerFields_.release(), line.c_str()));
}

std::optional<HTTPError> CurlExchange::Transfer::run(const std::atomic<bool>& cancelled) {
    if (failure_ != CURLE_OK) return errorOf(failure_);
    if (curl_multi_add_handle(multi_.get(), easy_.get()) != CURLM_OK) return errorOf(CURLE_FAILED_INIT);
    const bool ended = drive(cancelled);
    std::optional<HTTPError> error = ended ? outcome() : errorOf(CURLE_ABORTED_BY_CALLBACK);
    curl_multi_remove_handle(multi_.get(), easy_.get());
    return error;
}

bool CurlExchange::Transfer::drive(const std::atomic<bool>& cancelled) {
    while (!cancelled) {
        int running = 0;
        if (curl_multi_perform(multi_.get(), &running) != CURLM_OK) return false;
        if (running == 0) return true;
        if (curl_multi_poll(multi_.get(), nullptr, 0, kPollMilliseconds, nullptr) != CURLM_OK) return false;
    }
    return false;
}

std::optional<HTTPError> CurlExchange::Transfer::outcome() {
    int left = 0;
    const CURLMsg* message = curl_multi_info_read(multi_.get(), &left);
    const CURLcode code =
        message != nullptr && message->msg == CURLMSG_DONE ? message->data.result : CURLE_FAILED_INIT;
    if (code == CURLE_OK) return std::nullopt;
    // A callback that ended the exchange knows better than the library why.
    return errorOf(failure_ != CURLE_OK ? failure_ : code);
}

void CurlExchange::Transfer::wakeUp() {
    if (multi_) curl_multi_wakeup(multi_.get());
}

HTTPError CurlExchange::Transfer::errorOf(CURLcode code) const { return {code, curl_easy_strerror(code)}; }

ProtectionSpace CurlExchange::Transfer::protectionSpace() const {
    ProtectionSpace space{{}, 0, "ServerTrust"};
    CURLU* url = curl_url();
    char* part = nullptr;
    if (curl_url_set(url, CURLUPART_URL, url_.c_str(), 0) == CURLUE_OK) {
        if (curl_url_get(url, CURLUPART_HOST, &part, 0) == CURLUE_OK) {
            space.host = part;
            curl_free(part);
        }
        if (curl_url_get(url, CURLUPART_PORT, &part, CURLU_DEFAULT_PORT) == CURLUE_OK) {
            space.port = std::atoi(part);
            curl_free(part);
        }
    }
    curl_url_cleanup(url);
    return space;
}

/// Whether the receiver took the event: nothing may be thrown through the library's frames.
template <typename Deliver>
bool CurlExchange::Transfer::delivered(Deliver deliver) noexcept {
    try {
        deliver(events_);
        return true;
    } catch (...) {
        failure_ = CURLE_ABORTED_BY_CALLBACK;
        return false;
    }
}

/// The TLS session is about to begin. Whatever the answer, the server's certificate is verified.
CURLcode CurlExchange::Transfer::onTLSContext(CURL*, void*, void* exchange) noexcept {
    auto& self = *static_cast<Transfer*>(exchange);
    if (std::exchange(self.wasChallenged_, true)) return CURLE_OK;
    ChallengeAnswer answer = ChallengeAnswer::Cancel;
    self.delivered([&](HTTPSessionEvents& events) { answer = events.challenge(self.protectionSpace()); });
    if (answer == ChallengeAnswer::PerformDefaultHandling) return CURLE_OK;
    self.failure_ = CURLE_ABORTED_BY_CALLBACK;
    return CURLE_ABORTED_BY_CALLBACK;
}

/// Called for every line of every header; the empty line that ends the final one is the event.
size_t CurlExchange::Transfer::onHeader(char* line, size_t size, size_t count, void* exchange) noexcept {
    auto& self = *static_cast<Transfer*>(exchange);
    const std::string_view text(line, size * count);
    if (self.hasHeader_ || text.find_first_not_of("\r\n") != std::string_view::npos) return text.size();
    long status = 0;
    curl_easy_getinfo(self.easy_.get(), CURLINFO_RESPONSE_CODE, &status);
    if (status < kFirstFinalStatus) return text.size();
    self.hasHeader_ = true;
    const bool taken =
        self.delivered([=](HTTPSessionEvents& events) { events.responseHeader(static_cast<int>(status)); });
    return taken ? text.size() : 0;
}

size_t CurlExchange::Transfer::onBody(char* bytes, size_t size, size_t count, void* exchange) noexcept {
    auto& self = *static_cast<Transfer*>(exchange);
    const std::string_view piece(bytes, size * count);
    self.bodyBytes_ += piece.size();
    if (self.bodyBytes_ > kMaxHTTPResponseBytes) {
        self.failure_ = CURLE_FILESIZE_EXCEEDED;
        return 0;
    }
    return self.delivered([=](HTTPSessionEvents& events) { events.bodyBytes(bytesOf(piece)); }) ? piece.size()
                                                                                                : 0;
}

int CurlExchange::Transfer::onProgress(void* exchange, curl_off_t, curl_off_t, curl_off_t expected,
                                       curl_off_t sent) noexcept {
    auto& self = *static_cast<Transfer*>(exchange);
    if (sent <= self.reportedSent_) return 0;
    self.reportedSent_ = sent;
    const bool taken = self.delivered([=](HTTPSessionEvents& events) {
        events.uploadProgress(static_cast<uint64_t>(sent), static_cast<uint64_t>(std::max(expected, sent)));
    });
    return taken ? 0 : 1;
}

// --- What the rest of the HTTPS client sees

bool CurlExchange::isLibraryAvailable() {
    static const bool isAvailable = load();
    return isAvailable;
}

CurlExchange::CurlExchange(const HTTPRequest& request, HTTPSessionEvents& events)
    : transfer_(std::make_unique<Transfer>(request, events)) {}

CurlExchange::~CurlExchange() = default;

std::optional<HTTPError> CurlExchange::run(const std::atomic<bool>& cancelled) {
    return transfer_->run(cancelled);
}

void CurlExchange::wakeUp() { transfer_->wakeUp(); }

}  // namespace platform
