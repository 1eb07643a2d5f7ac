#include "VeltoIDXMLServerCommunications/SignIn.h"

#include <algorithm>
#include <atomic>
#include <string>

#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Protocol/OptionKeys.h"
#include "Protocol/RecordKeys.h"
#include "Values/DateText.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"
#include "VeltoIDXMLServerCommunications/WireKeys.h"

namespace veltoid {
namespace {

constexpr const char* kOperation = "__VeltoIDSessionDoCreateSession";
constexpr std::string_view kClientOutOfDate =
    "The client on this machine is out of date and can not talk with the Velto ID server.";

Error signInError(int64_t code, int line, const ErrorTexts& texts = {}) {
    return makeError(code, texts, {}, kOperation, __FILE_NAME__, line);
}

/// Beside the words for people, what it comes from.
Error outOfDateError(const char* description, int line) {
    return signInError(identity_error::kServerProtocol, line, {kClientOutOfDate, description, {}});
}

/// One sign-in; everything runs on the account's queue.
class SignIn {
  public:
    SignIn(const String& accountName, const String& passwordHash, const Dictionary& options)
        : accountName_(accountName), passwordHash_(passwordHash), options_(options) {}

    Session run(String* encDsId, std::optional<Dictionary>* result, ErrorOut error) {
        perform();
        if (session_) {
            fill(encDsId, encDsId_);
            fill(result, result_);
        } else {
            fillError(error, held_);
        }
        return Session(session_.release());
    }

  private:
    void perform() {
        hasRecord_ = __VeltoIDDBCopyVeltoIDAccount(accountName_, &record_);
        const String url = serverURL();
        if (!getBool(&options_, option::kDoNotUseCachedSession, false))
            session_ = takeCachedSession(accountName_, passwordHash_, url);
        if (session_) {
            encDsId_ = session_->fEncDsId;
            count(kVeltoIDXMLSessionReusedCountKey);
            count(kVeltoIDMetaSuccessfulConnectionCountKey);
        } else {
            if (mayConnect()) signInAnew(url);
            keepBooks();
        }
    }

    void count(std::string_view counter) {
        __VeltoIDDBIncrementMetaInfoCounter(accountName_, options_, counter, 1);
    }

    /// From the options, the account's record, the meta information or its default; null for none.
    String serverURL() const {
        const Value& given = options_[option::kServerURL];
        String url = given.asString();
        if (const auto asURL = given.asURL()) url = asURL->first;
        if (!url && hasRecord_) url = record_.serverURL();
        if (!url)
            url = __VeltoIDDBCopyMetaInfoValue(nullptr, options_, kVeltoIDDBServerURLKey, Value::Kind::String)
                      .asString();
        return url.empty() ? String() : url;
    }

    /// False, with the error held, while the server must not be contacted for this account.
    bool mayConnect() {
        if (!hasRecord_) return true;
        if (record_.isClientTooOld()) {
            VELTOID_LOG_FROM(kOperation, kNotice,
                             "Not connecting to VeltoID authentication server because clientTooOld = true is "
                             "set for this account ",
                             accountName_, ".");
            held_ = outOfDateError("The server has refused this version of the agent", __LINE__);
            return false;
        }
        if (const auto earliest = record_.embargoEnd(now_)) {
            VELTOID_LOG_FROM(kOperation, kNotice,
                             "Not connecting to VeltoID authentication server because there is an "
                             "earliest-allowed-connection-date set for this account ",
                             accountName_, ", ", Value::date(*earliest), " which is before now.");
            held_ = signInError(identity_error::kServerCannotBeReached, __LINE__);
            return false;
        }
        return true;
    }

    void signInAnew(const String& url) {
        const Dictionary parameters = authenticateParameters();
        count(kVeltoIDMetaConnectionAttemptCountKey);
        if (url) {
            authenticate(url, parameters);
        } else {
            held_ = copyAndHandleXMLErrorResponse(
                accountName_, passwordHash_, std::nullopt,
                signInError(identity_error::kUnknown, __LINE__, {{}, "The server has no address", {}}));
        }
        if (session_) return;
        VELTOID_LOG_FROM(kOperation, kNotice, "Didn't succeed with .authenticate, and error is ",
                         held_ ? Value(*held_) : Value(), " so releasing session.");
    }

