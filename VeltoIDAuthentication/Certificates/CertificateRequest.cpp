#include "Certificates/CertificateRequest.h"

#include "Platform/crypto/KeyPair.h"
#include "Values/Base64.h"
#include "Values/Error.h"
#include "Values/PEM.h"

namespace veltoid {
namespace {

constexpr std::string_view kPEMHeader = "-----BEGIN CERTIFICATE REQUEST-----\n";
constexpr std::string_view kPEMFooter = "\n-----END CERTIFICATE REQUEST-----\n";

String pemText(const std::vector<uint8_t>& der) {
    const Data request{der};
    // A body of whole lines ends with a line feed of its own; an empty line would make readers take what is
    // above it for headers.
    const size_t characters = (request.size() + 2) / 3 * 4;
    const bool endsWithLineFeed = characters % kBase64LineLength == 0;
    return base64Encode(request, kPEMHeader, kPEMFooter.substr(endsWithLineFeed ? 1 : 0));
}

String makeRequest(const String& accountName, platform::Bytes privateKey) {
    using Type = platform::SubjectAttribute::Type;
    const platform::SubjectAttribute subject[] = {{Type::CommonName, accountName.view()},
                                                  {Type::CountryName, "US"},
                                                  {Type::OrganizationName, "Velto, Inc."}};
    const auto der = platform::createCertificationRequest(privateKey, subject);
    return der ? pemText(*der) : String();
}

}  // namespace

int32_t createKeyPairAndCertificateRequest(const String& accountName, String* request, Key* publicKey,
                                           Key* privateKey) {
    fill(request, {});
    fill(publicKey, {});
    fill(privateKey, {});
    const auto pair = platform::generateRSAKeyPair(kVeltoIDKeyBits);
    if (!pair) return kKeyGenerationFailed;
    const String made = makeRequest(accountName, pair->privateKey);
    if (!made) return 0;
    fill(request, made);
    const Data publicPart{pair->publicKey};
    fill(publicKey, {false, publicPart, publicPart});
    fill(privateKey, {true, Data(pair->privateKey), publicPart});
    return 0;
}

std::optional<platform::Certificate> certificateFromPEM(const String& pem) {
    const Data der = pemBodyToData(pem);
    return der ? platform::readCertificate(der.bytes()) : std::nullopt;
}

String certificateLabelForAccount(const String& accountName) {
    return accountName ? String("Velto ID authorization certificate for " + accountName.text()) : String();
}

}  // namespace veltoid
