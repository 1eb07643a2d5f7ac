#include "Platform/crypto/SignedMessage.h"

#include <openssl/bio.h>
#include <openssl/cms.h>

#include <memory>

#include "Platform/crypto/OpenSSLLibrary.h"

namespace platform {

namespace {

using openssl::library;
VELTOID_LAZY_FUNCTION(library, BIO_ctrl);
VELTOID_LAZY_FUNCTION(library, BIO_free);
VELTOID_LAZY_FUNCTION(library, BIO_new);
VELTOID_LAZY_FUNCTION(library, BIO_s_mem);
VELTOID_LAZY_FUNCTION(library, CMS_ContentInfo_free);
VELTOID_LAZY_FUNCTION(library, CMS_get0_content);
VELTOID_LAZY_FUNCTION(library, CMS_get0_type);
VELTOID_LAZY_FUNCTION(library, CMS_verify);
VELTOID_LAZY_FUNCTION(library, d2i_CMS_ContentInfo);
VELTOID_LAZY_FUNCTION(library, OBJ_obj2nid);

struct Deleter {
    void operator()(CMS_ContentInfo* message) const { CMS_ContentInfo_free(message); }
    void operator()(BIO* stream) const { BIO_free(stream); }
};
using Message = std::unique_ptr<CMS_ContentInfo, Deleter>;
using Stream = std::unique_ptr<BIO, Deleter>;

Message read(Bytes bytes) {
    if (bytes.empty() || bytes.size() > kMaxSignedMessageBytes) return nullptr;
    const unsigned char* end = bytes.data();
    Message message(d2i_CMS_ContentInfo(nullptr, &end, static_cast<long>(bytes.size())));
    if (end != bytes.data() + bytes.size()) message.reset();
    return message;
}

bool carriesContent(CMS_ContentInfo* message) {
    if (OBJ_obj2nid(CMS_get0_type(message)) != NID_pkcs7_signed) return false;
    ASN1_OCTET_STRING** content = CMS_get0_content(message);
    return content != nullptr && *content != nullptr;
}

std::optional<std::vector<uint8_t>> verify(CMS_ContentInfo* message) {
    const Stream content(BIO_new(BIO_s_mem()));
    // Binary: what was signed is taken as it is, without turning line ends into a mail's.
    constexpr unsigned kFlags = CMS_NO_SIGNER_CERT_VERIFY | CMS_BINARY;
    if (content == nullptr || CMS_verify(message, nullptr, nullptr, nullptr, content.get(), kFlags) != 1)
        return std::nullopt;
    char* bytes = nullptr;
    const long length = BIO_ctrl(content.get(), BIO_CTRL_INFO, 0, static_cast<void*>(&bytes));
    return std::vector<uint8_t>(bytes, bytes + length);
}

}  // namespace

std::optional<std::vector<uint8_t>> verifySignedMessage(Bytes message) {
    const Message parsed = read(message);
    std::optional<std::vector<uint8_t>> content;
    if (parsed != nullptr && carriesContent(parsed.get())) content = verify(parsed.get());
    openssl::clearErrors();
    return content;
}

}  // namespace platform
