// Requests as clients send them, and the replies that they get.
#include "VeltoIDAuthd/AuthenticationService.h"

#include <unistd.h>

#include <array>
#include <functional>
#include <thread>

#include "Platform/FakeNotifications.h"
#include "VeltoIDAuthd/AccountStatus.h"
#include "VeltoIDAuthd/PasswordCheckService.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDKeychainItems/Passwords.h"
#include "VeltoIDXMLServerCommunications/FakeIdentityServer.h"

namespace veltoid {
namespace {

const Value kOn = flag(true);
const Value kOff = flag(false);

class FakeMessage : public platform::IncomingMessage {
  public:
    explicit FakeMessage(Dictionary request) : request_(std::move(request)) {}

    std::optional<int64_t> peekInteger(std::string_view key) override { return request_[key].asInt64(); }
    void read(platform::ValueSink& sink) override {
        EXPECT_GT(platform::transactions::openCount(), 0) << "the agent must not leave now";
        writeValue(request_, sink);
    }
    void reply(platform::ValueWriter writer) override {
        ValueBuilder builder;
        writer(builder);
        EXPECT_EQ(replies_++, 0) << "one reply to a request";
        EXPECT_TRUE(builder.value().isDictionary());
        if (const Dictionary* dictionary = builder.value().asDictionary()) reply_ = *dictionary;
    }

    const Dictionary& reply() const { return reply_; }
    int replies() const { return replies_; }

  private:
    Dictionary request_;
    Dictionary reply_;
    int replies_ = 0;
};

class ServiceTest : public ServerTest {
  protected:
    void SetUp() override {
        ServerTest::SetUp();
        server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
        server_.answer("getMyInfo", Dictionary{{"encDsId", "d1"}, {"firstNm", "Jane"}});
    }

    using Handler = void (*)(platform::IncomingMessage&);

    static Dictionary send(Value command, Dictionary request = {},
                           Handler handle = handleAuthenticationIPCMessage) {
        request.set("command", std::move(command));
        FakeMessage message(request);
        handle(message);
        EXPECT_EQ(message.replies(), 1);
        return message.reply();
    }
    static Dictionary send(int64_t command, const Dictionary& request = {}) {
        return send(number(command), request);
    }

    static int64_t errorCode(const Dictionary& reply) {
        const Dictionary* error = reply.dictionary("error");
        if (error == nullptr) return 0;
        EXPECT_EQ(keysOf(*error), (std::set<std::string>{"Code", "Domain", "UserInfo"}));
        return (*error)["Code"].asInt64().value_or(0);
    }

    static Dictionary firstStatus() {
        const Dictionary status = *send(0x510).dictionary("status");
        const Dictionary* accounts = status.dictionary("AccountStatuses");
        return accounts->empty() ? Dictionary() : *accounts->begin()->value.asDictionary();
    }

