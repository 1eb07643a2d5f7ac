#include "Platform/crypto/TrustEvaluation.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include "Platform/crypto/KeyPair.h"
#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/SimulatedClock.h"
#include "TestSupport/TemporaryStateDirectory.h"
#include "TestSupport/TestAuthority.h"

namespace platform {
namespace {

using veltoid::testing_support::CertificateContent;
using veltoid::testing_support::pemOf;
using veltoid::testing_support::TestAuthority;

class TrustTest : public testing::Test {
  protected:
    TrustTest() {
        std::filesystem::create_directory(directory_.base() / "harbwell");
        setenv("XDG_CONFIG_HOME", directory_.base().c_str(), 1);
    }

    void setAuthorities(const std::string& pem) const {
        TemporaryStateDirectory::writeFile(directory_.base() / "harbwell" / "identity-authority.pem", pem);
    }

    Certificate issue(const CertificateContent& content = {}) const {
        return *readCertificate(intermediate_.issue(key_.publicKey, content));
    }

    SimulatedClock clock_{1'750'000'000};  // 2025-06-15
    FakeSystemLog log_;
    TemporaryStateDirectory directory_;
    const KeyPair key_ = *generateRSAKeyPair(2048);
    const TestAuthority root_{"Root"};
    const TestAuthority intermediate_{"Intermediate", &root_};
    const TestAuthority stranger_{"Intermediate"};
    const Certificate above_ = *readCertificate(intermediate_.certificate());
    const Certificate wrong_ = *readCertificate(stranger_.certificate());
};

TEST_F(TrustTest, FollowsThePathToAnAuthority) {
    const std::string root = pemOf(root_.certificate());
    const std::string both = pemOf(stranger_.certificate()) + "\nsome words\n" + root;
    const CertificateContent over{.notBefore = "20200101000000Z", .notAfter = "20210101000000Z"};
    const CertificateContent early{.notBefore = "20300101000000Z", .notAfter = "20310101000000Z"};
    const Certificate good = issue();
    Certificate broken = good;
    broken.der.back() ^= 1;
    using enum TrustResult;
    const std::tuple<const char*, std::string, Certificate, std::vector<Certificate>, TrustResult> cases[] = {
        {"a path", root, good, {above_}, Unspecified},
        {"among others", both, good, {wrong_, above_}, Unspecified},
        {"an intermediate authority", pemOf(intermediate_.certificate()), good, {}, Unspecified},
        {"no intermediate", root, good, {}, FatalFailure},
        {"the wrong intermediate", root, good, {wrong_}, FatalFailure},
        {"another authority of that name", pemOf(stranger_.certificate()), good, {above_}, FatalFailure},
        {"a bad signature", root, broken, {above_}, FatalFailure},
        {"over", root, issue(over), {above_}, RecoverableFailure},
        {"not yet", root, issue(early), {above_}, RecoverableFailure},
        {"over, and no path", root, issue(over), {}, FatalFailure},
    };
    for (const auto& [what, authorities, certificate, intermediates, result] : cases) {
        setAuthorities(authorities);
        EXPECT_EQ(evaluateTrust(certificate, intermediates), result) << what;
    }
}

TEST_F(TrustTest, DeniesWhatIsRevokedOrRejected) {
    const std::string root = pemOf(root_.certificate());
    const Certificate good = issue();
    const Certificate revoked = issue({.serialNumber = 7});
    setAuthorities(root + intermediate_.revocationList({7}));
    EXPECT_EQ(evaluateTrust(good, {{above_}}), TrustResult::Unspecified);
    EXPECT_EQ(evaluateTrust(revoked, {{above_}}), TrustResult::Deny);
    setAuthorities(root + TestAuthority("Other").revocationList({7}));
    EXPECT_EQ(evaluateTrust(good, {{above_}}), TrustResult::Unspecified)
        << "that list is another authority's";
    setAuthorities(root_.rejectedCertificate());
    EXPECT_EQ(evaluateTrust(good, {{above_}}), TrustResult::Deny);
}

TEST_F(TrustTest, SaysNothingWithoutAuthorities) {
    for (const std::string& text : {std::string(), std::string("hello"), std::string(5U << 20U, 'x'),
                                    pemOf(veltoid::testing_support::Bytes{1, 2, 3})}) {
        setAuthorities(text);
        EXPECT_EQ(evaluateTrust(issue(), {}), std::nullopt);
    }
    EXPECT_EQ(log_.count("no certificate can be evaluated: "), 4);
}

}  // namespace
}  // namespace platform
