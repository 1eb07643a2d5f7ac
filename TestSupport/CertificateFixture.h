// What tests of certificates stand on: a device with one account, a server that signs what it is asked to,
// and the authority that the device trusts.
#pragma once

#include <stdlib.h>

#include <fstream>
#include <functional>
#include <vector>

#include "Platform/crypto/KeyPair.h"
#include "TestSupport/FakeIdentityServer.h"
#include "TestSupport/FakeNotifications.h"
#include "TestSupport/TestAuthority.h"
#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"

namespace veltoid {

class CertificateTest : public ServerTest {
  protected:
    void SetUp() override {
        ServerTest::SetUp();
        createAccount("d1");
        setValue("Dirty", {});
        server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
        server_.answer("getMyInfo", Dictionary{{"encDsId", "d1"}});
        server_.answer("downloadCertComplete", Dictionary{{"done", "yes"}});
        trust(root_);
        setProcessHooks({.scheduleRelaunch = [this](double date) { relaunches_.push_back(date - now()); }});
    }

    /// The device trusts this authority alone.
    void trust(const testing_support::TestAuthority& authority) const {
        setenv("XDG_CONFIG_HOME", directory_.base().c_str(), 1);
        std::filesystem::create_directories(directory_.base() / kVeltoIDFolder);
        std::ofstream(directory_.base() / kVeltoIDFolder / kVeltoIDIdentityAuthorityFile)
            << testing_support::pemOf(authority.certificate());
    }

    /// What the server says of a certificate that it has just issued for the last request.
    Dictionary issued(const Dictionary& changes = {}) {
        const auto certificate = intermediate_.issue(requested_);
        Dictionary dsCert = {{"Certificate", testing_support::pemOf(certificate)},
                             {"IntermediateCert", testing_support::pemOf(intermediate_.certificate())},
                             {"CertStatus", "CERT_ISSUED"},
                             {"SerialNumber", "1A2B3C"},
                             {"Expires", date(100 * 86'400)},
                             {"CertType", "client"}};
        for (const auto& [key, value] : changes) {
            if (value.isNull())
                dsCert.remove(key.view());
            else
                dsCert.set(key, value);
        }
        return dsCert;
    }

    /// The server takes requests and answers with what `reply` makes.
    void onRequest(std::function<Dictionary()> reply) {
        server_.answerWith("createCert", [this, reply = std::move(reply)](const Dictionary& parameters) {
            requested_ = testing_support::readRequest(parameters.string("CSR").text()).publicKey;
            EXPECT_EQ(parameters["encDsId"], Value("d1"));
            return reply();
        });
    }
    void issueAtOnce() {
        onRequest([this] { return Dictionary{{"dsCert", issued()}}; });
    }

    bool request(const Dictionary& options = {}) {
        error_.reset();
        return __VeltoIDDoCreateCertificateRequestForVeltoID(kName, options, nullptr, &error_);
    }
    bool fetch(FetchTime time = FetchTime::WhenDue) {
        error_.reset();
        return __VeltoIDDoFetchCertificateForVeltoID(kName, time, {}, &error_);
    }
    bool update(const std::optional<Dictionary>& result, const Value& delay = {}) {
        error_.reset();
        return updateAccountWithCertificateResult(OwnershipLock(), kName, "d1", {result, delay}, &error_);
    }
    int64_t takeCode() const { return error_ ? error_->code : 0; }
    /// Seconds from now of a Date in the record.
    double in(const char* key) const { return record().date(key).value_or(-1e12) - now(); }

    static size_t keys() { return copyAllKeysFromKeychain().value_or(Array()).size(); }
    static size_t certificates() { return copyAllCertificatesFromKeychain().value_or(Array()).size(); }

    platform::FakeNotifications notifications_;
    const testing_support::TestAuthority root_{"Root"};
    const testing_support::TestAuthority intermediate_{"Intermediate", &root_};
    testing_support::Bytes requested_;
    std::vector<double> relaunches_;
    std::optional<Error> error_;
};

}  // namespace veltoid
