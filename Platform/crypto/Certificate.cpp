#include "Platform/crypto/Certificate.h"

#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/x509.h>

#include <ctime>
#include <memory>

#include "Platform/crypto/OpenSSLLibrary.h"
#include "Platform/encoding/CalendarText.h"

namespace platform {

namespace {

using openssl::library;
VELTOID_LAZY_FUNCTION(library, ASN1_INTEGER_to_BN);
VELTOID_LAZY_FUNCTION(library, ASN1_STRING_to_UTF8);
VELTOID_LAZY_FUNCTION(library, ASN1_TIME_to_tm);
VELTOID_LAZY_FUNCTION(library, BIO_ctrl);
VELTOID_LAZY_FUNCTION(library, BIO_free);
VELTOID_LAZY_FUNCTION(library, BIO_new);
VELTOID_LAZY_FUNCTION(library, BIO_s_mem);
VELTOID_LAZY_FUNCTION(library, BN_bn2hex);
VELTOID_LAZY_FUNCTION(library, BN_free);
VELTOID_LAZY_FUNCTION(library, CRYPTO_free);
VELTOID_LAZY_FUNCTION(library, d2i_X509);
VELTOID_LAZY_FUNCTION(library, i2d_X509_PUBKEY);
VELTOID_LAZY_FUNCTION(library, X509_free);
VELTOID_LAZY_FUNCTION(library, X509_get0_notAfter);
VELTOID_LAZY_FUNCTION(library, X509_get0_notBefore);
VELTOID_LAZY_FUNCTION(library, X509_get0_serialNumber);
VELTOID_LAZY_FUNCTION(library, X509_get_issuer_name);
VELTOID_LAZY_FUNCTION(library, X509_get_subject_name);
VELTOID_LAZY_FUNCTION(library, X509_get_X509_PUBKEY);
VELTOID_LAZY_FUNCTION(library, X509_NAME_ENTRY_get_data);
VELTOID_LAZY_FUNCTION(library, X509_NAME_get_entry);
VELTOID_LAZY_FUNCTION(library, X509_NAME_get_index_by_NID);
VELTOID_LAZY_FUNCTION(library, X509_NAME_print_ex);

void freeMemory(void* memory) { CRYPTO_free(memory, __FILE__, __LINE__); }

struct Deleter {
    void operator()(X509* certificate) const { X509_free(certificate); }
    void operator()(BIO* stream) const { BIO_free(stream); }
    void operator()(BIGNUM* number) const { BN_free(number); }
};
struct MemoryDeleter {
    void operator()(void* memory) const { freeMemory(memory); }
};
using LibraryText = std::unique_ptr<char, MemoryDeleter>;

std::string nameText(const X509_NAME* name) {
    const std::unique_ptr<BIO, Deleter> stream(BIO_new(BIO_s_mem()));
    // Texts are UTF-8 here: nothing needs to be escaped for being beyond ASCII.
    constexpr unsigned long kFlags = XN_FLAG_RFC2253 & ~static_cast<unsigned long>(ASN1_STRFLGS_ESC_MSB);
    if (stream == nullptr || name == nullptr || X509_NAME_print_ex(stream.get(), name, 0, kFlags) < 0)
        return {};
    char* text = nullptr;
    const long length = BIO_ctrl(stream.get(), BIO_CTRL_INFO, 0, static_cast<void*>(&text));
    return length > 0 ? std::string(text, static_cast<size_t>(length)) : std::string();
}

std::string attributeText(const X509_NAME* name, int identifier) {
    const int index = name != nullptr ? X509_NAME_get_index_by_NID(name, identifier, -1) : -1;
    if (index < 0) return {};
    unsigned char* text = nullptr;
    const int length = ASN1_STRING_to_UTF8(&text, X509_NAME_ENTRY_get_data(X509_NAME_get_entry(name, index)));
    if (length < 0) return {};
    const std::unique_ptr<unsigned char, MemoryDeleter> owner(text);
    return {reinterpret_cast<const char*>(text), static_cast<size_t>(length)};
}

std::string serialText(const X509* certificate) {
    const std::unique_ptr<BIGNUM, Deleter> number(
        ASN1_INTEGER_to_BN(X509_get0_serialNumber(certificate), nullptr));
    const LibraryText text(number != nullptr ? BN_bn2hex(number.get()) : nullptr);
    return text != nullptr ? text.get() : "";
}

std::optional<double> secondsOf(const ASN1_TIME* time) {
    std::tm fields{};
    if (time == nullptr || ASN1_TIME_to_tm(time, &fields) != 1) return std::nullopt;
    return platform::secondsOf(CalendarDate{fields.tm_year + 1900, fields.tm_mon + 1, fields.tm_mday,
                                            fields.tm_hour, fields.tm_min, fields.tm_sec});
}

std::vector<uint8_t> publicKeyOf(const X509* certificate) {
    unsigned char* der = nullptr;
    const int size = i2d_X509_PUBKEY(X509_get_X509_PUBKEY(certificate), &der);
    if (size <= 0) return {};
    const std::unique_ptr<unsigned char, MemoryDeleter> owner(der);
    return {der, der + size};
}

std::optional<Certificate> describe(const X509* certificate, Bytes der) {
    const auto notBefore = secondsOf(X509_get0_notBefore(certificate));
    const auto notAfter = secondsOf(X509_get0_notAfter(certificate));
    if (!notBefore || !notAfter) return std::nullopt;
    const X509_NAME* subject = X509_get_subject_name(certificate);
    std::string summary = attributeText(subject, NID_commonName);
    if (summary.empty()) summary = attributeText(subject, NID_organizationName);
    return Certificate{{der.begin(), der.end()},
                       std::move(summary),
                       nameText(subject),
                       nameText(X509_get_issuer_name(certificate)),
                       serialText(certificate),
                       *notBefore,
                       *notAfter,
                       publicKeyOf(certificate)};
}

}  // namespace

std::optional<Certificate> readCertificate(Bytes der) {
    if (der.empty() || der.size() > kMaxCertificateBytes) return std::nullopt;
    const unsigned char* end = der.data();
    const std::unique_ptr<X509, Deleter> parsed(d2i_X509(nullptr, &end, static_cast<long>(der.size())));
    std::optional<Certificate> certificate;
    if (parsed != nullptr && end == der.data() + der.size()) certificate = describe(parsed.get(), der);
    openssl::clearErrors();
    return certificate;
}

}  // namespace platform
