#include "VeltoIDXMLServerCommunications/Methods.h"

#include "Values/Base64.h"
#include "Values/DateText.h"
#include "VeltoIDAuthenticationDB/Certificates.h"
#include "VeltoIDAuthenticationDB/Keys.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"

namespace veltoid {
namespace {

/// What is particular to one method.
struct Method {
    std::string_view shortName;
    std::string_view counter;
};

/// Spoiled for reuse: whatever the server thinks of the session now, nobody else gets it.
void spoil(VeltoIDAuthenticationSessionInfo& session) {
    session.fSessionID = nullptr;
    session.fCreated = 0;
    session.fValidityDuration = 0;
}

/// Calls the method with the common parameters and its own; the reply, or none and the translated error.
std::optional<Dictionary> call(VeltoIDAuthenticationSessionInfo& session, const Method& method,
                               const Dictionary& own, const Dictionary& options, ErrorOut error) {
    Dictionary parameters = createCallParameters(session.fAccountName, session.fSessionID, options);
    for (const auto& [key, value] : own) parameters.set(key, value);

    std::optional<Dictionary> reply;
    std::optional<Error> callError;
    const String name = std::string(kVeltoIDMethodPrefix).append(method.shortName);
    if (xmlInvoke(session, name, parameters, &reply, &callError) && reply) {
        __VeltoIDDBIncrementMetaInfoCounter(session.fAccountName, options, method.counter, 1);
        return reply;
    }
    fillError(error, copyAndHandleXMLErrorResponse(session.fAccountName, reply, callError));
    spoil(session);
    return std::nullopt;
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

Dictionary getMyInfoResult(const Dictionary& reply) {
    Dictionary result;
    takeValidationRecord(reply, result);
    for (const ReplyEntry& entry : kGetMyInfoEntries)
        if (const Value& value = reply[entry.replyKey]; value.kind() == entry.kind)
            result.set(entry.resultKey, value);
    return result;
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

}  // namespace veltoid
