#include "Platform/crypto/KeyPair.h"

#include <openssl/evp.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>

#include <memory>

#include "Platform/crypto/OpenSSLLibrary.h"
#include "Platform/runtime/SystemLog.h"

namespace platform {

namespace {

using openssl::library;
VELTOID_LAZY_FUNCTION(library, ASN1_BIT_STRING_free);
VELTOID_LAZY_FUNCTION(library, ASN1_BIT_STRING_new);
VELTOID_LAZY_FUNCTION(library, ASN1_BIT_STRING_set_bit);
VELTOID_LAZY_FUNCTION(library, d2i_PKCS8_PRIV_KEY_INFO);
VELTOID_LAZY_FUNCTION(library, d2i_PUBKEY);
VELTOID_LAZY_FUNCTION(library, EVP_PKCS82PKEY);
VELTOID_LAZY_FUNCTION(library, EVP_PKEY2PKCS8);
VELTOID_LAZY_FUNCTION(library, EVP_PKEY_free);
VELTOID_LAZY_FUNCTION(library, EVP_PKEY_Q_keygen);
VELTOID_LAZY_FUNCTION(library, EVP_sha256);
VELTOID_LAZY_FUNCTION(library, i2d_PKCS8_PRIV_KEY_INFO);
VELTOID_LAZY_FUNCTION(library, i2d_PUBKEY);
VELTOID_LAZY_FUNCTION(library, i2d_X509_REQ);
VELTOID_LAZY_FUNCTION(library, OPENSSL_sk_free);
VELTOID_LAZY_FUNCTION(library, OPENSSL_sk_new_null);
VELTOID_LAZY_FUNCTION(library, OPENSSL_sk_push);
VELTOID_LAZY_FUNCTION(library, PKCS8_PRIV_KEY_INFO_free);
VELTOID_LAZY_FUNCTION(library, X509_EXTENSION_free);
VELTOID_LAZY_FUNCTION(library, X509_NAME_add_entry_by_NID);
VELTOID_LAZY_FUNCTION(library, X509_REQ_add_extensions);
VELTOID_LAZY_FUNCTION(library, X509_REQ_free);
VELTOID_LAZY_FUNCTION(library, X509_REQ_get_subject_name);
VELTOID_LAZY_FUNCTION(library, X509_REQ_new);
VELTOID_LAZY_FUNCTION(library, X509_REQ_set_pubkey);
VELTOID_LAZY_FUNCTION(library, X509_REQ_set_version);
VELTOID_LAZY_FUNCTION(library, X509_REQ_sign);
VELTOID_LAZY_FUNCTION(library, X509V3_EXT_i2d);

template <const auto& Free>
struct Freeing {
    template <typename Object>
    void operator()(Object* object) const {
        Free(object);
    }
};
using Key = std::unique_ptr<EVP_PKEY, Freeing<EVP_PKEY_free>>;
using PrivateKeyInfo = std::unique_ptr<PKCS8_PRIV_KEY_INFO, Freeing<PKCS8_PRIV_KEY_INFO_free>>;
using CertificationRequest = std::unique_ptr<X509_REQ, Freeing<X509_REQ_free>>;
using BitString = std::unique_ptr<ASN1_BIT_STRING, Freeing<ASN1_BIT_STRING_free>>;
using Extension = std::unique_ptr<X509_EXTENSION, Freeing<X509_EXTENSION_free>>;
using Extensions = std::unique_ptr<OPENSSL_STACK, Freeing<OPENSSL_sk_free>>;

// Positions of the key usages (RFC 5280, 4.2.1.3).
constexpr int kDigitalSignature = 0;
constexpr int kKeyEncipherment = 2;

/// What the library's encoder writes for the object; empty when it refuses.
template <typename Container, typename Encode, typename Object>
Container encoded(const Encode& encode, const Object* object) {
    const int size = encode(object, nullptr);
    if (size <= 0) return {};
    Container der(static_cast<size_t>(size));
    unsigned char* end = der.data();
    if (encode(object, &end) != size) return {};
    return der;
}

Key readPrivateKey(Bytes pkcs8) {
    if (pkcs8.empty() || pkcs8.size() > kMaxKeyBytes) return nullptr;
    const unsigned char* end = pkcs8.data();
    const PrivateKeyInfo info(d2i_PKCS8_PRIV_KEY_INFO(nullptr, &end, static_cast<long>(pkcs8.size())));
    Key key(info != nullptr && end == pkcs8.data() + pkcs8.size() ? EVP_PKCS82PKEY(info.get()) : nullptr);
    if (key == nullptr) openssl::clearErrors();
    return key;
}

std::vector<uint8_t> encodePublicKey(const EVP_PKEY* key) {
    return encoded<std::vector<uint8_t>>(i2d_PUBKEY, key);
}

int identifierOf(SubjectAttribute::Type type) {
    switch (type) {
        case SubjectAttribute::Type::CommonName:
            return NID_commonName;
        case SubjectAttribute::Type::CountryName:
            return NID_countryName;
        case SubjectAttribute::Type::OrganizationName:
            return NID_organizationName;
    }
    return NID_undef;
}

/// With a type given, the library takes the bytes as they are, whatever the type allows.
bool addSubject(X509_REQ* request, std::span<const SubjectAttribute> subject) {
    X509_NAME* const name = X509_REQ_get_subject_name(request);
    for (const SubjectAttribute& attribute : subject) {
        const Bytes value = bytesOf(attribute.value);
        if (X509_NAME_add_entry_by_NID(name, identifierOf(attribute.type), V_ASN1_PRINTABLESTRING,
                                       value.data(), static_cast<int>(value.size()), -1, 0) != 1)
            return false;
    }
    return true;
}

bool addKeyUsage(X509_REQ* request) {
    const BitString usage(ASN1_BIT_STRING_new());
    if (usage == nullptr || ASN1_BIT_STRING_set_bit(usage.get(), kDigitalSignature, 1) != 1 ||
        ASN1_BIT_STRING_set_bit(usage.get(), kKeyEncipherment, 1) != 1)
        return false;
    const Extension extension(X509V3_EXT_i2d(NID_key_usage, /*crit=*/1, usage.get()));
    const Extensions extensions(OPENSSL_sk_new_null());
    return extension != nullptr && extensions != nullptr &&
           OPENSSL_sk_push(extensions.get(), extension.get()) > 0 &&
           X509_REQ_add_extensions(request, reinterpret_cast<STACK_OF(X509_EXTENSION)*>(extensions.get())) ==
               1;
}

void logRefusal(const char* what) {
    VELTOID_PLATFORM_LOG(Error, std::string(what) + ": " + openssl::takeReason());
}

}  // namespace

std::optional<KeyPair> generateRSAKeyPair(size_t bits) {
    const Key key(EVP_PKEY_Q_keygen(nullptr, nullptr, "RSA", bits));
    const PrivateKeyInfo info(key != nullptr ? EVP_PKEY2PKCS8(key.get()) : nullptr);
    KeyPair pair;
    if (info != nullptr) {
        pair.privateKey = encoded<SecretBytes>(i2d_PKCS8_PRIV_KEY_INFO, info.get());
        pair.publicKey = encodePublicKey(key.get());
    }
    if (!pair.privateKey.empty() && !pair.publicKey.empty()) return pair;
    logRefusal("no key pair could be generated");
    return std::nullopt;
}

std::optional<std::vector<uint8_t>> publicKeyOf(Bytes privateKey) {
    const Key key = readPrivateKey(privateKey);
    if (key == nullptr) return std::nullopt;
    auto publicKey = encodePublicKey(key.get());
    if (publicKey.empty()) return std::nullopt;
    return publicKey;
}

bool isPublicKey(Bytes bytes) {
    if (bytes.empty() || bytes.size() > kMaxKeyBytes) return false;
    const unsigned char* end = bytes.data();
    const Key key(d2i_PUBKEY(nullptr, &end, static_cast<long>(bytes.size())));
    if (key == nullptr) openssl::clearErrors();
    return key != nullptr && end == bytes.data() + bytes.size();
}

std::optional<std::vector<uint8_t>> createCertificationRequest(Bytes privateKey,
                                                               std::span<const SubjectAttribute> subject) {
    const Key key = readPrivateKey(privateKey);
    const CertificationRequest request(key != nullptr ? X509_REQ_new() : nullptr);
    if (request != nullptr && X509_REQ_set_version(request.get(), X509_REQ_VERSION_1) == 1 &&
        addSubject(request.get(), subject) && X509_REQ_set_pubkey(request.get(), key.get()) == 1 &&
        addKeyUsage(request.get()) && X509_REQ_sign(request.get(), key.get(), EVP_sha256()) > 0) {
        auto der = encoded<std::vector<uint8_t>>(i2d_X509_REQ, request.get());
        if (!der.empty()) return der;
    }
    logRefusal("no certification request could be created");
    return std::nullopt;
}

}  // namespace platform
