#include "veltoidctl/CertificateExport.h"

#include <openssl/err.h>
#include <openssl/pkcs12.h>
#include <openssl/x509.h>

#include <memory>
#include <stdexcept>

#include "Values/Base64.h"

namespace veltoidctl {
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
    char text[256];
    ERR_error_string_n(ERR_get_error(), text, sizeof text);
    throw std::runtime_error(std::string("the PKCS#12 file cannot be made: ") + text);
}

template <typename Object>
Owned<Object> neededObject(Object* object) {
    if (object == nullptr) refuse();
    return Owned<Object>(object);
}

Owned<EVP_PKEY> keyFrom(platform::Bytes pkcs8) {
    const unsigned char* end = pkcs8.data();
    const auto information =
        neededObject(d2i_PKCS8_PRIV_KEY_INFO(nullptr, &end, static_cast<long>(pkcs8.size())));
    return neededObject(EVP_PKCS82PKEY(information.get()));
}

Owned<X509> certificateFrom(const platform::Certificate& certificate) {
    const unsigned char* end = certificate.der.data();
    return neededObject(d2i_X509(nullptr, &end, static_cast<long>(certificate.der.size())));
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
    const auto others = neededObject(sk_X509_new_null());
    if (intermediate && sk_X509_push(others.get(), intermediate.get()) == 0) refuse();
    // Zero: the library's own choice of ciphers (AES-256, PBKDF2) and key type.
    const auto container =
        neededObject(PKCS12_create(password.c_str(), name.c_str(), key.get(), certificate.get(), others.get(),
                                   0, 0, kPasswordIterations, kPasswordIterations, 0));
    const int size = i2d_PKCS12(container.get(), nullptr);
    if (size <= 0) refuse();
    platform::SecretBytes der(static_cast<size_t>(size));
    unsigned char* end = der.data();
    if (i2d_PKCS12(container.get(), &end) != size) refuse();
    return der;
}

}  // namespace veltoidctl
