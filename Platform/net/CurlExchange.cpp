#include "Platform/net/CurlExchange.h"

#include <curl/curl.h>
#include <dlfcn.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <string>

#include "Platform/crypto/OpenSSLLibrary.h"
#include "Platform/runtime/SystemLog.h"

namespace platform {
namespace {

// --- The library

/// The functions of libcurl that are in use, found in the library at run time.
struct CurlLibrary {
    decltype(&::curl_global_init) globalInit = nullptr;
    decltype(&::curl_easy_init) easyInit = nullptr;
    decltype(&::curl_easy_cleanup) easyCleanup = nullptr;
    decltype(&::curl_easy_setopt) easySetopt = nullptr;
    decltype(&::curl_easy_getinfo) easyGetinfo = nullptr;
    decltype(&::curl_easy_strerror) easyStrerror = nullptr;
    decltype(&::curl_slist_append) slistAppend = nullptr;
    decltype(&::curl_slist_free_all) slistFreeAll = nullptr;
    decltype(&::curl_multi_init) multiInit = nullptr;
    decltype(&::curl_multi_cleanup) multiCleanup = nullptr;
    decltype(&::curl_multi_add_handle) multiAddHandle = nullptr;
    decltype(&::curl_multi_remove_handle) multiRemoveHandle = nullptr;
    decltype(&::curl_multi_perform) multiPerform = nullptr;
    decltype(&::curl_multi_poll) multiPoll = nullptr;
    decltype(&::curl_multi_wakeup) multiWakeup = nullptr;
    decltype(&::curl_multi_info_read) multiInfoRead = nullptr;

    decltype(&::curl_url) url = nullptr;
    decltype(&::curl_url_cleanup) urlCleanup = nullptr;
    decltype(&::curl_url_set) urlSet = nullptr;
    decltype(&::curl_url_get) urlGet = nullptr;
    decltype(&::curl_free) free = nullptr;

    /// Loaded and initialised on the first call and kept for the life of the process; null when the library
    /// or one of the functions is missing. Any thread.
    static const CurlLibrary* shared();
};

constexpr const char* kLibraryName = "libcurl.so.4";

/// Looks functions up until one is missing.
class SymbolReader {
  public:
    explicit SymbolReader(void* library) : library_(library) {}

    template <typename Function>
    void find(Function& function, const char* name) {
        function = reinterpret_cast<Function>(require(name));
    }

    void* require(const char* name) {
        void* address = dlsym(library_, name);
        if (address == nullptr && missing_ == nullptr) missing_ = name;
        return address;
    }

    const char* missing() const { return missing_; }

