#include "VeltoIDXMLServerCommunications/Methods.h"

#include <span>

#include "Protocol/RecordKeys.h"
#include "Values/Base64.h"
#include "Values/DateText.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/FindPersonCache.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"

namespace veltoid {
namespace {

/// Fault of a certificate that waits for the user's sign-in.
constexpr int64_t kSignInPendingFault = -4164;

/// What is particular to one method.
struct Method {
    std::string_view shortName;
    /// Empty when successes are not counted.
    std::string_view counter;
};

/// Spoiled for reuse: whatever the server thinks of the session now, nobody else gets it.
void spoil(VeltoIDAuthenticationSessionInfo& session) {
    session.fSessionID = nullptr;
    session.fCreated = 0;
    session.fValidityDuration = 0;
}

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

void count(VeltoIDAuthenticationSessionInfo& session, const Method& method, const Dictionary& options) {
    if (!method.counter.empty())
        __VeltoIDDBIncrementMetaInfoCounter(session.fAccountName, options, method.counter, 1);
}

/// A failed call: hands out the translated error, and nobody else gets the session.
void fail(VeltoIDAuthenticationSessionInfo& session, const Call& call, ErrorOut error) {
    fillError(error, copyAndHandleXMLErrorResponse(session.fAccountName, call.reply, call.error));
    spoil(session);
}

/// The reply, or none and the translated error.
std::optional<Dictionary> call(VeltoIDAuthenticationSessionInfo& session, const Method& method,
                               const Dictionary& own, const Dictionary& options, ErrorOut error) {
    Call made = invoke(session, method, own, options);
    if (!made.isAnswered()) {
        fail(session, made, error);
        return std::nullopt;
    }
    count(session, method, options);
    return std::move(made.reply);
}

/// The same on the session's queue, where nothing of the reply is wanted.
bool callOnQueue(VeltoIDAuthenticationSessionInfo& session, const Method& method, const Dictionary& own,
                 const Dictionary& options, ErrorOut error) {
    return session.fDispatchQueue.sync(
        [&] { return call(session, method, own, options, error).has_value(); });
}

template <typename Output>
void fill(Output* output, Output value) {
    if (output != nullptr) *output = std::move(value);
}

void takeValidationRecord(const Dictionary& reply, Dictionary& result) {
    const Data record = base64Decode(reply.string("VIDVRecord"));
    // Text that is no base64 decodes to nothing.
    if (record.size() == 0) return;
    result.set(kVeltoIDAccountValidationRecordDataKey, record);
    result.set(kVeltoIDAccountValidationRecordIdentifierKey, reply.string("VIDVRecordIdentifier"));
    if (const auto nextCheck = dateFromValue(reply.string("VIDVRecordNextCheckDate")))
        result.set(kVeltoIDAccountValidationRecordNextCheckDateKey, Value::date(*nextCheck));
}

struct ReplyEntry {
    std::string_view replyKey;
    Value::Kind kind;
    std::string_view resultKey;
};

constexpr ReplyEntry kGetMyInfoEntries[] = {
    {"encDsId", Value::Kind::String, kVeltoIDAccountDSIDKey},
    {"lastNm", Value::Kind::String, kVeltoIDAccountLastNameKey},
    {"firstNm", Value::Kind::String, kVeltoIDAccountFirstNameKey},
    {"ValidatedEmail", Value::Kind::Array, kVeltoIDAccountValidatedEmailKey},
    {"ValidatedPhones", Value::Kind::Array, kVeltoIDAccountValidatedPhonesKey},
    {"PrimaryEmail", Value::Kind::String, kVeltoIDAccountPrimaryEmailKey},
    {"VeltoID", Value::Kind::String, kVeltoIDAccountNameKey},
    {"CertificateIsValid", Value::Kind::Boolean, kVeltoIDAccountCertificateIsValidKey},
    {"AllEmails", Value::Kind::Array, "AllEmails"},
    {"ValidForInterval", Value::Kind::Number, kVeltoIDAccountValidForIntervalKey},
};

constexpr ReplyEntry kCertificateEntries[] = {
    {"Certificate", Value::Kind::String, "Certificate"},
    {"CertType", Value::Kind::String, "CertType"},
    {"SerialNumber", Value::Kind::String, kVeltoIDCertificateSerialNumberKey},
    {"CertStatus", Value::Kind::String, kVeltoIDCertificateStatusKey},
    {"IntermediateCert", Value::Kind::String, "IntermediateCertificate"},
};

void takeEntries(const Dictionary& reply, std::span<const ReplyEntry> entries, Dictionary& result) {
    for (const ReplyEntry& entry : entries)
        if (const Value& value = reply[entry.replyKey]; value.kind() == entry.kind)
            result.set(entry.resultKey, value);
}

Dictionary getMyInfoResult(const Dictionary& reply) {
    Dictionary result;
    takeValidationRecord(reply, result);
    takeEntries(reply, kGetMyInfoEntries, result);
    return result;
}

std::optional<Dictionary> copyCertificateResultFromDsCert(const Dictionary* dsCert) {
    if (dsCert == nullptr) return std::nullopt;
    Dictionary result;
    takeEntries(*dsCert, kCertificateEntries, result);
    if (const auto expires = dateFromValue((*dsCert)["Expires"]))
        result.set(kVeltoIDCertificateExpirationDateKey, Value::date(*expires));
    return result.empty() ? std::nullopt : std::optional(result);
}

Value delayOf(const Dictionary& reply) {
    const Value& delay = reply["Delay"];
    return delay.isNumber() ? delay : Value();
}

/// Some servers answer with a list of certificates, the wanted one first.
const Dictionary* dsCertOf(const Dictionary& reply) {
    const Value& dsCert = reply["dsCert"];
    const Array* list = dsCert.asArray();
    if (list != nullptr) return list->empty() ? nullptr : (*list)[0].asDictionary();
    return dsCert.asDictionary();
}

/// The lifetime to ask for; a Number that is none as a double counts as 0.
double requestedLifetime(const String& accountName, const Dictionary& options) {
    const Value lifetime = __VeltoIDDBCopyMetaInfoValue(
        accountName, options, "VeltoIDMetaDefaultCertificateRequestedLifetime", Value::Kind::Number);
    return lifetime.isNumber() ? lifetime.asDouble().value_or(0) : kVeltoIDRequestedCertificateLifetime;
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
    return {{"machineUUID", __VeltoIDDBCopyAccountValue(accountName, kVeltoIDAccountUUIDKey)},
            {"breadcrumbKey", key}};
}

String serialNumberOf(const String& encDsId) {
    Dictionary entry;
    if (!__VeltoIDDBCopyCertificateInfo(encDsId, &entry)) return nullptr;
    return entry.string(kVeltoIDCertificateSerialNumberKey);
}

}  // namespace

bool _VeltoIDSessionDoGetMyInfo(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                                const Dictionary& parameters, const Dictionary& options, Dictionary* result,
                                ErrorOut error) {
    return session.fDispatchQueue.sync([&] {
        const String certificateSerial = serialNumberOf(encDsId);
        const Dictionary own = {
            {"encDsId", encDsId ? encDsId : session.fEncDsId},
            {"CertificateSerialNumber",
             certificateSerial ? certificateSerial : parameters.string(kVeltoIDCertificateSerialNumberKey)},
            {"ClientVIDVRecordIdentifier", parameters.string(kVeltoIDAccountValidationRecordIdentifierKey)},
        };
        const auto reply = call(session, {"getMyInfo", kVeltoIDXMLGetMyInfoCountKey}, own, options, error);
        if (!reply) return false;
        if (!session.fEncDsId) session.fEncDsId = reply->string("encDsId");
        if (result != nullptr) *result = getMyInfoResult(*reply);
        return true;
    });
}

bool __VeltoIDSessionDoFindPerson(VeltoIDAuthenticationSessionInfo& session, const Dictionary& criteria,
                                  const Dictionary& options, std::optional<Array>* matches, ErrorOut error) {
    return session.fDispatchQueue.sync([&] {
        const auto reply = call(session, {"findPerson", kVeltoIDXMLFindPersonCountKey},
                                {{"searchCriteria", criteria}}, options, error);
        if (!reply) return false;
        const Array* found = reply->array("matches");
        if (found != nullptr) __VeltoIDDBAddFindPersonResultsToCache(*found);
        fill(matches, found != nullptr ? std::optional(*found) : std::nullopt);
        return true;
    });
}

bool __VeltoIDSessionDoSendCSR(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                               const String& request, const Dictionary& options, String* token,
                               CertificateAnswer* answer, ErrorOut error) {
    return session.fDispatchQueue.sync([&] {
        const Dictionary own = {
            {"__CERT_FETCH_DELAY_MIN", options.string("__CERT_FETCH_DELAY_MIN")},
            {"__CERT_FETCH_DELAY_MAX", options.string("__CERT_FETCH_DELAY_MAX")},
            {"CSR", request},
            {"encDsId", encDsId},
            {"RequestedCertificateLifetimeInSeconds",
             Value::real(requestedLifetime(session.fAccountName, options))},
        };
        const auto reply = call(session, {"createCert", kVeltoIDXMLSendCSRCountKey}, own, options, error);
        if (!reply) return false;
        fill(token, reply->string("CertificateToken"));
        fill(answer, {copyCertificateResultFromDsCert(reply->dictionary("dsCert")), delayOf(*reply)});
        return true;
    });
}

bool __VeltoIDSessionDoFetchCSRResult(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                                      const String& token, const Dictionary& options,
                                      CertificateAnswer* answer, ErrorOut error) {
    constexpr Method kMethod{"fetchCert", kVeltoIDXMLFetchCertCountKey};
    return session.fDispatchQueue.sync([&] {
        const Call made =
            invoke(session, kMethod, {{"CertificateToken", token}, {"encDsId", encDsId}}, options);
        if (made.isAnswered()) {
            fill(answer, {copyCertificateResultFromDsCert(dsCertOf(*made.reply)), delayOf(*made.reply)});
        } else if (isPending(made)) {
            fill(answer, pendingAnswer(made, token));
        } else {
            fail(session, made, error);
            return false;
        }
        count(session, kMethod, options);
        return true;
    });
}

bool __VeltoIDSessionDoCompleteCertificate(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                                           const String& token, const Dictionary& options, ErrorOut error) {
    return callOnQueue(session, {"downloadCertComplete", kVeltoIDXMLCompleteCertCountKey},
                       {{"CertificateToken", token}, {"encDsId", encDsId}}, options, error);
}

bool __VeltoIDSessionDoFetchCertificateBySerialNumber(VeltoIDAuthenticationSessionInfo& session,
                                                      const String& serialNumber, const Dictionary& options,
                                                      String* certificate, ErrorOut error) {
    return session.fDispatchQueue.sync([&] {
        const auto reply = call(session, {"fetchCert", kVeltoIDXMLFetchCertCountKey},
                                {{"certSerialNumber", serialNumber}}, options, error);
        if (!reply) return false;
        fill(certificate, reply->string("Certificate"));
        return true;
    });
}

bool __VeltoIDSessionDoRevokeCertificate(VeltoIDAuthenticationSessionInfo& session,
                                         const String& serialNumber, const Dictionary& options,
                                         ErrorOut error) {
    return callOnQueue(session, {"revokeCert", {}}, {{"SerialNumber", serialNumber}}, options, error);
}

Data __VeltoIDSessionDoCopyBreadcrumb(VeltoIDAuthenticationSessionInfo& session, const String& key,
                                      const Dictionary& options, ErrorOut error) {
    return session.fDispatchQueue.sync([&]() -> Data {
        const Call made = invoke(session, {"fetchBreadcrumbEk", {}},
                                 breadcrumbParameters(session.fAccountName, key), options);
        if (!made.succeeded) {
            fail(session, made, error);
            return {};
        }
        const Data data = made.reply ? base64Decode(made.reply->string("ek")) : Data();
        // Text that is no base64 decodes to nothing.
        return data.size() > 0 ? data : Data();
    });
}

bool __VeltoIDSessionDoSetBreadcrumb(VeltoIDAuthenticationSessionInfo& session, const String& key,
                                     const Data& data, const Dictionary& options, ErrorOut error) {
    Dictionary own = breadcrumbParameters(session.fAccountName, key);
    own.set("ek", base64Encode(data));
    return callOnQueue(session, {"saveBreadcrumbEk", {}}, own, options, error);
}

}  // namespace veltoid
