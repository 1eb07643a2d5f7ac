#include "VeltoIDAuthenticationImpl/AccountInformation.h"

#include <algorithm>
#include <cmath>

#include "Certificates/ValidationRecord.h"
#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/bus/Notifications.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/Names.h"
#include "Values/DateText.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/RecordKeys.h"
#include "VeltoIDAuthenticationImpl/ServerErrorHandling.h"
#include "VeltoIDXMLServerCommunications/Methods.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

/// Share of a validation record's suggested duration after which it is looked at again.
constexpr double kRecordCheckShare = 0.75;

double now() { return platform::Clock::shared().now(); }

std::optional<double> finiteNumber(const Dictionary& dictionary, std::string_view key) {
    const auto number = dictionary.number(key);
    return number && std::isfinite(*number) ? number : std::nullopt;
}

/// One request for an account's information.
class InformationRequest {
  public:
    InformationRequest(const String& requestedName, const Dictionary& options) : options_(options) {
        known_ = copyRecord(requestedName);
        name_ = known_ ? record_.string(kVeltoIDAccountNameKey) : requestedName;
        if (!name_) name_ = requestedName;
        encDsId_ = record_.string(kVeltoIDAccountDSIDKey);
    }

    bool run() {
        const bool fresh = isFresh();
        if (option("SkipValidation")) return fresh && isComplete();
        if (option("DeferValidation")) {
            if (!isComplete()) return false;
            markForValidation();
            return true;
        }
        const bool mustAsk = option("ForceValidationRecordFetch") ||
                             option("ValidateCertificateSerialNumber") || option("ForceValidation");
        if (mustAsk || !fresh || !isComplete()) return askServer(fresh);
        return true;
    }

    Dictionary answer() const {
        Dictionary entry;
        if (encDsId_) __VeltoIDDBCopyCertificateInfo(encDsId_, &entry);
        Dictionary info;
        info.set("VeltoID", name_);
        info.set("encDsId", encDsId_);
        for (const std::string_view key : {kVeltoIDAccountFirstNameKey, kVeltoIDAccountLastNameKey})
            info.set(key, record_.string(key));
        if (const Array* all = record_.array(kVeltoIDAccountEmailAddressesKey)) info.set("AllEmails", *all);
        for (const std::string_view key :
             {kVeltoIDAccountValidatedEmailKey, kVeltoIDAccountValidatedPhonesKey})
            if (const Array* items = record_.array(key)) info.set(key, *items);
        if (const auto date = record_.date(kVeltoIDAccountLastValidationDateKey))
            info.set(kVeltoIDAccountLastValidationDateKey, Value::date(*date));
        info.set("CertificatePEM", entry["CertificatePEM"]);
        info.set("CertificateExpiration", entry[kVeltoIDCertificateExpirationDateKey]);
        info.set("SerialNumber", entry[kVeltoIDCertificateSerialNumberKey]);
        info.set("CertificateDate", entry["Date"]);
        return info;
    }

    const String& name() const { return name_; }
    const std::optional<Error>& error() const { return held_; }

  private:
    bool option(std::string_view key) const { return getBool(&options_, key, false); }

    bool copyRecord(const String& requestedName) {
        if (requestedName) return __VeltoIDDBCopyVeltoIDAccount(requestedName, &record_, &held_);
        auto first = __VeltoIDDBCopyFirstVeltoIDAccount(true, false);
        if (first) record_ = std::move(*first);
        return first.has_value();
    }

    bool isFresh() const {
        const Value stored = __VeltoIDDBCopyMetaInfoValue(
            name_, options_, kVeltoIDMetaAccountPresumedValidIntervalKey, Value::Kind::Number);
        const double presumed = stored.asDouble().value_or(kVeltoIDPresumedValidInterval);
        double valid = presumed;
        if (const auto own = record_.number(kVeltoIDAccountValidForIntervalKey))
            valid = std::min(std::max(*own, kVeltoIDLeastValidInterval), presumed);
        const auto validated = record_.date(kVeltoIDAccountLastValidationDateKey);
        return validated && *validated <= now() && now() <= *validated + valid;
    }

    bool isComplete() const {
        return record_.contains(kVeltoIDAccountNameKey) && record_.contains(kVeltoIDAccountDSIDKey) &&
               (record_.contains(kVeltoIDAccountValidatedEmailKey) ||
                record_.contains(kVeltoIDAccountValidatedPhonesKey));
    }

