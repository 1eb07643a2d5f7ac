#include "Platform/crypto/TrustEvaluation.h"

#include <openssl/bio.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509_vfy.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "Platform/crypto/OpenSSLLibrary.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/SystemLog.h"

namespace platform {

namespace {

using openssl::library;
VELTOID_LAZY_FUNCTIONS(library, BIO_free, BIO_new_mem_buf, d2i_X509, OPENSSL_sk_new_null, OPENSSL_sk_num,
                       OPENSSL_sk_pop_free, OPENSSL_sk_push, OPENSSL_sk_value, PEM_X509_INFO_read_bio,
                       X509_free, X509_INFO_free, X509_STORE_add_cert, X509_STORE_add_crl,
                       X509_STORE_CTX_free, X509_STORE_CTX_get0_param, X509_STORE_CTX_get_error,
                       X509_STORE_CTX_init, X509_STORE_CTX_new, X509_STORE_CTX_set_default, X509_STORE_free,
                       X509_STORE_new, X509_verify_cert, X509_VERIFY_PARAM_set_flags,
                       X509_VERIFY_PARAM_set_time);

using Parsed = LazyOwner<X509, X509_free>;

/// Owns a list of the library and what is in it.
template <typename Object, const auto& Free>
struct StackDeleter {
    void operator()(OPENSSL_STACK* stack) const {
        OPENSSL_sk_pop_free(stack, [](void* object) { Free(static_cast<Object*>(object)); });
    }
};
template <typename Object, const auto& Free>
using OwningStack = std::unique_ptr<OPENSSL_STACK, StackDeleter<Object, Free>>;

std::filesystem::path authorityFile() {
    const Product& product = Lifetime::current().product();
    const std::filesystem::path name = std::filesystem::path(product.folder) / product.authorityFile;
    // NOLINTBEGIN(concurrency-mt-unsafe): the environment does not change
    const char* configuration = std::getenv("XDG_CONFIG_HOME");
    const char* home = std::getenv("HOME");
    // NOLINTEND(concurrency-mt-unsafe)
    std::filesystem::path own;
    if (configuration != nullptr && *configuration == '/') {
        own = std::filesystem::path(configuration) / name;
    } else if (home != nullptr && *home == '/') {
        own = std::filesystem::path(home) / ".config" / name;
    }
    std::error_code ignored;
    return !own.empty() && std::filesystem::exists(own, ignored) ? own : std::filesystem::path("/etc") / name;
}

void logUnusable(const std::filesystem::path& file, const std::string& reason) {
    VELTOID_PLATFORM_LOG(Error, "no certificate can be evaluated: " + file.string() + ": " + reason);
}

std::optional<std::string> readAuthorityFile(const std::filesystem::path& file) {
    std::ifstream stream(file, std::ios::binary);
    std::string text(kMaxAuthorityFileBytes + 1, '\0');
    if (!stream) {
        logUnusable(file, std::strerror(errno));  // NOLINT(concurrency-mt-unsafe): thread-safe in glibc
        return std::nullopt;
    }
    stream.read(text.data(), static_cast<std::streamsize>(text.size()));
    text.resize(static_cast<size_t>(stream.gcount()));
    if (text.size() <= kMaxAuthorityFileBytes) return text;
    logUnusable(file, "too large");
    return std::nullopt;
}

/// The authorities and, beside them, the revocation lists.
struct Authorities {
    LazyOwner<X509_STORE, X509_STORE_free> store;
    bool hasRevocationLists = false;
};

std::optional<Authorities> readAuthorities() {
    const std::filesystem::path file = authorityFile();
    const auto text = readAuthorityFile(file);
    if (!text) return std::nullopt;
    const LazyOwner<BIO, BIO_free> stream(BIO_new_mem_buf(text->data(), static_cast<int>(text->size())));
    const OwningStack<X509_INFO, X509_INFO_free> entries(
        reinterpret_cast<OPENSSL_STACK*>(PEM_X509_INFO_read_bio(stream.get(), nullptr, nullptr, nullptr)));
    Authorities authorities;
    authorities.store.reset(X509_STORE_new());
    int certificates = 0;
    for (int i = 0; i < OPENSSL_sk_num(entries.get()); ++i) {
        const auto* entry = static_cast<const X509_INFO*>(OPENSSL_sk_value(entries.get(), i));
        if (entry->x509 != nullptr) certificates += X509_STORE_add_cert(authorities.store.get(), entry->x509);
        if (entry->crl != nullptr && X509_STORE_add_crl(authorities.store.get(), entry->crl) == 1)
            authorities.hasRevocationLists = true;
    }
    if (certificates > 0) return authorities;
    logUnusable(file, "no certificates: " + openssl::takeReason());
    return std::nullopt;
}

Parsed parsed(const Certificate& certificate) {
    return openssl::decoded<Parsed>(d2i_X509, certificate.der, kMaxCertificateBytes);
}

/// One run of the library's verification with these flags; its verdict.
int verify(const Authorities& authorities, const Certificate& certificate,
           std::span<const Certificate> intermediates, unsigned long flags) {
    const Parsed leaf = parsed(certificate);
    const OwningStack<X509, X509_free> untrusted(OPENSSL_sk_new_null());
    for (const Certificate& intermediate : intermediates) {
        Parsed between = parsed(intermediate);
        if (OPENSSL_sk_push(untrusted.get(), between.get()) > 0) (void)between.release();
    }
    const LazyOwner<X509_STORE_CTX, X509_STORE_CTX_free> context(X509_STORE_CTX_new());
    if (leaf == nullptr || context == nullptr ||
        X509_STORE_CTX_init(context.get(), authorities.store.get(), leaf.get(),
                            reinterpret_cast<STACK_OF(X509)*>(untrusted.get())) != 1 ||
        X509_STORE_CTX_set_default(context.get(), "ssl_client") != 1)
        return X509_V_ERR_UNSPECIFIED;
    X509_VERIFY_PARAM* parameters = X509_STORE_CTX_get0_param(context.get());
    // An authority need not be self-signed.
    X509_VERIFY_PARAM_set_flags(parameters, X509_V_FLAG_PARTIAL_CHAIN | flags);
    if ((flags & X509_V_FLAG_NO_CHECK_TIME) == 0)
        X509_VERIFY_PARAM_set_time(parameters, static_cast<time_t>(Clock::shared().now()));
    if (X509_verify_cert(context.get()) == 1) return X509_V_OK;
    const int error = X509_STORE_CTX_get_error(context.get());
    return error == X509_V_OK ? X509_V_ERR_UNSPECIFIED : error;
}

TrustResult resultOf(int error) {
    switch (error) {
        case X509_V_OK:
            return TrustResult::Unspecified;
        case X509_V_ERR_CERT_REVOKED:
        case X509_V_ERR_CERT_REJECTED:
            return TrustResult::Deny;
        case X509_V_ERR_CERT_NOT_YET_VALID:
        case X509_V_ERR_CERT_HAS_EXPIRED:
            return TrustResult::RecoverableFailure;
        case X509_V_ERR_OUT_OF_MEM:
        case X509_V_ERR_INVALID_CALL:
        case X509_V_ERR_STORE_LOOKUP:
        case X509_V_ERR_UNSPECIFIED:
            return TrustResult::OtherError;
        default:
            return TrustResult::FatalFailure;
    }
}

}  // namespace

std::optional<TrustResult> evaluateTrust(const Certificate& certificate,
                                         std::span<const Certificate> intermediates) {
    const auto authorities = readAuthorities();
    if (!authorities) return std::nullopt;
    // Without regard to time first: a certificate that is merely out of date must be good in everything else.
    constexpr unsigned long kTimeless = X509_V_FLAG_NO_CHECK_TIME;
    const unsigned long revocation = authorities->hasRevocationLists ? X509_V_FLAG_CRL_CHECK : 0;
    int error = verify(*authorities, certificate, intermediates, kTimeless | revocation);
    // The lists are those of other authorities.
    if (error == X509_V_ERR_UNABLE_TO_GET_CRL)
        error = verify(*authorities, certificate, intermediates, kTimeless);
    if (error == X509_V_OK) error = verify(*authorities, certificate, intermediates, 0);
    openssl::clearErrors();
    return resultOf(error);
}

}  // namespace platform
