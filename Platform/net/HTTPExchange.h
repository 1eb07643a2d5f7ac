// What goes into an HTTPS exchange and what comes out of it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Platform/runtime/SecureMemory.h"

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

}  // namespace platform