    /// The next account check validates the account.
    void markForValidation() const {
        __VeltoIDDBSetAccountValue(name_, kVeltoIDAccountForceValidationKey, Value::boolean(true), true);
        if (!record_.contains(kVeltoIDAccountNextValidationDateKey))
            __VeltoIDDBSetAccountValue(name_, kVeltoIDAccountNextValidationDateKey, Value::date(now()), true);
    }

    bool askServer(bool fresh) {
        std::optional<Error> sessionError;
        encDsId_ = nullptr;
        Session session = __VeltoIDSessionDoCreateSession(name_, __VeltoIDDBCopyHashedPassword(record_),
                                                          options_, &encDsId_, nullptr, &sessionError);
        if (!session) {
            if (sessionError) held_ = sessionError;
            if (known_ && !fresh) markForValidation();
            return known_;
        }
        const bool answered = fetch(*session);
        __VeltoIDSessionRelease(std::move(session));
        return answered;
    }

    bool fetch(VeltoIDAuthenticationSessionInfo& session) {
        Dictionary result;
        std::optional<Error> fetchError;
        if (_VeltoIDSessionDoGetMyInfo(session, encDsId_, fetchParameters(), options_, &result,
                                       &fetchError)) {
            updateAccountWithGetMyInfoResult(name_, result);
            return __VeltoIDDBCopyVeltoIDAccount(name_, &record_, &held_);
        }
        held_ = fetchError;
        return known_ && __VeltoIDDBCopyVeltoIDAccount(name_, &record_);
    }

    /// What the agent has already; an empty identifier makes the server send its record.
    Dictionary fetchParameters() const {
        Dictionary entry;
        if (encDsId_) __VeltoIDDBCopyCertificateInfo(encDsId_, &entry);
        String identifier = record_.string(kVeltoIDAccountValidationRecordIdentifierKey);
        const bool hasRecordData = record_.data(kVeltoIDAccountValidationRecordDataKey).size() > 0;
        if (option("ForceValidationRecordFetch") || !identifier || !hasRecordData) identifier = "";
        return {{kVeltoIDCertificateSerialNumberKey, entry.string(kVeltoIDCertificateSerialNumberKey)},
                {kVeltoIDAccountValidationRecordIdentifierKey, identifier}};
    }

    const Dictionary& options_;
    Dictionary record_;
    bool known_ = false;
    String name_;
    String encDsId_;
    std::optional<Error> held_;
};

/// The server's last word on the certificate goes into the certificate entry.
void applyCertificateValidity(const String& accountName, const Dictionary& answer) {
    const Value& isValid = answer[kVeltoIDAccountCertificateIsValidKey];
    if (isValid.isAbsent()) return;
    const String encDsId = answer.string(kVeltoIDAccountDSIDKey);
    if (isValid.asBoolean().value_or(false)) {
        __VeltoIDDBSetCertificateValue(encDsId, kVeltoIDCertificateLastSuccessfulValidationDateKey,
                                       Value::date(now()), true);
        return;
    }
    VELTOID_LOG_FROM("updateAccountWithGetMyInfoResult", kNotice,
                     "Marking certificate for Velto ID "
                         << accountName.view() << " dsID=" << describeValue(encDsId)
                         << "as invalid because the server said CertificateIsValid = false. ("
                         << describeValue(isValid));
    __VeltoIDDBSetCertificateValue(encDsId, kVeltoIDCertificateStatusKey, kVeltoIDCertificateStatusInvalid,
                                   true);
    __VeltoIDDBSetCertificateValue(encDsId, kVeltoIDCertificateExpirationDateKey, Value::date(now()), true);
}

bool bothPresentAndDifferent(const Value& before, const Value& after) {
    return !before.isAbsent() && !after.isAbsent() && before != after;
}

/// What the signed record says of itself goes into the values; the date at which to look at it again, if it
/// tells one.
std::optional<double> applyPayload(const Data& signedRecord, Dictionary& values) {
    const Data content = verifyValidationRecord(signedRecord);
    const auto payload = content ? parseValidationRecordPayload(content) : std::nullopt;
    if (!payload) return std::nullopt;
    const auto validAsOf = dateFromValue((*payload)["ValidAsOf"]);
    const auto duration = finiteNumber(*payload, "SuggestValidDuration");
    values.set(kVeltoIDAccountValidationRecordValidAsOfKey, validAsOf ? Value::date(*validAsOf) : Value());
    values.set(kVeltoIDAccountValidationRecordSuggestedValidIntervalKey,
               duration ? Value::real(*duration) : Value());
    if (!validAsOf) return std::nullopt;
    return *validAsOf + kRecordCheckShare * duration.value_or(0);
}