    platform::FakeNotifications notifications_;
};

const Dictionary kSuccess = {{"success", kOn}};
const Dictionary kFailure = {{"success", kOff}};

TEST_F(ServiceTest, OnlyKnownCommandsSucceed) {
    struct Case {
        Value command;
        bool succeeds;
    };
    const Case cases[] = {{number(1), true},   {Value::uint64(1), true}, {number(2), false},
                          {number(-1), false}, {number(0x9998), false},  {"1", false},
                          {{}, false},         {Value::real(1.5), false}};
    for (const Case& each : cases) {
        EXPECT_EQ(send(each.command), each.succeeds ? kSuccess : kFailure)
            << testing::PrintToString(each.command);
    }
}

TEST_F(ServiceTest, SetsDatabaseValues) {
    createAccount("d1");
    __VeltoIDDBSetCertificateInfo("d1", std::nullopt);
    struct Case {
        const char* what;
        Value domain;
        Value item;
        Value key;
        /// By the command that fails when nothing can be set, and by the one that does not.
        bool succeeds;
        bool succeedsIfPossible;
        std::function<Value()> stored;
        int signals;
    };
    const auto inRecord = [] { return record()["k"]; };
    const auto inEntry = [] { return certificateEntry()["k"]; };
    const auto inMeta = [] { return meta("k"); };
    const auto inSection = [] { return meta("k", "item"); };
    const Case cases[] = {
        {"an account", "Accounts", kName, "k", true, true, inRecord, 1},
        {"no such account", "Accounts", "x", "k", false, false, inRecord, 0},
        {"a certificate", "Certificates", "d1", "k", true, true, inEntry, 1},
        {"no such certificate", "Certificates", "x", "k", false, false, inEntry, 0},
        {"the device", "MetaInfo", {}, "k", true, true, inMeta, 0},
        {"a section", "MetaInfo", "item", "k", true, true, inSection, 0},
        {"no domain", {}, kName, "k", false, true, inRecord, 0},
        {"no key", "Accounts", kName, {}, false, true, inRecord, 0},
        {"no item", "Accounts", {}, "k", false, true, inRecord, 0},
        {"an unknown domain", "Other", kName, "k", false, true, inRecord, 0},
        {"a key of the wrong kind", "MetaInfo", {}, number(1), false, true, inMeta, 0},
    };
    for (const Case& each : cases) {
        for (const int64_t command : {0xFE, 0xFF}) {
            (void)takeSignals();
            Dictionary request = {{"domain", each.domain}, {"item", each.item}, {"key", each.key}};
            const Dictionary removal = request;
            request.set("value", "v");
            const bool succeeds = command == 0xFE ? each.succeeds : each.succeedsIfPossible;
            EXPECT_EQ(send(command, request), succeeds ? kSuccess : kFailure) << each.what << command;
            EXPECT_EQ(each.stored(), each.succeeds ? Value("v") : Value()) << each.what << command;
            EXPECT_EQ(takeSignals(), each.signals) << each.what << command;
            send(command, removal);
            EXPECT_TRUE(each.stored().isAbsent()) << each.what << command << ": no value removes";
        }
    }
    (void)takeSignals();
    const Dictionary quietly = {{"Dirty", kOff}};
    send(0xFE, {{"domain", "Accounts"}, {"item", kName}, {"key", "k"}, {"value", "v"}, {"options", quietly}});
    EXPECT_EQ(record()["k"], Value("v"));
    EXPECT_EQ(takeSignals(), 0);
}

TEST_F(ServiceTest, AddsAnAccountAndKeepsNoOther) {
    for (const char* other : {"old@velto.example", "JANE@velto.example"})
        ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount(other, "hash", nullptr));
    const Dictionary reply = send(0x120, {{"VeltoID", "Jane@Velto.Example"}, {"hashedpassword", kPassword}});
    EXPECT_EQ(keysOf(reply), (std::set<std::string>{"accountinfo", "encDsId", "success"}));
    EXPECT_EQ(reply["success"], kOn);
    EXPECT_EQ(reply["encDsId"], Value("d1"));
    EXPECT_EQ(reply.dictionary("accountinfo")->string("FirstName"), "Jane");
    EXPECT_FALSE(record().contains("ValidationDate")) << "it is validated again";
    // A name that differs in case only is the same account for clients.
    EXPECT_EQ(send(0x150)["result"], Value(Array{"JANE@velto.example", kName}));
    EXPECT_EQ(meta("VeltoIDAddVeltoIDCount"), number(1));

