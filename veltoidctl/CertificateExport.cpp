#include "veltoidctl/CertificateExport.h"

#include <openssl/pkcs12.h>
#include <openssl/x509.h>

#include <memory>
#include <stdexcept>

#include "Platform/crypto/KeyPair.h"
#include "Platform/crypto/OpenSSLLibrary.h"
#include "Values/Base64.h"

namespace veltoidctl {

namespace openssl = platform::openssl;

namespace {

/// For each of key, certificates and integrity. Readers refuse files that would keep them busy for too long:
/// common ones stop at 300,000 for one and 600,000 for all.
constexpr int kPasswordIterations = 100'000;

struct Deleter {
    void operator()(EVP_PKEY* key) const { EVP_PKEY_free(key); }
    void operator()(PKCS8_PRIV_KEY_INFO* key) const { PKCS8_PRIV_KEY_INFO_free(key); }
    void operator()(X509* certificate) const { X509_free(certificate); }
    void operator()(STACK_OF(X509) * certificates) const { sk_X509_free(certificates); }
    void operator()(PKCS12* container) const { PKCS12_free(container); }
};
template <typename Object>
using Owned = std::unique_ptr<Object, Deleter>;

[[noreturn]] void refuse() {
    throw std::runtime_error("the PKCS#12 file cannot be made: " + openssl::takeReason());
}

template <typename Object>
Owned<Object> neededObject(Owned<Object> object) {
    if (object == nullptr) refuse();
    return object;
}

Owned<EVP_PKEY> keyFrom(platform::Bytes pkcs8) {
    const auto information = neededObject(
        openssl::decoded<Owned<PKCS8_PRIV_KEY_INFO>>(d2i_PKCS8_PRIV_KEY_INFO, pkcs8, platform::kMaxKeyBytes));
    return neededObject(Owned<EVP_PKEY>(EVP_PKCS82PKEY(information.get())));
}

Owned<X509> certificateFrom(const platform::Certificate& certificate) {
    return neededObject(
        openssl::decoded<Owned<X509>>(d2i_X509, certificate.der, platform::kMaxCertificateBytes));
}

template <typename Text>
void appendPEM(Text& text, const std::string& label, platform::Bytes der) {
    const veltoid::String body = veltoid::base64Encode(veltoid::Data(der));
    text.append("-----BEGIN ").append(label).append("-----\n").append(body.view());
    // A last line that is full has its line feed already.
    if (text.back() != '\n') text += '\n';
    text.append("-----END ").append(label).append("-----\n");
}

constexpr const char* kCertificateLabel = "CERTIFICATE";

}  // namespace

std::string pemOf(const platform::Certificate& certificate) {
    std::string text;
    appendPEM(text, kCertificateLabel, certificate.der);
    return text;
}

platform::SecretBytes pemOf(const Identity& identity) {
    platform::SecretText text;
    appendPEM(text, "PRIVATE KEY", identity.privateKey.encoded.bytes());
    appendPEM(text, kCertificateLabel, identity.certificate.der);
    if (identity.intermediate) appendPEM(text, kCertificateLabel, identity.intermediate->der);
    return {text.begin(), text.end()};
}

platform::SecretBytes pkcs12Of(const Identity& identity, const platform::SecretText& password,
                               const std::string& name) {
    const auto key = keyFrom(identity.privateKey.encoded.bytes());
    const auto certificate = certificateFrom(identity.certificate);
    const auto intermediate = identity.intermediate ? certificateFrom(*identity.intermediate) : Owned<X509>();
    const auto others = neededObject(Owned<STACK_OF(X509)>(sk_X509_new_null()));
    if (intermediate && sk_X509_push(others.get(), intermediate.get()) == 0) refuse();
    // Zero: the library's own choice of ciphers (AES-256, PBKDF2) and key type.
    const auto container = neededObject(
        Owned<PKCS12>(PKCS12_create(password.c_str(), name.c_str(), key.get(), certificate.get(),
                                    others.get(), 0, 0, kPasswordIterations, kPasswordIterations, 0)));
    auto der = openssl::encoded<platform::SecretBytes>(i2d_PKCS12, container.get());
    if (der.empty()) refuse();
    return der;
}

}  // namespace veltoidctl