/// Record data is kept only with an identifier and a date at which it is looked at again, from the server or
/// from the record itself; otherwise the stored one goes. True when the account has another record than
/// before.
bool applyValidationRecord(const Dictionary& before, const Dictionary& answer, Dictionary& values) {
    const String identifier = answer.string(kVeltoIDAccountValidationRecordIdentifierKey);
    const Data data = answer.data(kVeltoIDAccountValidationRecordDataKey);
    auto nextCheck = answer.date(kVeltoIDAccountValidationRecordNextCheckDateKey);
    for (const std::string_view key :
         {kVeltoIDAccountValidationRecordIdentifierKey, kVeltoIDAccountValidationRecordDataKey,
          kVeltoIDAccountValidationRecordNextCheckDateKey})
        values.set(key, Value::null());
    if (identifier && data) {
        const auto suggested = applyPayload(data, values);
        if (!nextCheck) nextCheck = suggested;
        if (nextCheck) {
            values.set(kVeltoIDAccountValidationRecordIdentifierKey, identifier);
            values.set(kVeltoIDAccountValidationRecordDataKey, data);
            values.set(kVeltoIDAccountValidationRecordNextCheckDateKey, Value::date(*nextCheck));
        }
    }
    return bothPresentAndDifferent(before.string(kVeltoIDAccountValidationRecordIdentifierKey), identifier);
}

bool visibleDetailsChanged(const Dictionary& before, const Dictionary& values) {
    constexpr std::string_view kVisibleKeys[] = {
        kVeltoIDAccountFirstNameKey, kVeltoIDAccountLastNameKey, kVeltoIDAccountEmailAddressesKey,
        kVeltoIDAccountValidatedEmailKey, kVeltoIDAccountValidatedPhonesKey};
    return std::any_of(std::begin(kVisibleKeys), std::end(kVisibleKeys), [&](std::string_view key) {
        return bothPresentAndDifferent(before[key], values[key]);
    });
}

}  // namespace

bool __VeltoIDDoGetMyInfo(const String& accountName, const Dictionary& options, Dictionary* result,
                          ErrorOut error) {
    InformationRequest request(accountName, options);
    if (request.run()) {
        if (result != nullptr) *result = request.answer();
        return true;
    }
    handleServerError(request.name(), request.error());
    fillError(error, request.error() ? *request.error() : VELTOID_ERROR(identity_error::kUnknown));
    return false;
}

void updateAccountWithGetMyInfoResult(const String& accountName, const Dictionary& answer) {
    Dictionary before;
    const bool existed = __VeltoIDDBCopyVeltoIDAccount(accountName, &before);
    Dictionary values = answer;
    values.set(kVeltoIDAccountLastValidationDateKey, Value::date(now()));
    // Records keep the list of all addresses under their own name for it.
    values.set(kVeltoIDAccountEmailAddressesKey, answer["AllEmails"]);
    values.remove("AllEmails");
    applyCertificateValidity(accountName, answer);

    bool notify = false;
    if (answer.contains(kVeltoIDAccountValidationRecordDataKey))
        notify = applyValidationRecord(before, answer, values);
    notify = notify || !existed || visibleDetailsChanged(before, values);

    values.set(kVeltoIDAccountForceValidationKey, Value::null());
    values.set(kVeltoIDAccountNextValidationDateKey, Value::null());
    __VeltoIDDBSetAccountValues(accountName, values, true);
    if (notify) platform::Notifications::shared().post(kVeltoIDAccountChangeNotification);
}

bool __VeltoIDCopyVeltoIDs(const Dictionary& /*options*/, Array* names, ErrorOut error) {
    std::optional<Error> databaseError;
    Array all;
    if (!__VeltoIDDBCopyVeltoIDs(&all, &databaseError) && databaseError &&
        databaseError->code != identity_error::kNoAccounts) {
        fillError(error, databaseError);
        return false;
    }
    if (names != nullptr) *names = std::move(all);
    return true;
}

}  // namespace veltoid
