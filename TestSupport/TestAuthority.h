// Certificates, certificate requests and signed messages for unit tests, made and read with OpenSSL directly,
// so that what the agent makes and reads is held against something else.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace veltoid::testing_support {

using Bytes = std::vector<uint8_t>;

/// "-----BEGIN CERTIFICATE-----" and so on around the DER.
std::string pemOf(const Bytes& der, std::string_view kind = "CERTIFICATE");

/// What a certificate is to say; dates are texts of the ASN.1 form GeneralizedTime and are not checked.
struct CertificateContent {
    std::string commonName = "jane.roe@velto.example";
    std::string notBefore = "20200101000000Z";
    std::string notAfter = "20990101000000Z";
    long serialNumber = 0x1A2B3C;
};

/// An authority with a key and a certificate of its own.
class TestAuthority {
  public:
    explicit TestAuthority(const std::string& name = "Test authority", const TestAuthority* issuer = nullptr);
    ~TestAuthority();

    const Bytes& certificate() const { return certificate_; }

    /// A client certificate (DER) for the public key (SubjectPublicKeyInfo, DER).
    Bytes issue(const Bytes& publicKey, const CertificateContent& content = {}) const;

    enum class Content { Attached, Detached };
    /// A CMS signed message (DER), signed with the authority's own certificate.
    Bytes sign(std::string_view content, Content kind = Content::Attached) const;

    /// The certificates with these serial numbers, revoked (PEM).
    std::string revocationList(const std::vector<long>& serialNumbers) const;

    /// The authority's certificate, marked as rejected for client authentication (PEM of OpenSSL).
    std::string rejectedCertificate() const;

  private:
    struct Credential;
    std::unique_ptr<Credential> own_;
    Bytes certificate_;
};

/// What a certificate signing request says.
struct RequestContent {
    bool signatureVerifies = false;
    /// One per relative distinguished name, in order: "TAG/attribute=value", such as
    /// "PRINTABLESTRING/CN=jane".
    std::vector<std::string> subject;
    int keyBits = 0;
    /// Numbers of the key-usage bits that are set, and whether the extension is critical.
    std::vector<int> keyUsage;
    bool keyUsageIsCritical = false;
    Bytes publicKey;
};

/// Reads a request in PEM; all is empty when it is none.
RequestContent readRequest(const std::string& pem);

}  // namespace veltoid::testing_support
