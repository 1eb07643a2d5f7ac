#include "Platform/crypto/OpenSSLLibrary.h"

#include <malloc.h>
#include <openssl/crypto.h>
#include <openssl/err.h>

#include <cstdlib>
#include <cstring>

#include "Platform/runtime/SecureMemory.h"
#include "Platform/runtime/SystemLog.h"

namespace platform::openssl {

namespace {

constexpr const char* kSoname = "libcrypto.so.3";

// prepare() itself uses these functions, so they must not call it.
constinit const LazyLibrary unprepared(kSoname);
VELTOID_LAZY_FUNCTIONS(unprepared, CRYPTO_set_mem_functions, OPENSSL_init_crypto);

}  // namespace

constinit const LazyLibrary library(kSoname, [] { (void)prepare(); });

namespace {

VELTOID_LAZY_FUNCTIONS(library, ERR_clear_error, ERR_error_string_n, ERR_get_error);

void* allocate(size_t size, const char* /*file*/, int /*line*/) { return std::malloc(size); }

void wipeAndFree(void* block, const char* /*file*/, int /*line*/) {
    if (block == nullptr) return;
    wipe(block, malloc_usable_size(block));
    std::free(block);
}

void* reallocate(void* block, size_t size, const char* file, int line) {
    if (block == nullptr) return allocate(size, file, line);
    if (size == 0) {
        wipeAndFree(block, file, line);
        return nullptr;
    }
    const size_t usable = malloc_usable_size(block);
    if (size <= usable) return block;
    void* larger = allocate(size, file, line);
    if (larger == nullptr) return nullptr;
    std::memcpy(larger, block, usable);
    wipeAndFree(block, file, line);
    return larger;
}

bool prepareOnce() {
    const bool wipes = CRYPTO_set_mem_functions(allocate, reallocate, wipeAndFree) == 1;
    if (!wipes) VELTOID_PLATFORM_LOG(Error, "OpenSSL is in use already: what it frees is not wiped");
    // Other threads may be inside the library when the process exits: it must not take its tables down
    // underneath them. Only the first caller in a process can choose that.
    OPENSSL_init_crypto(OPENSSL_INIT_NO_ATEXIT, nullptr);
    return wipes;
}

}  // namespace

bool prepare() {
    static const bool wipes = prepareOnce();
    return wipes;
}

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
