#include "Platform/crypto/SignedMessage.h"

#include <openssl/bio.h>
#include <openssl/cms.h>

#include "Platform/crypto/OpenSSLLibrary.h"

namespace platform {

namespace {

using openssl::library;
VELTOID_LAZY_FUNCTIONS(library, BIO_ctrl, BIO_free, BIO_new, BIO_s_mem, CMS_ContentInfo_free,
                       CMS_get0_content, CMS_get0_type, CMS_verify, d2i_CMS_ContentInfo, OBJ_obj2nid);

using Message = LazyOwner<CMS_ContentInfo, CMS_ContentInfo_free>;

bool carriesContent(CMS_ContentInfo* message) {
    if (OBJ_obj2nid(CMS_get0_type(message)) != NID_pkcs7_signed) return false;
    ASN1_OCTET_STRING** content = CMS_get0_content(message);
    return content != nullptr && *content != nullptr;
}

std::optional<std::vector<uint8_t>> verify(CMS_ContentInfo* message) {
    const LazyOwner<BIO, BIO_free> content(BIO_new(BIO_s_mem()));
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
    const auto parsed = openssl::decoded<Message>(d2i_CMS_ContentInfo, message, kMaxSignedMessageBytes);
    std::optional<std::vector<uint8_t>> content;
    if (parsed != nullptr && carriesContent(parsed.get())) content = verify(parsed.get());
    openssl::clearErrors();
    return content;
}

}  // namespace platform