    server_.fault("authenticate", -20101);
    EXPECT_EQ(send(0x120, {{"VeltoID", "second"}, {"hashedpassword", "x"}}), kSuccess)
        << "stored, although the server refuses the password";
    EXPECT_EQ(send(0x150)["result"], Value(Array{"second"}));
    EXPECT_EQ(errorCode(send(0x120)), -100);
    EXPECT_EQ(send(0x150)["result"], Value(Array{"second"}));
    EXPECT_EQ(meta("VeltoIDAddVeltoIDCount"), number(3));
}

TEST_F(ServiceTest, ForgetsAnAccount) {
    createAccount("d1");
    const Dictionary before = record();
    EXPECT_EQ(send(0x160, {{"VeltoID", "JANE@velto.example"}}),
              (Dictionary{{"success", kOn}, {"VeltoID", kName}, {"encDSID", "d1"}, {"accountInfo", before}}));
    EXPECT_EQ(errorCode(send(0x160, {{"VeltoID", kName}})), -108);
    EXPECT_EQ(errorCode(send(0x160, {{"VeltoID", number(1)}})), -99);
    EXPECT_EQ(send(0x150), (Dictionary{{"success", kOn}, {"result", Array()}}));
    EXPECT_EQ(meta("VeltoIDForgetVeltoIDCount"), number(3));
}

TEST_F(ServiceTest, TellsWhoAnAccountIs) {
    createAccount("d1");
    const Dictionary reply = send(0x130, {{"VeltoID", kName}});
    EXPECT_EQ(reply["success"], kOn);
    EXPECT_EQ(reply.dictionary("info")->string("FirstName"), "Jane");
    const Dictionary skip = {{"SkipValidation", kOn}};
    const Dictionary failed = send(0x130, {{"VeltoID", kName}, {"options", skip}});
    EXPECT_EQ(keysOf(failed), (std::set<std::string>{"error", "success"}));
    EXPECT_EQ(errorCode(failed), -100);
    EXPECT_EQ(count("VeltoIDGetMyInfoCount"), 2);
    EXPECT_EQ(errorCode(send(0x130, {{"VeltoID", "nobody"}})), -108);
}

TEST_F(ServiceTest, VerifiesAPasswordOnBothServices) {
    for (const Handler service : {&handleAuthenticationIPCMessage, &handlePasswordCheckIPCMessage}) {
        const auto verify = [&](const Dictionary& request) { return send(number(0x180), request, service); };
        const Dictionary complete = {{"VeltoID", kName}, {"hashedpassword", "x"}};
        server_.answer("authenticate", Dictionary{{"encDsId", "d1"}});
        EXPECT_EQ(verify(complete), kSuccess);
        EXPECT_TRUE(meta("LastConnectAttempt").isAbsent()) << "nothing is saved";
        server_.fault("authenticate", -20283);
        const Dictionary refused = verify(complete);
        EXPECT_EQ(refused["success"], kOff);
        EXPECT_EQ(errorCode(refused), -101);
        EXPECT_EQ(verify({{"VeltoID", kName}}), kFailure);
        EXPECT_EQ(verify({{"hashedpassword", "x"}}), kFailure);
        EXPECT_EQ(verify({{"VeltoID", kName}, {"hashedpassword", number(5)}}), kFailure);
        EXPECT_EQ(server_.take().size(), 2U);
    }
}

TEST_F(ServiceTest, ThePasswordCheckServiceHasItsOwnCommands) {
    const auto check = [](int64_t command, const Dictionary& request = {}) {
        return send(number(command), request, handlePasswordCheckIPCMessage);
    };
    EXPECT_EQ(check(1), kSuccess);
    EXPECT_EQ(check(0x120, {{"VeltoID", kName}}), kFailure);
    const Data reference(std::vector<uint8_t>{1, 2});
    EXPECT_EQ(errorCode(check(400, {{"identityReferenceData", reference}})), -114) << "no such service here";
    EXPECT_EQ(check(400), kFailure);
    Data updated;
    setLinkedIdentityHandler([&](const Data& given, ErrorOut) {
        updated = given;
        return true;
    });
    EXPECT_EQ(check(400, {{"identityReferenceData", "no data"}}), kFailure);
    EXPECT_FALSE(updated);
    EXPECT_EQ(check(400, {{"identityReferenceData", reference}}), kSuccess);
    EXPECT_EQ(updated, reference);
}

TEST_F(ServiceTest, ShowsTheWholeDatabase) {
    createAccount("d1");
    const Dictionary reply = send(0x500);
    EXPECT_EQ(reply["success"], kOn);
    EXPECT_EQ(*reply.dictionary("result"), storedDomain());
    EXPECT_EQ(
        reply.dictionary("result")->dictionary("Accounts")->dictionary(kName)->data("HashedPasswordRef"),
        record().data("HashedPasswordRef"));
}

// --- Status

TEST_F(ServiceTest, StatusOfTheAgent) {
    const Dictionary empty = *send(0x510).dictionary("status");
    EXPECT_EQ(empty, (Dictionary{{"AccountStatuses", Dictionary()},
                                 {"LaunchTime", Value::date(launchTime())},
                                 {"pid", number(getpid())},
                                 {"DeviceUnlockedSinceBoot", kOn}}));
    createAccount("d1");
    __VeltoIDDBSetMetaInfoValue(nullptr, "LastConnectAttempt", date(-5));
    scheduleRelaunch(now() + 60, true);
    clock_.settle();
    const Dictionary status = *send(0x510).dictionary("status");
    EXPECT_EQ(keysOf(status),
              (std::set<std::string>{"AccountStatuses", "DeviceUnlockedSinceBoot", "DirtyAccounts",
                                     "DirtyAccountsAndCertificates", "LastConnectAttempt", "LaunchTime",
                                     "NextLaunchTime", "pid"}));
    EXPECT_EQ(status["DirtyAccounts"], Value(Array{kName}));
    EXPECT_EQ(status["DirtyAccountsAndCertificates"], Value(Array{kName}));
    EXPECT_EQ(status["NextLaunchTime"], date(60));
    EXPECT_EQ(status["LastConnectAttempt"], date(-5));
    EXPECT_TRUE(record().contains("Dirty")) << "looking does not clean";
}

TEST_F(ServiceTest, StatusOfAnAccount) {
    createAccount(nullptr);
    setValue("Dirty", {});
    setValue("LastConnectAttempt", date(-100));
    setValue("ValidationDate", "whatever is stored");
    EXPECT_EQ(firstStatus(), (Dictionary{{"ValidationDate", "whatever is stored"},
                                         {"NextActionTime", date()},
                                         {"AccountState", "NoEncodedDSID"},
                                         {"AccountRequiresUserAction", kOff}}));
    setValue("encDsId", "d1");
    EXPECT_EQ(firstStatus()["AccountState"], Value("NoCertificate"));
    setValue("CertificateToken", "t");
    setValue("NextCertificateFetchDate", date(70));
    EXPECT_EQ(firstStatus()["AccountState"], Value("CertificatePending"));
    EXPECT_EQ(firstStatus()["NextFetchAttempt"], date(70));
    ASSERT_TRUE(removePasswordFromKeychainGivenPersistentRef(record().data("HashedPasswordRef")));
    EXPECT_EQ(firstStatus()["AccountState"], Value("PasswordInaccessibleInKeychain"));
    EXPECT_EQ(firstStatus()["AccountRequiresUserAction"], kOn) << "the device is unlocked";
    EXPECT_TRUE(log_.contains("or the password has been removed from the keychain; no next action."));
    __VeltoIDDBRemovePassword(kName);
    EXPECT_EQ(firstStatus()["AccountState"], Value("PasswordInvalid"));
    EXPECT_TRUE(log_.contains(std::string(kName) + " doesn't have a password; no next action."));
    EXPECT_EQ(firstStatus()["AccountRequiresUserAction"], kOn);
    EXPECT_FALSE(firstStatus().contains("NextActionTime"));

    __VeltoIDDBSetMetaInfoValue(nullptr, "AccountRequiresUserAction", "0");
    EXPECT_EQ(firstStatus()["AccountRequiresUserAction"], kOff);
    EXPECT_EQ(
        log_.count("copyAccountStatusesDictionaryVeltoIDAccountStatusRequiresUserAction override value 0"),
        1);
    __VeltoIDDBSetMetaInfoValue(nullptr, "AccountRequiresUserAction", "no");
    EXPECT_EQ(firstStatus()["AccountRequiresUserAction"], kOn);
    __VeltoIDDBSetMetaInfoValue(nullptr, "AccountRequiresUserAction", number(0));
    createAccount("d1");
    EXPECT_EQ(firstStatus()["AccountRequiresUserAction"], kOff) << "an override is a text";
}

// --- The end

TEST_F(ServiceTest, EndsAfterTheReplyWhenTheStatusRequestSaysSo) {
    platform::ChildProcess process([this] {
        createAccount("d1");
        const Dictionary terminate = {{"VeltoIDAuthenticationStatusTerminateServer", kOn}};
        const Dictionary reply = send(0x510, {{"options", terminate}});
        const Dictionary unlocked = {{"DeviceUnlockedSinceBoot", kOn}};
        if (reply != Dictionary{{"success", kOn}, {"status", unlocked}}) return false;
        if (platform::transactions::openCount() > 1 || !nextLaunchDate()) return false;
        clock_.advanceBy(0.09);
        // The process ends in here.
        clock_.advanceBy(0.02);
        return false;
    });
    EXPECT_TRUE(process.succeeded());
}

TEST_F(ServiceTest, EndsAtOnceWithoutAReply) {
    platform::ChildProcess process([this] {
        createAccount("d1");
        FakeMessage message({{"command", number(0x9999)}});
        handleAuthenticationIPCMessage(message);
        return false;
    });
    EXPECT_TRUE(process.succeeded());
    EXPECT_EQ(send(0x150)["result"], Value(Array{kName})) << "what it had was kept";
}

TEST_F(ServiceTest, ManyClientsAtOnce) {
    createAccount("d1");
    std::vector<std::thread> clients;
    std::array<std::atomic<int>, 6> answered{};
    for (size_t client = 0; client < answered.size(); ++client) {
        clients.emplace_back([this, client, &answered] {
            const platform::WorkQueue queue("client " + std::to_string(client));
            for (int round = 0; round < 10; ++round) {
                queue.sync([&] {
                    const Dictionary account = {{"VeltoID", kName}, {"hashedpassword", kPassword}};
                    constexpr int64_t kCommands[] = {0x120, 0x130, 0x150, 0x180, 0x510, 0x500};
                    if (send(kCommands[client], account)["success"] == kOn) ++answered[client];
                });
            }
        });
    }
    for (std::thread& client : clients) client.join();
    for (const auto& count : answered) EXPECT_EQ(count, 10);
}

}  // namespace
}  // namespace veltoid
