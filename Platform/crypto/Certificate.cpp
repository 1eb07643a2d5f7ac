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
VELTOID_LAZY_FUNCTIONS(library, ASN1_INTEGER_to_BN, ASN1_STRING_to_UTF8, ASN1_TIME_to_tm, BIO_ctrl, BIO_free,
                       BIO_new, BIO_s_mem, BN_bn2hex, BN_free, CRYPTO_free, d2i_X509, i2d_X509_PUBKEY,
                       X509_free, X509_get0_notAfter, X509_get0_notBefore, X509_get0_serialNumber,
                       X509_get_issuer_name, X509_get_subject_name, X509_get_X509_PUBKEY,
                       X509_NAME_ENTRY_get_data, X509_NAME_get_entry, X509_NAME_get_index_by_NID,
                       X509_NAME_print_ex);

struct MemoryDeleter {
    void operator()(void* memory) const { CRYPTO_free(memory, __FILE__, __LINE__); }
};

std::string nameText(const X509_NAME* name) {
    const LazyOwner<BIO, BIO_free> stream(BIO_new(BIO_s_mem()));
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
    const LazyOwner<BIGNUM, BN_free> number(ASN1_INTEGER_to_BN(X509_get0_serialNumber(certificate), nullptr));
    const std::unique_ptr<char, MemoryDeleter> text(number != nullptr ? BN_bn2hex(number.get()) : nullptr);
    return text != nullptr ? text.get() : "";
}

std::optional<double> secondsOf(const ASN1_TIME* time) {
    std::tm fields{};
    if (time == nullptr || ASN1_TIME_to_tm(time, &fields) != 1) return std::nullopt;
    return platform::secondsOf(CalendarDate{fields.tm_year + 1900, fields.tm_mon + 1, fields.tm_mday,
                                            fields.tm_hour, fields.tm_min, fields.tm_sec});
}

std::optional<Certificate> describe(const X509* certificate, Bytes der) {
    const auto notBefore = secondsOf(X509_get0_notBefore(certificate));
    const auto notAfter = secondsOf(X509_get0_notAfter(certificate));
    if (!notBefore || !notAfter) return std::nullopt;
    const X509_NAME* subject = X509_get_subject_name(certificate);
    std::string summary = attributeText(subject, NID_commonName);
    if (summary.empty()) summary = attributeText(subject, NID_organizationName);
    return Certificate{
        {der.begin(), der.end()},
        std::move(summary),
        nameText(subject),
        nameText(X509_get_issuer_name(certificate)),
        serialText(certificate),
        *notBefore,
        *notAfter,
        openssl::encoded<std::vector<uint8_t>>(i2d_X509_PUBKEY, X509_get_X509_PUBKEY(certificate))};
}

}  // namespace

std::optional<Certificate> readCertificate(Bytes der) {
    const auto parsed = openssl::decoded<LazyOwner<X509, X509_free>>(d2i_X509, der, kMaxCertificateBytes);
    std::optional<Certificate> certificate;
    if (parsed != nullptr) certificate = describe(parsed.get(), der);
    openssl::clearErrors();
    return certificate;
}

}  // namespace platform
