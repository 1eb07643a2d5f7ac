#include "Platform/crypto/KeyPair.h"

#include <openssl/evp.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>

#include "Platform/crypto/OpenSSLLibrary.h"
#include "Platform/encoding/UTF8.h"
#include "Platform/runtime/SystemLog.h"

namespace platform {

namespace {

using openssl::library;
VELTOID_LAZY_FUNCTIONS(library, ASN1_BIT_STRING_free, ASN1_BIT_STRING_new, ASN1_BIT_STRING_set_bit,
                       d2i_PKCS8_PRIV_KEY_INFO, d2i_PUBKEY, EVP_PKCS82PKEY, EVP_PKEY2PKCS8, EVP_PKEY_free,
                       EVP_PKEY_Q_keygen, EVP_sha256, i2d_PKCS8_PRIV_KEY_INFO, i2d_PUBKEY, i2d_X509_REQ,
                       OPENSSL_sk_free, OPENSSL_sk_new_null, OPENSSL_sk_push, PKCS8_PRIV_KEY_INFO_free,
                       X509_EXTENSION_free, X509_NAME_add_entry_by_NID, X509_REQ_add_extensions,
                       X509_REQ_free, X509_REQ_get_subject_name, X509_REQ_new, X509_REQ_set_pubkey,
                       X509_REQ_set_version, X509_REQ_sign, X509V3_EXT_i2d);

using Key = LazyOwner<EVP_PKEY, EVP_PKEY_free>;
using PrivateKeyInfo = LazyOwner<PKCS8_PRIV_KEY_INFO, PKCS8_PRIV_KEY_INFO_free>;
using CertificationRequest = LazyOwner<X509_REQ, X509_REQ_free>;
using BitString = LazyOwner<ASN1_BIT_STRING, ASN1_BIT_STRING_free>;
using Extension = LazyOwner<X509_EXTENSION, X509_EXTENSION_free>;
using Extensions = LazyOwner<OPENSSL_STACK, OPENSSL_sk_free>;

// Positions of the key usages (RFC 5280, 4.2.1.3).
constexpr int kDigitalSignature = 0;
constexpr int kKeyEncipherment = 2;

Key readPrivateKey(Bytes pkcs8) {
    const auto info = openssl::decoded<PrivateKeyInfo>(d2i_PKCS8_PRIV_KEY_INFO, pkcs8, kMaxKeyBytes);
    Key key(info != nullptr ? EVP_PKCS82PKEY(info.get()) : nullptr);
    if (key == nullptr) openssl::clearErrors();
    return key;
}

std::vector<uint8_t> encodePublicKey(const EVP_PKEY* key) {
    return openssl::encoded<std::vector<uint8_t>>(i2d_PUBKEY, key);
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
        const int form = isASCII(attribute.value) ? V_ASN1_PRINTABLESTRING : V_ASN1_UTF8STRING;
        if (X509_NAME_add_entry_by_NID(name, identifierOf(attribute.type), form, value.data(),
                                       static_cast<int>(value.size()), -1, 0) != 1)
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
        pair.privateKey = openssl::encoded<SecretBytes>(i2d_PKCS8_PRIV_KEY_INFO, info.get());
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
    const auto key = openssl::decoded<Key>(d2i_PUBKEY, bytes, kMaxKeyBytes);
    if (key == nullptr) openssl::clearErrors();
    return key != nullptr;
}

std::optional<std::vector<uint8_t>> createCertificationRequest(Bytes privateKey,
                                                               std::span<const SubjectAttribute> subject) {
    const Key key = readPrivateKey(privateKey);
    const CertificationRequest request(key != nullptr ? X509_REQ_new() : nullptr);
    if (request != nullptr && X509_REQ_set_version(request.get(), X509_REQ_VERSION_1) == 1 &&
        addSubject(request.get(), subject) && X509_REQ_set_pubkey(request.get(), key.get()) == 1 &&
        addKeyUsage(request.get()) && X509_REQ_sign(request.get(), key.get(), EVP_sha256()) > 0) {
        auto der = openssl::encoded<std::vector<uint8_t>>(i2d_X509_REQ, request.get());
        if (!der.empty()) return der;
    }
    logRefusal("no certification request could be created");
    return std::nullopt;
}

}  // namespace platform
