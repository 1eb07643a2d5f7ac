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
VELTOID_LAZY_FUNCTION(library, BIO_free);
VELTOID_LAZY_FUNCTION(library, BIO_new_mem_buf);
VELTOID_LAZY_FUNCTION(library, d2i_X509);
VELTOID_LAZY_FUNCTION(library, OPENSSL_sk_free);
VELTOID_LAZY_FUNCTION(library, OPENSSL_sk_new_null);
VELTOID_LAZY_FUNCTION(library, OPENSSL_sk_num);
VELTOID_LAZY_FUNCTION(library, OPENSSL_sk_pop);
VELTOID_LAZY_FUNCTION(library, OPENSSL_sk_push);
VELTOID_LAZY_FUNCTION(library, OPENSSL_sk_value);
VELTOID_LAZY_FUNCTION(library, PEM_X509_INFO_read_bio);
VELTOID_LAZY_FUNCTION(library, X509_free);
VELTOID_LAZY_FUNCTION(library, X509_INFO_free);
VELTOID_LAZY_FUNCTION(library, X509_STORE_add_cert);
VELTOID_LAZY_FUNCTION(library, X509_STORE_add_crl);
VELTOID_LAZY_FUNCTION(library, X509_STORE_CTX_free);
VELTOID_LAZY_FUNCTION(library, X509_STORE_CTX_get0_param);
VELTOID_LAZY_FUNCTION(library, X509_STORE_CTX_get_error);
VELTOID_LAZY_FUNCTION(library, X509_STORE_CTX_init);
VELTOID_LAZY_FUNCTION(library, X509_STORE_CTX_new);
VELTOID_LAZY_FUNCTION(library, X509_STORE_CTX_set_default);
VELTOID_LAZY_FUNCTION(library, X509_STORE_free);
VELTOID_LAZY_FUNCTION(library, X509_STORE_new);
VELTOID_LAZY_FUNCTION(library, X509_verify_cert);
VELTOID_LAZY_FUNCTION(library, X509_VERIFY_PARAM_set_flags);
VELTOID_LAZY_FUNCTION(library, X509_VERIFY_PARAM_set_time);

struct Deleter {
    void operator()(BIO* stream) const { BIO_free(stream); }
    void operator()(X509* certificate) const { X509_free(certificate); }
    void operator()(X509_INFO* entry) const { X509_INFO_free(entry); }
    void operator()(X509_STORE* store) const { X509_STORE_free(store); }
    void operator()(X509_STORE_CTX* context) const { X509_STORE_CTX_free(context); }
};
template <typename Object>
using Owned = std::unique_ptr<Object, Deleter>;

/// A list of the library that owns what is in it.
template <typename Object>
class OwningStack {
  public:
    explicit OwningStack(OPENSSL_STACK* stack) : stack_(stack) {}
    ~OwningStack() {
        while (Owned<Object>(static_cast<Object*>(OPENSSL_sk_pop(stack_)))) {
        }
        OPENSSL_sk_free(stack_);
    }
    OwningStack(const OwningStack&) = delete;
    OwningStack& operator=(const OwningStack&) = delete;

    OPENSSL_STACK* get() const { return stack_; }
    int size() const { return stack_ != nullptr ? OPENSSL_sk_num(stack_) : 0; }
    const Object* operator[](int index) const {
        return static_cast<Object*>(OPENSSL_sk_value(stack_, index));
    }
    void push(Owned<Object> object) {
        if (OPENSSL_sk_push(stack_, object.get()) > 0) (void)object.release();
    }

  private:
    OPENSSL_STACK* stack_;
};

std::filesystem::path authorityFile() {
    const Product& product = Lifetime::current().product();
    const std::filesystem::path name = std::filesystem::path(product.folder) / product.authorityFile;
    // NOLINTBEGIN(concurrency-mt-unsafe): nobody changes the environment
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
    Owned<X509_STORE> store;
    bool hasRevocationLists = false;
};

std::optional<Authorities> readAuthorities() {
    const std::filesystem::path file = authorityFile();
    const auto text = readAuthorityFile(file);
    if (!text) return std::nullopt;
    const Owned<BIO> stream(BIO_new_mem_buf(text->data(), static_cast<int>(text->size())));
    const OwningStack<X509_INFO> entries(
        reinterpret_cast<OPENSSL_STACK*>(PEM_X509_INFO_read_bio(stream.get(), nullptr, nullptr, nullptr)));
    Authorities authorities{Owned<X509_STORE>(X509_STORE_new()), false};
    int certificates = 0;
    for (int i = 0; i < entries.size(); ++i) {
        if (entries[i]->x509 != nullptr)
            certificates += X509_STORE_add_cert(authorities.store.get(), entries[i]->x509);
        if (entries[i]->crl != nullptr && X509_STORE_add_crl(authorities.store.get(), entries[i]->crl) == 1)
            authorities.hasRevocationLists = true;
    }
    if (certificates > 0) return authorities;
    logUnusable(file, "no certificates: " + openssl::takeReason());
    return std::nullopt;
}

Owned<X509> parsed(const Certificate& certificate) {
    const unsigned char* der = certificate.der.data();
    return Owned<X509>(d2i_X509(nullptr, &der, static_cast<long>(certificate.der.size())));
}

/// One run of the library's verification with these flags; its verdict.
int verify(const Authorities& authorities, const Certificate& certificate,
           std::span<const Certificate> intermediates, unsigned long flags) {
    const Owned<X509> leaf = parsed(certificate);
    OwningStack<X509> untrusted(OPENSSL_sk_new_null());
    for (const Certificate& intermediate : intermediates) untrusted.push(parsed(intermediate));
    const Owned<X509_STORE_CTX> context(X509_STORE_CTX_new());
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
