#include "Platform/OpenSSLLibrary.h"

#include <openssl/err.h>

namespace platform::openssl {

constinit const LazyLibrary library("libcrypto.so.3");

namespace {

VELTOID_LAZY_FUNCTION(library, ERR_clear_error);
VELTOID_LAZY_FUNCTION(library, ERR_error_string_n);
VELTOID_LAZY_FUNCTION(library, ERR_get_error);

}  // namespace

std::string takeReason() {
    std::string reason;
    while (const unsigned long code = ERR_get_error()) {
        char text[256];
        ERR_error_string_n(code, text, sizeof text);
        reason.append(reason.empty() ? "" : "; ").append(text);
    }
    return reason.empty() ? "no reason given" : reason;
}

void clearErrors() { ERR_clear_error(); }

}  // namespace platform::openssl
