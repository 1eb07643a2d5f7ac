#include "Platform/CurlExchange.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

namespace platform {
namespace {

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

CurlExchange::CurlExchange(const CurlLibrary& curl, const HTTPRequest& request, HTTPSessionEvents& events)
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
void CurlExchange::set(CURLoption option, Value value) {
    const CURLcode code = curl_.easySetopt(easy_.get(), option, value);
    if (failure_ == CURLE_OK) failure_ = code;
}

void CurlExchange::setTransportOptions() {
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

void CurlExchange::setTrustAnchors() {
    // The directory is looked up by hash when a chain is checked, while the bundle that the library is built
    // with would be parsed as a whole for every exchange.
    const char* file =
        std::getenv(kCertificateFileVariable);  // NOLINT(concurrency-mt-unsafe): nothing sets it
    const bool hasFile = file != nullptr && *file != '\0';
    set(CURLOPT_CAINFO, hasFile ? file : static_cast<const char*>(nullptr));
    set(CURLOPT_CAPATH, hasFile ? static_cast<const char*>(nullptr) : kCertificateDirectory);
}

void CurlExchange::setCallbacks() {
    set(CURLOPT_SSL_CTX_FUNCTION, &CurlExchange::onTLSContext);
    set(CURLOPT_SSL_CTX_DATA, this);
    set(CURLOPT_HEADERFUNCTION, &CurlExchange::onHeader);
    set(CURLOPT_HEADERDATA, this);
    set(CURLOPT_WRITEFUNCTION, &CurlExchange::onBody);
    set(CURLOPT_WRITEDATA, this);
    set(CURLOPT_XFERINFOFUNCTION, &CurlExchange::onProgress);
    set(CURLOPT_XFERINFODATA, this);
    set(CURLOPT_NOPROGRESS, 0L);
}

void CurlExchange::setRequest(const HTTPRequest& request) {
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

void CurlExchange::addHeaderField(std::string_view name, std::string_view value) {
    if (!isFieldName(name) || !isFieldValue(value)) {
        if (failure_ == CURLE_OK) failure_ = CURLE_BAD_FUNCTION_ARGUMENT;
        return;
    }
    // To the library a name with a colon and nothing behind it means that the field is to be left out.
    const std::string line = std::string(name) + (value.empty() ? ";" : ": " + std::string(value));
    headerFields_.reset(curl_.slistAppend(headerFields_.release(), line.c_str()));
}

std::optional<HTTPError> CurlExchange::run(const std::atomic<bool>& cancelled) {
    if (failure_ != CURLE_OK) return errorOf(failure_);
    if (curl_.multiAddHandle(multi_.get(), easy_.get()) != CURLM_OK) return errorOf(CURLE_FAILED_INIT);
    const bool ended = drive(cancelled);
    std::optional<HTTPError> error = ended ? outcome() : errorOf(CURLE_ABORTED_BY_CALLBACK);
    curl_.multiRemoveHandle(multi_.get(), easy_.get());
    return error;
}

bool CurlExchange::drive(const std::atomic<bool>& cancelled) {
    while (!cancelled) {
        int running = 0;
        if (curl_.multiPerform(multi_.get(), &running) != CURLM_OK) return false;
        if (running == 0) return true;
        if (curl_.multiPoll(multi_.get(), nullptr, 0, kPollMilliseconds, nullptr) != CURLM_OK) return false;
    }
    return false;
}

std::optional<HTTPError> CurlExchange::outcome() {
    int left = 0;
    const CURLMsg* message = curl_.multiInfoRead(multi_.get(), &left);
    const CURLcode code =
        message != nullptr && message->msg == CURLMSG_DONE ? message->data.result : CURLE_FAILED_INIT;
    if (code == CURLE_OK) return std::nullopt;
    // A callback that ended the exchange knows better than the library why.
    return errorOf(failure_ != CURLE_OK ? failure_ : code);
}

void CurlExchange::wakeUp() {
    if (multi_) curl_.multiWakeup(multi_.get());
}

HTTPError CurlExchange::errorOf(CURLcode code) const { return {code, curl_.easyStrerror(code)}; }

ProtectionSpace CurlExchange::protectionSpace() const {
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
bool CurlExchange::delivered(Deliver deliver) noexcept {
    try {
        deliver(events_);
        return true;
    } catch (...) {
        failure_ = CURLE_ABORTED_BY_CALLBACK;
        return false;
    }
}

/// The TLS session is about to begin. Whatever the answer, the server's certificate is verified.
CURLcode CurlExchange::onTLSContext(CURL*, void*, void* exchange) noexcept {
    auto& self = *static_cast<CurlExchange*>(exchange);
    if (std::exchange(self.wasChallenged_, true)) return CURLE_OK;
    ChallengeAnswer answer = ChallengeAnswer::Cancel;
    self.delivered([&](HTTPSessionEvents& events) { answer = events.challenge(self.protectionSpace()); });
    if (answer == ChallengeAnswer::PerformDefaultHandling) return CURLE_OK;
    self.failure_ = CURLE_ABORTED_BY_CALLBACK;
    return CURLE_ABORTED_BY_CALLBACK;
}

/// Called for every line of every header; the empty line that ends the final one is the event.
size_t CurlExchange::onHeader(char* line, size_t size, size_t count, void* exchange) noexcept {
    auto& self = *static_cast<CurlExchange*>(exchange);
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

size_t CurlExchange::onBody(char* bytes, size_t size, size_t count, void* exchange) noexcept {
    auto& self = *static_cast<CurlExchange*>(exchange);
    const std::string_view piece(bytes, size * count);
    self.bodyBytes_ += piece.size();
    if (self.bodyBytes_ > kMaxHTTPResponseBytes) {
        self.failure_ = CURLE_FILESIZE_EXCEEDED;
        return 0;
    }
    return self.delivered([=](HTTPSessionEvents& events) { events.bodyBytes(bytesOf(piece)); }) ? piece.size()
                                                                                                : 0;
}

int CurlExchange::onProgress(void* exchange, curl_off_t, curl_off_t, curl_off_t expected,
                             curl_off_t sent) noexcept {
    auto& self = *static_cast<CurlExchange*>(exchange);
    if (sent <= self.reportedSent_) return 0;
    self.reportedSent_ = sent;
    const bool taken = self.delivered([=](HTTPSessionEvents& events) {
        events.uploadProgress(static_cast<uint64_t>(sent), static_cast<uint64_t>(std::max(expected, sent)));
    });
    return taken ? 0 : 1;
}

}  // namespace platform
