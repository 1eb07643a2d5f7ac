// What tests of the account engine stand on: a real database and keychain, an identity server that is told
// what to answer, and simulated time.
#pragma once

#include <functional>

#include "TestSupport/FakeIdentityServer.h"
#include "TestSupport/FakeNotifications.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {

inline const Array kEmails{"jane@velto.example"};
inline const Value kRecordData = Data(std::vector<uint8_t>{1, 2});

enum class Server { Up, Down, NoSignIn, NoAnswer, RefusesPassword };

class EngineTest : public ServerTest {
  protected:
    void SetUp() override {
        ServerTest::SetUp();
        serverIs(Server::Up);
    }

    void serverIs(Server state) {
        server_.answer("authenticate", Dictionary{{"encDsId", "d1"}, {"Version", Value::int32(101)}});
        server_.answer("getMyInfo",
                       Dictionary{{"encDsId", "d1"}, {"firstNm", "Jane"}, {"ValidatedEmail", kEmails}});
        if (state == Server::Down) server_.refuse("authenticate", 503);
        if (state == Server::NoSignIn) server_.answer("authenticate", Dictionary());
        if (state == Server::NoAnswer) server_.fault("getMyInfo", -5);
        if (state == Server::RefusesPassword) server_.fault("authenticate", -20101);
    }

    /// An entry that is of use.
    static void storeCertificateEntry(const char* encDsId) {
        const Data reference(std::vector<uint8_t>{1});
        __VeltoIDDBSetCertificateInfo(encDsId, Dictionary{{"CertificateReference", reference}});
        __VeltoIDDBSetCertificateValue(encDsId, "CertificatePrivateKeyReference", reference, Notify::No);
    }

    /// What was posted since the last time: "added/removed", "changed".
    std::string takePosted() {
        std::string text;
        for (const std::string& name : notifications_.take()) {
            if (name == "HWVeltoIDAccountConfigurationAddedOrRemovedNotification") text += "added/removed ";
            if (name == "HWVeltoIDAccountConfigurationChangeNotification") text += "changed ";
        }
        return text;
    }

    platform::FakeNotifications notifications_;
};

}  // namespace veltoid