    Dictionary authenticateParameters() {
        Dictionary parameters = createCallParameters(accountName_, nullptr, options_);
        parameters.set(wire::kAccount, accountName_);
        parameters.set(wire::kPasswordHash, passwordHash_);
        parameters.set(wire::kUserUUID, __VeltoIDDBCopyMetaInfoValue(nullptr, {}, kVeltoIDMetaUserUUIDKey,
                                                                     Value::Kind::String));
        parameters.set(wire::kClientDateTime, Value::date(now_));
        if (hasRecord_) addAccountParameters(parameters);
        return parameters;
    }

    void addAccountParameters(Dictionary& parameters) {
        oldEncDsId_ = record_.encDsId();
        oldRecordIdentifier_ = record_.validationRecordIdentifier();
        parameters.set(wire::kKnownRecordIdentifier, oldRecordIdentifier_);
        oldCertificate_ = certificateEntryOf(oldEncDsId_);
        parameters.set(wire::kKnownSerialNumber, oldCertificate_.serialNumber());
        const String uuid = record_.uuid();
        parameters.set(wire::kAccountUUID, uuid);
        parameters.set(wire::kMachineUUID, uuid);
        parameters.set(wire::kAccountStableUUID, record_.stableUUID());
    }

    void authenticate(const String& url, const Dictionary& parameters) {
        auto session = std::make_unique<VeltoIDAuthenticationSessionInfo>(
            VeltoIDAuthenticationSessionInfo{accountName_, passwordHash_, url, nullptr, now_, 0, nullptr,
                                             copySessionQueueForAccount(accountName_)});
        std::optional<Dictionary> reply;
        std::optional<Error> callError;
        const String method = std::string(kVeltoIDMethodPrefix) + "authenticate";
        if (!xmlInvoke(*session, method, parameters, &reply, &callError)) {
            held_ = copyAndHandleXMLErrorResponse(accountName_, passwordHash_, reply, callError);
            return;
        }
        count(kVeltoIDXMLAuthenticateCountKey);
        if (reply)
            applyReply(*reply, *session);
        else
            held_ = signInError(identity_error::kSignInFailed, __LINE__, {{}, kUnusableAnswer, {}});
        if (session->fEncDsId) session_ = std::move(session);
    }

    void applyReply(const Dictionary& reply, VeltoIDAuthenticationSessionInfo& session) {
        __VeltoIDDBSetMetaInfoValue(nullptr, kVeltoIDMetaServerVersionKey,
                                    Value::int32(getInt32(&reply, wire::kVersion, 0)));
        applyEmbargo(reply);
        if (reply.boolean(wire::kClientTooOld).value_or(false)) {
            __VeltoIDDBSetAccountValues(accountName_, {{kVeltoIDAccountClientTooOldKey, Value::boolean(true)},
                                                       {kVeltoIDAccountClientTooOldVersionKey,
                                                        Value::real(kVeltoIDDBAccessorVersion)}});
            held_ = signInError(identity_error::kServerCannotBeReached, __LINE__,
                                {{}, "The server refuses this version of the agent", {}});
        }
        encDsId_ = reply.string(wire::kEncDsId);
        if (oldEncDsId_ && encDsId_ && oldEncDsId_ != encDsId_) disableCertificatesOfChangedAccount();
        session.fSessionID = reply.string(wire::kSession);
        if (encDsId_) {
            session.fEncDsId = encDsId_;
            applyCertificateState(reply);
        } else if (!held_) {
            held_ =
                outOfDateError("The server's answer to the sign-in lacks the account's encDsId", __LINE__);
        }
        applyRecordIdentifier(reply.string(wire::kRecordIdentifier));
        result_ = reply;
    }

    void applyEmbargo(const Dictionary& reply) {
        std::optional<double> date = dateFromValue(reply[wire::kDoNotConnectBefore]);
        const int32_t seconds = getInt32(&reply, wire::kDoNotConnectFor, 0);
        if (!date && seconds >= 1) date = now_ + seconds;
        if (!date || *date <= now_) return;
        __VeltoIDDBSetAccountValue(accountName_, kVeltoIDAccountEarliestAllowedConnectionDateKey,
                                   Value::date(std::min(*date, now_ + kMaxEmbargo)));
        held_ = signInError(identity_error::kServerCannotBeReached, __LINE__);
    }

