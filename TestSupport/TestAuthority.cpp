#include "TestSupport/TestAuthority.h"

#include <openssl/bio.h>
#include <openssl/cms.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>

#include <cstdlib>

namespace veltoid::testing_support {

namespace {

template <auto Free>
struct Deleter {
    template <typename Object>
    void operator()(Object* object) const {
        Free(object);
    }
};
using Key = std::unique_ptr<EVP_PKEY, Deleter<EVP_PKEY_free>>;
using Certificate = std::unique_ptr<X509, Deleter<X509_free>>;
using Request = std::unique_ptr<X509_REQ, Deleter<X509_REQ_free>>;
using RevocationList = std::unique_ptr<X509_CRL, Deleter<X509_CRL_free>>;
using Number = std::unique_ptr<ASN1_INTEGER, Deleter<ASN1_INTEGER_free>>;
using Time = std::unique_ptr<ASN1_TIME, Deleter<ASN1_TIME_free>>;
using Stream = std::unique_ptr<BIO, Deleter<BIO_free_all>>;
using Message = std::unique_ptr<CMS_ContentInfo, Deleter<CMS_ContentInfo_free>>;

/// Tests cannot go on without their own material.
template <typename Result>
Result require(Result result) {
    if (!result) std::abort();
    return result;
}

template <typename Object>
Bytes derOf(int (*encode)(const Object*, unsigned char**), const Object* object) {
    Bytes der(static_cast<size_t>(require(encode(object, nullptr) > 0 ? encode(object, nullptr) : 0)));
    unsigned char* end = der.data();
    encode(object, &end);
    return der;
}

Stream streamOf(std::string_view text) {
    return Stream(BIO_new_mem_buf(text.data(), static_cast<int>(text.size())));
}

Bytes contentOf(BIO* stream) {
    char* bytes = nullptr;
    const long size = BIO_get_mem_data(stream, &bytes);
    return {bytes, bytes + size};
}

void addExtension(X509* certificate, int identifier, const char* value, const X509* issuer = nullptr) {
    X509V3_CTX context;
    X509V3_set_ctx(&context, const_cast<X509*>(issuer), certificate, nullptr, nullptr, 0);
    X509_EXTENSION* extension = require(X509V3_EXT_conf_nid(nullptr, &context, identifier, value));
    X509_add_ext(certificate, extension, -1);
    X509_EXTENSION_free(extension);
}

void setName(X509_NAME* name, const std::string& commonName) {
    X509_NAME_add_entry_by_NID(name, NID_commonName, V_ASN1_UTF8STRING,
                               reinterpret_cast<const unsigned char*>(commonName.data()),
                               static_cast<int>(commonName.size()), -1, 0);
}

/// Takes the text as it is, even when it is no date.
void setTime(const ASN1_TIME* time, const std::string& text) {
    auto* writable = const_cast<ASN1_TIME*>(time);
    ASN1_STRING_set(writable, text.data(), static_cast<int>(text.size()));
    writable->type = V_ASN1_GENERALIZEDTIME;
}

Certificate certify(EVP_PKEY* publicKey, const CertificateContent& content, const X509* issuer,
                    EVP_PKEY* issuerKey, bool isAuthority) {
    Certificate certificate(X509_new());
    X509_set_version(certificate.get(), X509_VERSION_3);
    ASN1_INTEGER_set(X509_get_serialNumber(certificate.get()), content.serialNumber);
    setName(X509_get_subject_name(certificate.get()), content.commonName);
    X509_set_issuer_name(certificate.get(),
                         X509_get_subject_name(issuer != nullptr ? issuer : certificate.get()));
    setTime(X509_get0_notBefore(certificate.get()), content.notBefore);
    setTime(X509_get0_notAfter(certificate.get()), content.notAfter);
    X509_set_pubkey(certificate.get(), publicKey);
    addExtension(certificate.get(), NID_basic_constraints,
                 isAuthority ? "critical,CA:TRUE" : "critical,CA:FALSE");
    addExtension(certificate.get(), NID_key_usage,
                 isAuthority ? "critical,keyCertSign,cRLSign,digitalSignature"
                             : "critical,digitalSignature,keyEncipherment");
    if (!isAuthority) addExtension(certificate.get(), NID_ext_key_usage, "clientAuth");
    addExtension(certificate.get(), NID_subject_key_identifier, "hash");
    if (issuer != nullptr) addExtension(certificate.get(), NID_authority_key_identifier, "keyid", issuer);
    require(X509_sign(certificate.get(), issuerKey, EVP_sha256()) > 0);
    return certificate;
}

std::string describe(const X509_NAME_ENTRY* entry) {
    const ASN1_STRING* value = X509_NAME_ENTRY_get_data(entry);
    return std::string(ASN1_tag2str(ASN1_STRING_type(value))) + "/" +
           OBJ_nid2sn(OBJ_obj2nid(X509_NAME_ENTRY_get_object(entry))) + "=" +
           std::string(reinterpret_cast<const char*>(ASN1_STRING_get0_data(value)),
                       static_cast<size_t>(ASN1_STRING_length(value)));
}

void readKeyUsage(X509_REQ* request, RequestContent& content) {
    STACK_OF(X509_EXTENSION)* extensions = X509_REQ_get_extensions(request);
    int critical = 0;
    auto* usage =
        static_cast<ASN1_BIT_STRING*>(X509V3_get_d2i(extensions, NID_key_usage, &critical, nullptr));
    for (int bit = 0; usage != nullptr && bit < 9; ++bit)
        if (ASN1_BIT_STRING_get_bit(usage, bit) == 1) content.keyUsage.push_back(bit);
    content.keyUsageIsCritical = critical == 1;
    ASN1_BIT_STRING_free(usage);
    sk_X509_EXTENSION_pop_free(extensions, X509_EXTENSION_free);
}

}  // namespace

struct TestAuthority::Credential {
    Key key;
    Certificate certificate;
};

std::string pemOf(const Bytes& der, std::string_view kind) {
    const Stream stream(BIO_new(BIO_s_mem()));
    PEM_write_bio(stream.get(), std::string(kind).c_str(), "", der.data(), static_cast<long>(der.size()));
    const Bytes text = contentOf(stream.get());
    return {text.begin(), text.end()};
}

TestAuthority::TestAuthority(const std::string& name, const TestAuthority* issuer)
    : own_(std::make_unique<Credential>()) {
    own_->key.reset(require(EVP_EC_gen("P-256")));
    CertificateContent content;
    content.commonName = name;
    own_->certificate =
        certify(own_->key.get(), content, issuer != nullptr ? issuer->own_->certificate.get() : nullptr,
                issuer != nullptr ? issuer->own_->key.get() : own_->key.get(), true);
    certificate_ = derOf(i2d_X509, own_->certificate.get());
}

TestAuthority::~TestAuthority() = default;

Bytes TestAuthority::issue(const Bytes& publicKey, const CertificateContent& content) const {
    const unsigned char* end = publicKey.data();
    const Key key(require(d2i_PUBKEY(nullptr, &end, static_cast<long>(publicKey.size()))));
    return derOf(i2d_X509,
                 certify(key.get(), content, own_->certificate.get(), own_->key.get(), false).get());
}

Bytes TestAuthority::sign(std::string_view content, Content kind) const {
    const Stream stream = streamOf(content);
    const unsigned flags = CMS_BINARY | (kind == Content::Detached ? CMS_DETACHED : 0);
    const Message message(
        require(CMS_sign(own_->certificate.get(), own_->key.get(), nullptr, stream.get(), flags)));
    return derOf(i2d_CMS_ContentInfo, message.get());
}

std::string TestAuthority::revocationList(const std::vector<long>& serialNumbers) const {
    const RevocationList list(X509_CRL_new());
    X509_CRL_set_issuer_name(list.get(), X509_get_subject_name(own_->certificate.get()));
    const Time now(ASN1_TIME_set(nullptr, 1'600'000'000));
    X509_CRL_set1_lastUpdate(list.get(), now.get());
    for (const long serialNumber : serialNumbers) {
        X509_REVOKED* entry = X509_REVOKED_new();
        const Number number(ASN1_INTEGER_new());
        ASN1_INTEGER_set(number.get(), serialNumber);
        X509_REVOKED_set_serialNumber(entry, number.get());
        X509_REVOKED_set_revocationDate(entry, now.get());
        X509_CRL_add0_revoked(list.get(), entry);
    }
    require(X509_CRL_sign(list.get(), own_->key.get(), EVP_sha256()) > 0);
    return pemOf(derOf(i2d_X509_CRL, list.get()), "X509 CRL");
}

std::string TestAuthority::rejectedCertificate() const {
    const Certificate copy(X509_dup(own_->certificate.get()));
    X509_add1_reject_object(copy.get(), OBJ_nid2obj(NID_client_auth));
    const Stream stream(BIO_new(BIO_s_mem()));
    PEM_write_bio_X509_AUX(stream.get(), copy.get());
    const Bytes text = contentOf(stream.get());
    return {text.begin(), text.end()};
}

RequestContent readRequest(const std::string& pem) {
    RequestContent content;
    const Stream stream = streamOf(pem);
    const Request request(PEM_read_bio_X509_REQ(stream.get(), nullptr, nullptr, nullptr));
    if (request == nullptr) return content;
    EVP_PKEY* key = X509_REQ_get0_pubkey(request.get());
    content.signatureVerifies = X509_REQ_verify(request.get(), key) == 1;
    content.keyBits = EVP_PKEY_get_bits(key);
    content.publicKey = derOf(i2d_PUBKEY, key);
    const X509_NAME* subject = X509_REQ_get_subject_name(request.get());
    for (int i = 0; i < X509_NAME_entry_count(subject); ++i)
        content.subject.push_back(describe(X509_NAME_get_entry(subject, i)));
    readKeyUsage(request.get(), content);
    return content;
}

}  // namespace veltoid::testing_support