  private:
    void* library_;
    const char* missing_ = nullptr;
};

const char* findAll(void* library, CurlLibrary& curl) {
    SymbolReader symbols(library);
    symbols.find(curl.globalInit, "curl_global_init");
    symbols.find(curl.easyInit, "curl_easy_init");
    symbols.find(curl.easyCleanup, "curl_easy_cleanup");
    symbols.find(curl.easySetopt, "curl_easy_setopt");
    symbols.find(curl.easyGetinfo, "curl_easy_getinfo");
    symbols.find(curl.easyStrerror, "curl_easy_strerror");
    symbols.find(curl.slistAppend, "curl_slist_append");
    symbols.find(curl.slistFreeAll, "curl_slist_free_all");
    symbols.find(curl.multiInit, "curl_multi_init");
    symbols.find(curl.multiCleanup, "curl_multi_cleanup");
    symbols.find(curl.multiAddHandle, "curl_multi_add_handle");
    symbols.find(curl.multiRemoveHandle, "curl_multi_remove_handle");
    symbols.find(curl.multiPerform, "curl_multi_perform");
    symbols.find(curl.multiPoll, "curl_multi_poll");
    symbols.find(curl.multiWakeup, "curl_multi_wakeup");
    symbols.find(curl.multiInfoRead, "curl_multi_info_read");
    symbols.find(curl.url, "curl_url");
    symbols.find(curl.urlCleanup, "curl_url_cleanup");
    symbols.find(curl.urlSet, "curl_url_set");
    symbols.find(curl.urlGet, "curl_url_get");
    symbols.find(curl.free, "curl_free");
    // There are builds on other TLS libraries.
    symbols.require("OPENSSL_init_crypto");
    return symbols.missing();
}

const CurlLibrary* load() {
    // Never closed: its threads and TLS state live as long as the process.
    void* library = dlopen(kLibraryName, RTLD_NOW | RTLD_LOCAL);
    if (library == nullptr) {
        const char* reason = dlerror();  // NOLINT(concurrency-mt-unsafe): thread-local in glibc
        VELTOID_PLATFORM_LOG(Error,
                             std::string("cannot load the HTTPS client library: ") + (reason ? reason : "?"));
        return nullptr;
    }
    static CurlLibrary curl;
    if (const char* missing = findAll(library, curl)) {
        VELTOID_PLATFORM_LOG(Error, std::string(kLibraryName) + " lacks " + missing);
        return nullptr;
    }
    // Before the library makes use of it.
    openssl::prepare();
    if (curl.globalInit(CURL_GLOBAL_DEFAULT) != CURLE_OK) {
        VELTOID_PLATFORM_LOG(Error, "cannot initialise the HTTPS client library");
        return nullptr;
    }
    return &curl;
}

const CurlLibrary* CurlLibrary::shared() {
    static const CurlLibrary* const curl = load();
    return curl;
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
    Transfer(const CurlLibrary& curl, const HTTPRequest& request, HTTPSessionEvents& events);
    Transfer(const Transfer&) = delete;
    Transfer& operator=(const Transfer&) = delete;

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

CurlExchange::Transfer::Transfer(const CurlLibrary& curl, const HTTPRequest& request,
                                 HTTPSessionEvents& events)
    : curl_(curl),
      events_(events),
      url_(request.url),
      headerFields_(nullptr, {&curl}),
      easy_(curl.easyInit(), {&curl}),
      multi_(curl.multiInit(), {&curl}) {
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
    const CURLcode code = curl_.easySetopt(easy_.get(), option, value);
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
    headerFields_.reset(curl_.slistAppend(headerFields_.release(), "Expect:"));
    set(CURLOPT_HTTPHEADER, headerFields_.get());
}

void CurlExchange::Transfer::addHeaderField(std::string_view name, std::string_view value) {
    if (!isFieldName(name) || !isFieldValue(value)) {
        if (failure_ == CURLE_OK) failure_ = CURLE_BAD_FUNCTION_ARGUMENT;
        return;
    }
    // To the library a name with a colon and nothing behind it means that the field is to be left out.
    const std::string line = std::string(name) + (value.empty() ? ";" : ": " + std::string(value));
    headerFields_.reset(curl_.slistAppend(headerFields_.release(), line.c_str()));
}

std::optional<HTTPError> CurlExchange::Transfer::run(const std::atomic<bool>& cancelled) {
    if (failure_ != CURLE_OK) return errorOf(failure_);
    if (curl_.multiAddHandle(multi_.get(), easy_.get()) != CURLM_OK) return errorOf(CURLE_FAILED_INIT);
    const bool ended = drive(cancelled);
    std::optional<HTTPError> error = ended ? outcome() : errorOf(CURLE_ABORTED_BY_CALLBACK);
    curl_.multiRemoveHandle(multi_.get(), easy_.get());
    return error;
}

bool CurlExchange::Transfer::drive(const std::atomic<bool>& cancelled) {
    while (!cancelled) {
        int running = 0;
        if (curl_.multiPerform(multi_.get(), &running) != CURLM_OK) return false;
        if (running == 0) return true;
        if (curl_.multiPoll(multi_.get(), nullptr, 0, kPollMilliseconds, nullptr) != CURLM_OK) return false;
    }
    return false;
}

std::optional<HTTPError> CurlExchange::Transfer::outcome() {
    int left = 0;
    const CURLMsg* message = curl_.multiInfoRead(multi_.get(), &left);
    const CURLcode code =
        message != nullptr && message->msg == CURLMSG_DONE ? message->data.result : CURLE_FAILED_INIT;
    if (code == CURLE_OK) return std::nullopt;
    // A callback that ended the exchange knows better than the library why.
    return errorOf(failure_ != CURLE_OK ? failure_ : code);
}

void CurlExchange::Transfer::wakeUp() {
    if (multi_) curl_.multiWakeup(multi_.get());
}

HTTPError CurlExchange::Transfer::errorOf(CURLcode code) const { return {code, curl_.easyStrerror(code)}; }

ProtectionSpace CurlExchange::Transfer::protectionSpace() const {
    ProtectionSpace space{{}, 0, "ServerTrust"};
    CURLU* url = curl_.url();
    char* part = nullptr;
    if (curl_.urlSet(url, CURLUPART_URL, url_.c_str(), 0) == CURLUE_OK) {
        if (curl_.urlGet(url, CURLUPART_HOST, &part, 0) == CURLUE_OK) {
            space.host = part;
            curl_.free(part);
        }
        if (curl_.urlGet(url, CURLUPART_PORT, &part, CURLU_DEFAULT_PORT) == CURLUE_OK) {
            space.port = std::atoi(part);
            curl_.free(part);
        }
    }
    curl_.urlCleanup(url);
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
    self.curl_.easyGetinfo(self.easy_.get(), CURLINFO_RESPONSE_CODE, &status);
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

bool CurlExchange::isLibraryAvailable() { return CurlLibrary::shared() != nullptr; }

CurlExchange::CurlExchange(const HTTPRequest& request, HTTPSessionEvents& events)
    : transfer_(std::make_unique<Transfer>(*CurlLibrary::shared(), request, events)) {}

CurlExchange::~CurlExchange() = default;

std::optional<HTTPError> CurlExchange::run(const std::atomic<bool>& cancelled) {
    return transfer_->run(cancelled);
}

void CurlExchange::wakeUp() { transfer_->wakeUp(); }

}  // namespace platform
