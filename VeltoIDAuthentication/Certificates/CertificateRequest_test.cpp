#include "Certificates/CertificateRequest.h"

#include <gtest/gtest.h>

#include <sstream>

#include "Platform/crypto/KeyPair.h"
#include "TestSupport/TestAuthority.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"

namespace veltoid {
namespace {

using testing_support::pemOf;
using testing_support::readRequest;
using testing_support::TestAuthority;

struct Made {
    String text;
    Key publicKey, privateKey;
};

Made make(const String& accountName) {
    Made made;
    EXPECT_EQ(createKeyPairAndCertificateRequest(accountName, &made.text, &made.publicKey, &made.privateKey),
              0);
    return made;
}

TEST(CertificateRequest, SaysWhoseItIsInTheOrderThatTheServerWants) {
    for (const auto& [name, form] :
         std::vector<std::pair<std::string, std::string>>{{"jane.roe@velto.example", "PRINTABLESTRING"},
                                                          {"Jane Roe", "PRINTABLESTRING"},
                                                          {"j_#+,\"=<>;\\", "PRINTABLESTRING"},
                                                          {"jürgen_#+,\"=<>;\\", "UTF8STRING"},
                                                          {"", "PRINTABLESTRING"}}) {
        const Made made = make(name);
        const auto content = readRequest(made.text.text());
        EXPECT_TRUE(content.signatureVerifies) << name;
        EXPECT_EQ(content.subject, (std::vector<std::string>{form + "/CN=" + name, "PRINTABLESTRING/C=US",
                                                             "PRINTABLESTRING/O=Velto, Inc."}));
        EXPECT_EQ(content.keyBits, 2048);
        EXPECT_EQ(content.keyUsage, (std::vector<int>{0, 2})) << "digitalSignature, keyEncipherment";
        EXPECT_TRUE(content.keyUsageIsCritical);
        EXPECT_EQ(Data(content.publicKey), made.publicKey.publicPart);
        EXPECT_EQ(Key::privateKey(made.privateKey.encoded.bytes()), made.privateKey);
        EXPECT_NE(made.publicKey, made.privateKey) << "they are not of one class";
        EXPECT_EQ(made.publicKey.publicPart, made.privateKey.publicPart);
    }
}

/// The length of the last line of the body, after a look at all of it.
size_t checkedLastLine(const std::string& text) {
    std::istringstream stream(text);
    std::vector<std::string> lines;
    for (std::string line; std::getline(stream, line);) lines.push_back(line);
    EXPECT_GT(lines.size(), 3U);
    EXPECT_EQ(lines.front(), "-----BEGIN CERTIFICATE REQUEST-----");
    EXPECT_EQ(lines.back(), "-----END CERTIFICATE REQUEST-----");
    for (size_t i = 1; i + 2 < lines.size(); ++i) EXPECT_EQ(lines[i].size(), 64U) << text;
    EXPECT_TRUE(text.ends_with("-\n") && readRequest(text).signatureVerifies) << text;
    return lines[lines.size() - 2].size();
}

TEST(CertificateRequest, IsPEMEvenWhenItsLastLineIsFull) {
    // Three bytes more in the name are four characters more in the body.
    size_t length = 1;
    size_t last = 0;
    for (int attempt = 0; attempt < 5 && last != 64; ++attempt) {
        length += 3 * ((64 - last) / 4 % 16);
        last = checkedLastLine(make(std::string(length, 'n')).text.text());
    }
    EXPECT_EQ(last, 64U);
}

TEST(CertificateRequest, AKeyIsNewEachTime) {
    EXPECT_NE(make("a").publicKey, make("a").publicKey);
    EXPECT_EQ(createKeyPairAndCertificateRequest("a", nullptr, nullptr, nullptr), 0);
}

TEST(CertificateFromPEM, IsReadOrNone) {
    const TestAuthority authority;
    const auto pair = platform::generateRSAKeyPair(2048);
    ASSERT_TRUE(pair);
    const auto der = authority.issue(pair->publicKey);
    const auto certificate = certificateFromPEM(pemOf(der));
    ASSERT_TRUE(certificate);
    EXPECT_EQ(certificate->der, der);
    EXPECT_EQ(certificate->summary, "jane.roe@velto.example");
    EXPECT_EQ(certificate->subject, "CN=jane.roe@velto.example");
    EXPECT_EQ(certificate->issuer, "CN=Test authority");
    EXPECT_EQ(certificate->serialNumber, "1A2B3C");
    EXPECT_EQ(certificate->notBefore, 1'577'836'800);
    EXPECT_EQ(certificate->notAfter, 4'070'908'800);
    EXPECT_EQ(certificate->publicKey, pair->publicKey);

    const testing_support::Bytes cut(der.begin(), der.end() - 1);
    auto longer = der;
    longer.push_back(0);
    testing_support::CertificateContent undated;
    undated.notAfter = "tomorrow, perhaps";
    const String texts[] = {nullptr,          "",
                            "hello",          pemOf({}),
                            pemOf(cut),       pemOf(longer),
                            pemOf({1, 2, 3}), pemOf(authority.issue(pair->publicKey, undated)),
                            make("a").text,   pemOf(std::vector<uint8_t>(70'000, 0x30))};
    for (const String& text : texts) EXPECT_FALSE(certificateFromPEM(text)) << text.view().substr(0, 100);
}

TEST(CertificateFromPEM, DamagedOnesAreReadOrRefusedButDoNoHarm) {
    const TestAuthority authority;
    const auto der = authority.issue(platform::generateRSAKeyPair(2048)->publicKey);
    for (size_t i = 0; i < der.size(); ++i) {
        auto damaged = der;
        damaged[i] ^= 0x55;
        const auto read = platform::readCertificate(damaged);
        EXPECT_TRUE(!read || read->der == damaged);
        EXPECT_FALSE(platform::readCertificate(platform::Bytes(der).first(i))) << i;
    }
}

TEST(CertificateLabel, NamesTheAccount) {
    EXPECT_EQ(certificateLabelForAccount("jane"), "Velto ID authorization certificate for jane");
    EXPECT_FALSE(certificateLabelForAccount(nullptr));
}

}  // namespace
}  // namespace veltoid
