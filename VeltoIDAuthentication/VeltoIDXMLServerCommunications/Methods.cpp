#include "VeltoIDXMLServerCommunications/Methods.h"

#include "Protocol/MessageKeys.h"
#include "Protocol/OptionKeys.h"
#include "Protocol/RecordKeys.h"
#include "Values/Base64.h"
#include "Values/DateText.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/FindPersonCache.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"
#include "VeltoIDXMLServerCommunications/WireKeys.h"

namespace veltoid {
namespace {

/// Fault of a certificate that waits for the user's sign-in.
constexpr int64_t kSignInPendingFault = -4164;

/// What is particular to one method.
struct Method {
    std::string_view shortName;
    /// Empty when successes are not counted.
    std::string_view counter;
    /// As people call it; empty for what is no attempt at anything.
    std::string_view purpose;
};

struct Call {
    bool succeeded = false;
    /// None when the answer was no Dictionary.
    std::optional<Dictionary> reply;
    std::optional<Error> error;

    bool isAnswered() const { return succeeded && reply; }
};

/// Calls the method with the common parameters and its own.
Call invoke(VeltoIDAuthenticationSessionInfo& session, const Method& method, const Dictionary& own,
            const Dictionary& options) {
    Dictionary parameters = createCallParameters(session.fAccountName, session.fSessionID, options);
    for (const auto& [key, value] : own) parameters.set(key, value);
    Call call;
    const String name = std::string(kVeltoIDMethodPrefix).append(method.shortName);
    call.succeeded = xmlInvoke(session, name, parameters, &call.reply, &call.error);
    return call;
}

void noteSuccess(VeltoIDAuthenticationSessionInfo& session, const Method& method, const Dictionary& options) {
    if (!method.counter.empty())
        __VeltoIDDBIncrementMetaInfoCounter(session.fAccountName, options, method.counter, 1);
    if (!method.purpose.empty()) noteAttempt(session.fAccountName, method.purpose, kAttemptSucceeded);
}

/// A failed call: hands out the translated error; the session is not used for anything else. False.
bool fail(VeltoIDAuthenticationSessionInfo& session, const Method& method, const Call& call, ErrorOut error) {
    const Error held =
        copyAndHandleXMLErrorResponse(session.fAccountName, session.fPasswordHash, call.reply, call.error);
    if (!method.purpose.empty()) noteAttempt(session.fAccountName, method.purpose, held);
    session.spoil();
    return failWith(error, held);
}

/// One call; `take` gets the reply.
template <typename Take>
bool call(VeltoIDAuthenticationSessionInfo& session, const Method& method, const Dictionary& own,
          const Dictionary& options, ErrorOut error, Take take) {
    const Call made = invoke(session, method, own, options);
    if (!made.isAnswered()) return fail(session, method, made, error);
    noteSuccess(session, method, options);
    take(*made.reply);
    return true;
}

/// The same on the session's queue.
template <typename Take = void (*)(const Dictionary&)>
bool callOnQueue(
    VeltoIDAuthenticationSessionInfo& session, const Method& method, const Dictionary& own,
    const Dictionary& options, ErrorOut error, Take take = [](const Dictionary&) {}) {
    return session.fDispatchQueue.sync([&] { return call(session, method, own, options, error, take); });
}

void takeValidationRecord(const Dictionary& reply, Dictionary& result) {
    const Data record = base64Decode(reply.string(wire::kValidationRecord));
    // Text that is no base64 decodes to nothing.
    if (record.size() == 0) return;
    result.set(kVeltoIDAccountValidationRecordDataKey, record);
    result.set(kVeltoIDAccountValidationRecordIdentifierKey, reply.string(wire::kValidationRecordIdentifier));
    if (const auto nextCheck = dateFromValue(reply.string(wire::kValidationRecordNextCheck)))
        result.set(kVeltoIDAccountValidationRecordNextCheckDateKey, Value::date(*nextCheck));
}

constexpr TakenEntry kGetMyInfoEntries[] = {
    {wire::kEncDsId, Value::Kind::String, kVeltoIDAccountDSIDKey},
    {wire::kLastName, Value::Kind::String, kVeltoIDAccountLastNameKey},
    {wire::kFirstName, Value::Kind::String, kVeltoIDAccountFirstNameKey},
    {wire::kValidatedEmail, Value::Kind::Array, kVeltoIDAccountValidatedEmailKey},
    {wire::kValidatedPhones, Value::Kind::Array, kVeltoIDAccountValidatedPhonesKey},
    {wire::kPrimaryEmail, Value::Kind::String, kVeltoIDAccountPrimaryEmailKey},
    {wire::kAccountName, Value::Kind::String, kVeltoIDAccountNameKey},
    {wire::kCertificateIsValid, Value::Kind::Boolean, kVeltoIDAccountCertificateIsValidKey},
    {wire::kAllEmails, Value::Kind::Array, message::kAllEmails},
    {wire::kValidForInterval, Value::Kind::Number, kVeltoIDAccountValidForIntervalKey},
};

constexpr TakenEntry kCertificateEntries[] = {
    {wire::kCertificate, Value::Kind::String, kVeltoIDCertificateCertificateKey},
    {wire::kCertificateType, Value::Kind::String, kVeltoIDCertificateTypeKey},
    {wire::kSerialNumber, Value::Kind::String, kVeltoIDCertificateSerialNumberKey},
    {wire::kCertificateStatus, Value::Kind::String, kVeltoIDCertificateStatusKey},
    {wire::kIntermediateCertificate, Value::Kind::String, kVeltoIDCertificateIntermediateCertificateKey},
};

Dictionary getMyInfoResult(const Dictionary& reply) {
    Dictionary result;
    takeValidationRecord(reply, result);
    takeEntries(reply, kGetMyInfoEntries, result);
    return result;
}

Value delayOf(const Dictionary& reply) {
    const Value& delay = reply[wire::kDelay];
    return delay.isNumber() ? delay : Value();
}

std::optional<Dictionary> copyCertificateResultFromDsCert(const Dictionary* dsCert) {
    if (dsCert == nullptr) return std::nullopt;
    Dictionary result;
    takeEntries(*dsCert, kCertificateEntries, result);
    if (const auto expires = dateFromValue((*dsCert)[wire::kCertificateExpiration]))
        result.set(kVeltoIDCertificateExpirationDateKey, Value::date(*expires));
    return result.empty() ? std::nullopt : std::optional(result);
}

/// Some servers answer with a list of certificates, the wanted one first.
const Dictionary* dsCertOf(const Dictionary& reply) {
    const Value& dsCert = reply[wire::kCertificateEntry];
    const Array* list = dsCert.asArray();
    if (list != nullptr) return list->empty() ? nullptr : (*list)[0].asDictionary();
    return dsCert.asDictionary();
}

bool isPending(const Call& call) {
    return call.error && call.error->domain == kXMLErrorDomain && call.error->code == kSignInPendingFault;
}

CertificateAnswer pendingAnswer(const Call& call, const String& token) {
    const Value delay = call.reply ? delayOf(*call.reply) : Value();
    return {Dictionary{{kVeltoIDAccountCertificateTokenKey, token},
                       {kVeltoIDCertificateStatusKey, kVeltoIDCertificateStatusPending}},
            delay.isAbsent() ? Value::int64(kVeltoIDPendingCertificateDelay) : delay};
}

/// The parameters that say whose breadcrumb it is.
Dictionary breadcrumbParameters(const String& accountName, const String& key) {
    return {{wire::kMachineUUID, __VeltoIDDBCopyAccountValue(accountName, kVeltoIDAccountUUIDKey)},
            {wire::kBreadcrumbKey, key}};
}

}  // namespace

bool _VeltoIDSessionDoGetMyInfo(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                                const Dictionary& parameters, const Dictionary& options, Dictionary* result,
                                ErrorOut error) {
    return session.fDispatchQueue.sync([&] {
        const String stored = certificateEntryOf(encDsId).serialNumber();
        const Dictionary own = {
            {wire::kEncDsId, encDsId ? encDsId : session.fEncDsId},
            {wire::kKnownSerialNumber,
             stored ? stored : parameters.string(kVeltoIDCertificateSerialNumberKey)},
            {wire::kKnownRecordIdentifier, parameters.string(kVeltoIDAccountValidationRecordIdentifierKey)},
        };
        return call(session, {"getMyInfo", kVeltoIDXMLGetMyInfoCountKey, "account information"}, own, options,
                    error, [&](const Dictionary& reply) {
                        if (!session.fEncDsId) session.fEncDsId = reply.string(wire::kEncDsId);
                        fill(result, getMyInfoResult(reply));
                    });
    });
}

bool __VeltoIDSessionDoFindPerson(VeltoIDAuthenticationSessionInfo& session, const Dictionary& criteria,
                                  const Dictionary& options, std::optional<Array>* matches, ErrorOut error) {
    return callOnQueue(session, {"findPerson", kVeltoIDXMLFindPersonCountKey, "finding people"},
                       {{wire::kSearchCriteria, criteria}}, options, error, [&](const Dictionary& reply) {
                           const Array* found = reply.array(wire::kMatches);
                           if (found != nullptr) __VeltoIDDBAddFindPersonResultsToCache(*found);
                           fill(matches, found != nullptr ? std::optional(*found) : std::nullopt);
                       });
}

bool __VeltoIDSessionDoSendCSR(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                               const String& request, const Dictionary& options, String* token,
                               CertificateAnswer* answer, ErrorOut error) {
    return session.fDispatchQueue.sync([&] {
        const Dictionary own = {
            {wire::kFetchDelayMinimum, options.string(option::kFetchDelayMinimum)},
            {wire::kFetchDelayMaximum, options.string(option::kFetchDelayMaximum)},
            {wire::kRequest, request},
            {wire::kEncDsId, encDsId},
            {wire::kRequestedLifetime,
             Value::real(metaInterval(session.fAccountName, options, kVeltoIDMetaCertificateLifetimeKey,
                                      kVeltoIDRequestedCertificateLifetime))},
        };
        return call(session, {"createCert", kVeltoIDXMLSendCSRCountKey, "certificate request"}, own, options,
                    error, [&](const Dictionary& reply) {
                        fill(token, reply.string(wire::kCertificateToken));
                        fill(answer,
                             {copyCertificateResultFromDsCert(reply.dictionary(wire::kCertificateEntry)),
                              delayOf(reply)});
                    });
    });
}

bool __VeltoIDSessionDoFetchCSRResult(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                                      const String& token, const Dictionary& options,
                                      CertificateAnswer* answer, ErrorOut error) {
    constexpr Method kMethod{"fetchCert", kVeltoIDXMLFetchCertCountKey, "certificate"};
    return session.fDispatchQueue.sync([&] {
        const Call made =
            invoke(session, kMethod, {{wire::kCertificateToken, token}, {wire::kEncDsId, encDsId}}, options);
        if (made.isAnswered()) {
            fill(answer, {copyCertificateResultFromDsCert(dsCertOf(*made.reply)), delayOf(*made.reply)});
        } else if (isPending(made)) {
            fill(answer, pendingAnswer(made, token));
        } else {
            return fail(session, kMethod, made, error);
        }
        noteSuccess(session, kMethod, options);
        return true;
    });
}

bool __VeltoIDSessionDoCompleteCertificate(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                                           const String& token, const Dictionary& options, ErrorOut error) {
    return callOnQueue(session, {"downloadCertComplete", kVeltoIDXMLCompleteCertCountKey, {}},
                       {{wire::kCertificateToken, token}, {wire::kEncDsId, encDsId}}, options, error);
}

bool __VeltoIDSessionDoFetchCertificateBySerialNumber(VeltoIDAuthenticationSessionInfo& session,
                                                      const String& serialNumber, const Dictionary& options,
                                                      String* certificate, ErrorOut error) {
    return callOnQueue(session, {"fetchCert", kVeltoIDXMLFetchCertCountKey, "certificate"},
                       {{wire::kFetchedSerialNumber, serialNumber}}, options, error,
                       [&](const Dictionary& reply) { fill(certificate, reply.string(wire::kCertificate)); });
}

bool __VeltoIDSessionDoRevokeCertificate(VeltoIDAuthenticationSessionInfo& session,
                                         const String& serialNumber, const Dictionary& options,
                                         ErrorOut error) {
    return callOnQueue(session, {"revokeCert", {}, "revocation"}, {{wire::kSerialNumber, serialNumber}},
                       options, error);
}

Data __VeltoIDSessionDoCopyBreadcrumb(VeltoIDAuthenticationSessionInfo& session, const String& key,
                                      const Dictionary& options, ErrorOut error) {
    constexpr Method kMethod{"fetchBreadcrumbEk", {}, "breadcrumb"};
    return session.fDispatchQueue.sync([&]() -> Data {
        const Call made = invoke(session, kMethod, breadcrumbParameters(session.fAccountName, key), options);
        if (!made.succeeded) {
            fail(session, kMethod, made, error);
            return {};
        }
        noteSuccess(session, kMethod, options);
        const Data data = made.reply ? base64Decode(made.reply->string(wire::kBreadcrumb)) : Data();
        // Text that is no base64 decodes to nothing.
        return data.size() > 0 ? data : Data();
    });
}

bool __VeltoIDSessionDoSetBreadcrumb(VeltoIDAuthenticationSessionInfo& session, const String& key,
                                     const Data& data, const Dictionary& options, ErrorOut error) {
    Dictionary own = breadcrumbParameters(session.fAccountName, key);
    own.set(wire::kBreadcrumb, base64Encode(data));
    return callOnQueue(session, {"saveBreadcrumbEk", {}, "breadcrumb"}, own, options, error);
}

}  // namespace veltoid
