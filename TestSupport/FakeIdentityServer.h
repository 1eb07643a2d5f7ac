// The identity server as tests of its clients see it: answers are set by method, calls are recorded. What
// goes over the wire is real; the connection is not.
#pragma once

#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "TestSupport/DatabaseFixture.h"
#include "TestSupport/FakeHTTPSession.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"
#include "XMLRPC/XMLRPCDefaultEncoder.h"
#include "XMLRPC/XMLRPCResponse.h"

namespace veltoid {

/// Methods go by their short names. All operations may be called from any thread.
class FakeIdentityServer {
  public:
    struct Call {
        std::string url;
        std::string method;
        Dictionary parameters;
    };

    FakeIdentityServer() {
        transport_.respondWith([this](const platform::HTTPRequest& request) { return serve(request); });
    }

    // What every call of the method gets from now on. Unset methods get a fault.
    void answer(const std::string& method, const Value& reply) { set(method, answerOf(reply)); }
    /// A reply that depends on the parameters of the call, or something that happens meanwhile; an Error is a
    /// fault with its code, or, in domain kNoAnswer, that HTTP status.
    void answerWith(const std::string& method, std::function<Value(const Dictionary& parameters)> reply) {
        const std::lock_guard lock(mutex_);
        answers_[method] = [reply = std::move(reply)](const Dictionary& parameters) {
            return answerOf(reply(parameters));
        };
    }
    static constexpr const char* kNoAnswer = "no answer";
    static Value noAnswer() { return Error{kNoAnswer, 503, {}}; }
    static Value faultOf(int64_t code) { return Error{"fault", code, {}}; }
    void fault(const std::string& method, int64_t code) { set(method, answerOf(faultOf(code))); }
    void refuse(const std::string& method, int status) { set(method, {status}); }
    /// Whatever the exchange yields.
    void set(const std::string& method, const platform::FakeHTTPAnswer& answer) {
        const std::lock_guard lock(mutex_);
        answers_[method] = [answer](const Dictionary&) { return answer; };
    }

    /// The calls since the last time.
    std::vector<Call> take() {
        const std::lock_guard lock(mutex_);
        return std::exchange(calls_, {});
    }

    /// Their short names, separated by blanks.
    std::string takeMethods() {
        std::string methods;
        for (const Call& call : take()) methods += (methods.empty() ? "" : " ") + call.method;
        return methods;
    }

  private:
    using Answer = platform::FakeHTTPAnswer;

    static Answer answerOf(const Value& reply) {
        const Error* error = reply.asError();
        if (error == nullptr) return methodResponse("<params><param>" + encoded(reply) + "</param></params>");
        if (error->domain == kNoAnswer) return {static_cast<int>(error->code)};
        const Dictionary fault = {{"faultCode", Value::int64(error->code)}, {"faultString", "because"}};
        return methodResponse("<fault>" + encoded(fault) + "</fault>");
    }
    static Answer methodResponse(const std::string& content) {
        return {200, "<methodResponse>" + content + "</methodResponse>"};
    }

    static std::string encoded(const Value& value) {
        const auto text = XMLRPCDefaultEncoder::encodeObject(value);
        return {text.begin(), text.end()};
    }

    Answer serve(const platform::HTTPRequest& request) {
        const std::string_view body(request.body);
        const size_t start = body.find("<methodName>") + std::string_view("<methodName>").size();
        std::string method(body.substr(start, body.find("</methodName>") - start));
        EXPECT_EQ(method.find(kVeltoIDMethodPrefix), 0U) << method;
        method.erase(0, kVeltoIDMethodPrefix.size());
        const XMLRPCResponse parameter(platform::SecretBytes(body.begin(), body.end()));
        const Dictionary* parameters = parameter.object().asDictionary();

        std::unique_lock lock(mutex_);
        const Dictionary given = parameters != nullptr ? *parameters : Dictionary();
        calls_.push_back({request.url, method, given});
        const auto found = answers_.find(method);
        if (found == answers_.end()) return {404};
        const auto reply = found->second;
        // While one call is answered, others may come.
        lock.unlock();
        return reply(given);
    }

    platform::FakeHTTPTransport transport_;
    std::mutex mutex_;
    std::map<std::string, std::function<Answer(const Dictionary&)>> answers_;
    std::vector<Call> calls_;
};

/// A device with one account, and the identity server.
class ServerTest : public DatabaseTest {
  protected:
    static constexpr const char* kName = "jane@velto.example";
    static constexpr const char* kPassword = "hash of a password";
    static constexpr const char* kURL = "https://server.example/rpc";

    static void createAccount(const String& encDsId = "d1") {
        ASSERT_TRUE(__VeltoIDDBCreateVeltoIDAccount(kName, kPassword, encDsId));
    }
    static Dictionary record() {
        AccountRecord record;
        __VeltoIDDBCopyVeltoIDAccount(kName, &record);
        return record.values();
    }
    static Dictionary certificateEntry(const String& encDsId = "d1") {
        CertificateEntry entry;
        __VeltoIDDBCopyCertificateInfo(encDsId, &entry);
        return entry.values();
    }
    /// Sets values of the account's certificate entry; Null removes.
    static void setInEntry(const Dictionary& values) {
        for (const auto& [key, value] : values) __VeltoIDDBSetCertificateValue("d1", key, value, Notify::No);
    }
    static void setValue(const char* key, const Value& value) {
        ASSERT_TRUE(__VeltoIDDBSetAccountValue(kName, key, value, Notify::No));
    }
    static void setValues(const Dictionary& values) {
        for (const auto& [key, value] : values)
            ASSERT_TRUE(__VeltoIDDBSetAccountValue(kName, key, value, Notify::No));
    }
    static bool hasPassword() { return record().contains("HashedPasswordRef"); }

    static Value meta(const char* key, const String& section = nullptr) {
        return __VeltoIDDBCopyMetaInfoValue(section, {}, key);
    }
    /// A session of the account, as a sign-in that many seconds ago has yielded it.
    Session session(const String& encDsId = "d1", double age = 0, double validity = 100,
                    const String& id = "s1") const {
        return Session(new VeltoIDAuthenticationSessionInfo{kName, kPassword, kURL, id, now() - age, validity,
                                                            encDsId, copySessionQueueForAccount(kName)});
    }

    /// A counter of the account.
    static int64_t count(std::string_view key) {
        return __VeltoIDDBCopyMetaInfoValue(kName, {}, key).asInt64().value_or(0);
    }

    FakeIdentityServer server_;
};

}  // namespace veltoid