    void disableCertificatesOfChangedAccount() {
        VELTOID_LOG_FROM(kOperation, kError, "Got back a different encDSID for our account, ",
                         describeValue(encDsId_), " vs ", describeValue(oldEncDsId_),
                         " so disabling the certs and VeltoIDValidationRecord on this account.");
        for (const String& encDsId : {oldEncDsId_, encDsId_})
            __VeltoIDDBSetCertificateValue(encDsId, kVeltoIDCertificateStatusKey,
                                           kVeltoIDCertificateStatusInvalid);
        __VeltoIDDBSetAccountValue(accountName_, kVeltoIDAccountValidationRecordIdentifierKey, Value::null());
        __VeltoIDDBSetCertificateValue(encDsId_, kVeltoIDCertificateExpirationDateKey, Value::date(now_));
    }

    /// The server speaks of the certificate that it was told of, not of one that was issued meanwhile.
    void applyCertificateState(const Dictionary& reply) {
        if (oldCertificate_.encDsId() != encDsId_) return;
        if (reply.boolean(wire::kCertificateIsValid).value_or(false)) {
            __VeltoIDDBSetCertificateValues(
                oldCertificate_, {{kVeltoIDCertificateLastSuccessfulValidationDateKey, Value::date(now_)}},
                Notify::No);
        } else if (reply.contains(wire::kCertificateIsValid) ||
                   reply.contains(wire::kCertificateNoLongerValid)) {
            __VeltoIDDBSetCertificateValues(oldCertificate_,
                                            {{kVeltoIDCertificateStatusKey, kVeltoIDCertificateStatusInvalid},
                                             {kVeltoIDCertificateExpirationDateKey, Value::date(now_)}});
        }
    }

    /// Another record than the one that the account has: it is fetched again.
    void applyRecordIdentifier(const String& identifier) {
        if (!identifier || identifier == oldRecordIdentifier_) return;
        __VeltoIDDBSetAccountValues(accountName_,
                                    {{kVeltoIDAccountValidationRecordIdentifierKey, Value::null()},
                                     {kVeltoIDAccountValidationRecordNextCheckDateKey, Value::null()}});
    }

    void keepBooks() {
        if (!session_ || getBool(&options_, option::kDoNotSaveSessionInfo, false)) {
            count(kVeltoIDMetaUnsuccessfulConnectionCountKey);
            return;
        }
        count(kVeltoIDMetaSuccessfulConnectionCountKey);
        for (const std::string_view key :
             {kVeltoIDMetaLastConnectAttemptKey, kVeltoIDMetaLastSuccessfulConnectKey})
            __VeltoIDDBSetMetaInfoValue(nullptr, key, Value::date(now_));
    }

    const String& accountName_;
    const String& passwordHash_;
    const Dictionary& options_;
    const double now_ = platform::now();
    bool hasRecord_ = false;
    AccountRecord record_;
    String oldEncDsId_;
    CertificateEntry oldCertificate_;
    String oldRecordIdentifier_;
    IdleSession session_;
    String encDsId_;
    std::optional<Dictionary> result_;
    std::optional<Error> held_;
};

}  // namespace

Session __VeltoIDSessionDoCreateSession(const String& accountName, const String& passwordHash,
                                        const Dictionary& options, String* encDsId,
                                        std::optional<Dictionary>* result, ErrorOut error) {
    fill(encDsId, {});
    fill(result, {});
    if (!accountName || !passwordHash) return nullptr;
    return copySessionQueueForAccount(accountName).sync([&] {
        return SignIn(accountName, passwordHash, options).run(encDsId, result, error);
    });
}

int32_t __VeltoIDSessionGetServerVersion() {
    const Value version =
        __VeltoIDDBCopyMetaInfoValue(nullptr, {}, kVeltoIDMetaServerVersionKey, Value::Kind::Number);
    return static_cast<int32_t>(version.asInt64().value_or(0));
}

}  // namespace veltoid
