#include "VeltoIDAuthenticationImpl/AccountInformation.h"

#include <algorithm>
#include <cmath>

#include "Certificates/ValidationRecord.h"
#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/bus/Notifications.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/Names.h"
#include "Protocol/OptionKeys.h"
#include "Protocol/RecordKeys.h"
#include "Values/DateText.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationImpl/AccountBackOff.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainItems.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"
#include "VeltoIDXMLServerCommunications/Methods.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

/// Share of a validation record's suggested duration after which it is looked at again.
constexpr double kRecordCheckShare = 0.75;

// Keys of the signed record.
constexpr std::string_view kValidAsOfKey = "ValidAsOf";
constexpr std::string_view kSuggestedDurationKey = "SuggestValidDuration";

/// Of the record, in an account's information.
constexpr TakenEntry kRecordEntries[] = {
    {kVeltoIDAccountFirstNameKey, Value::Kind::String},
    {kVeltoIDAccountLastNameKey, Value::Kind::String},
    {kVeltoIDAccountEmailAddressesKey, Value::Kind::Array, message::kAllEmails},
    {kVeltoIDAccountValidatedEmailKey, Value::Kind::Array},
    {kVeltoIDAccountValidatedPhonesKey, Value::Kind::Array},
    {kVeltoIDAccountLastValidationDateKey, Value::Kind::Date},
};

std::optional<double> finiteNumber(const Dictionary& dictionary, std::string_view key) {
    const auto number = dictionary.number(key);
    return number && std::isfinite(*number) ? number : std::nullopt;
}

/// One request for an account's information.
class InformationRequest {
  public:
    InformationRequest(const String& requestedName, const Dictionary& options) : options_(options) {
        known_ = copyRecord(requestedName);
        name_ = known_ ? record_.accountName() : requestedName;
        encDsId_ = record_.encDsId();
    }

    bool run() {
        const bool fresh = isFresh();
        if (isOn(option::kSkipValidation)) return fresh && record_.isComplete();
        if (isOn(option::kDeferValidation)) {
            if (!record_.isComplete()) return false;
            markForValidation();
            noteNews(name_);
            return true;
        }
        const bool mustAsk = isOn(option::kForceValidationRecordFetch) ||
                             isOn(option::kValidateCertificateSerialNumber) || isOn(option::kForceValidation);
        return (!mustAsk && fresh && record_.isComplete()) || askServer(fresh);
    }

    Dictionary answer() const {
        Dictionary info = {{message::kAccount, name_}, {message::kEncDsId, encDsId_}};
        takeEntries(record_.values(), kRecordEntries, info);
        const Dictionary entry = certificateEntryOf(encDsId_).values();
        info.set(message::kCertificatePEM, entry[kVeltoIDCertificatePEMKey]);
        info.set(message::kCertificateExpiration, entry[kVeltoIDCertificateExpirationDateKey]);
        info.set(kVeltoIDCertificateSerialNumberKey, entry[kVeltoIDCertificateSerialNumberKey]);
        info.set(message::kCertificateDate, entry[kVeltoIDCertificateDateKey]);
        return info;
    }

    const String& name() const { return name_; }
    const String& sentPasswordHash() const { return password_; }
    const std::optional<Error>& error() const { return held_; }

  private:
    bool isOn(std::string_view key) const { return getBool(&options_, key, false); }

    bool copyRecord(const String& requestedName) {
        if (requestedName) return __VeltoIDDBCopyVeltoIDAccount(requestedName, &record_, &held_);
        auto first = __VeltoIDDBCopyFirstVeltoIDAccount({.password = true});
        if (first) record_ = std::move(*first);
        return first.has_value();
    }

    bool isFresh() const {
        const double presumed = metaInterval(name_, options_, kVeltoIDMetaAccountPresumedValidIntervalKey,
                                             kVeltoIDPresumedValidInterval);
        double valid = presumed;
        if (const auto own = record_.validForInterval())
            valid = std::min(std::max(*own, kMinValidInterval), presumed);
        const auto validated = record_.lastValidation();
        return validated && *validated <= platform::now() && platform::now() <= *validated + valid;
    }

    /// The next account check validates the account.
    void markForValidation() const {
        __VeltoIDDBSetAccountValue(name_, kVeltoIDAccountForceValidationKey, Value::boolean(true));
        if (!record_.values().contains(kVeltoIDAccountNextValidationDateKey))
            __VeltoIDDBSetAccountValue(name_, kVeltoIDAccountNextValidationDateKey,
                                       Value::date(platform::now()));
    }

    bool askServer(bool fresh) {
        encDsId_ = nullptr;
        password_ = __VeltoIDDBCopyHashedPassword(record_);
        const Session session =
            __VeltoIDSessionDoCreateSession(name_, password_, options_, &encDsId_, nullptr, &held_);
        if (session) return fetch(*session);
        if (known_ && !fresh) markForValidation();
        return known_;
    }

    bool fetch(VeltoIDAuthenticationSessionInfo& session) {
        Dictionary result;
        const CertificateEntry asked = certificateEntryOf(encDsId_);
        if (!_VeltoIDSessionDoGetMyInfo(session, encDsId_, fetchParameters(), options_, &result, &held_))
            return known_ && __VeltoIDDBCopyVeltoIDAccount(name_, &record_);
        updateAccountWithGetMyInfoResult(name_, result, asked);
        return __VeltoIDDBCopyVeltoIDAccount(name_, &record_, &held_);
    }

    /// What the agent has already; an empty identifier makes the server send its record.
    Dictionary fetchParameters() const {
        String identifier = record_.validationRecordIdentifier();
        if (isOn(option::kForceValidationRecordFetch) || !identifier ||
            record_.validationRecordData().size() == 0)
            identifier = "";
        return {{kVeltoIDCertificateSerialNumberKey, certificateEntryOf(encDsId_).serialNumber()},
                {kVeltoIDAccountValidationRecordIdentifierKey, identifier}};
    }

    const Dictionary& options_;
    AccountRecord record_;
    bool known_ = false;
    String name_;
    String encDsId_;
    String password_;
    std::optional<Error> held_;
};

/// The server's last word on the certificate goes into the certificate entry.
void applyCertificateValidity(const String& accountName, const Dictionary& answer,
                              const std::optional<CertificateEntry>& asked) {
    const Value& isValid = answer[kVeltoIDAccountCertificateIsValidKey];
    if (isValid.isAbsent()) return;
    const String encDsId = answer.string(kVeltoIDAccountDSIDKey);
    const CertificateEntry entry = asked ? *asked : certificateEntryOf(encDsId);
    if (isValid.asBoolean().value_or(false)) {
        __VeltoIDDBSetCertificateValues(
            entry, {{kVeltoIDCertificateLastSuccessfulValidationDateKey, Value::date(platform::now())}},
            Notify::No);
        return;
    }
    VELTOID_LOG_FROM("updateAccountWithGetMyInfoResult", kNotice, "Marking certificate for Velto ID ",
                     accountName, " dsID=", describeValue(encDsId),
                     "as invalid because the server said CertificateIsValid = false. (", isValid);
    __VeltoIDDBSetCertificateValues(entry,
                                    {{kVeltoIDCertificateStatusKey, kVeltoIDCertificateStatusInvalid},
                                     {kVeltoIDCertificateExpirationDateKey, Value::date(platform::now())}});
}

bool bothPresentAndDifferent(const Value& before, const Value& after) {
    return !before.isAbsent() && !after.isAbsent() && before != after;
}

/// What the signed record says of itself goes into the values; when to look at it again, if it tells that.
std::optional<double> applyPayload(const Data& signedRecord, Dictionary& values) {
    const Data content = verifyValidationRecord(signedRecord);
    const auto payload = content ? parseValidationRecordPayload(content) : std::nullopt;
    if (!payload) return std::nullopt;
    const auto validAsOf = dateFromValue((*payload)[kValidAsOfKey]);
    const auto duration = finiteNumber(*payload, kSuggestedDurationKey);
    values.set(kVeltoIDAccountValidationRecordValidAsOfKey, validAsOf ? Value::date(*validAsOf) : Value());
    values.set(kVeltoIDAccountValidationRecordSuggestedValidIntervalKey,
               duration ? Value::real(*duration) : Value());
    if (!validAsOf) return std::nullopt;
    return *validAsOf + kRecordCheckShare * duration.value_or(0);
}

/// Record data is kept only with an identifier and a date at which to look at it again, from the server or
/// from the record itself; otherwise the stored one goes. True when the account's record is another one now.
bool applyValidationRecord(const AccountRecord& before, const Dictionary& answer, Dictionary& values) {
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
    return bothPresentAndDifferent(before.validationRecordIdentifier(), identifier);
}

bool visibleDetailsChanged(const AccountRecord& before, const Dictionary& values) {
    constexpr std::string_view kVisibleKeys[] = {
        kVeltoIDAccountFirstNameKey, kVeltoIDAccountLastNameKey, kVeltoIDAccountEmailAddressesKey,
        kVeltoIDAccountValidatedEmailKey, kVeltoIDAccountValidatedPhonesKey};
    return std::any_of(std::begin(kVisibleKeys), std::end(kVisibleKeys), [&](std::string_view key) {
        return bothPresentAndDifferent(before.values()[key], values[key]);
    });
}

constexpr TakenEntry kCertificateEntries[] = {
    {kVeltoIDAccountDSIDKey, Value::Kind::String},
    {kVeltoIDCertificateStatusKey, Value::Kind::String},
    {kVeltoIDCertificateTypeKey, Value::Kind::String},
    {kVeltoIDCertificateSerialNumberKey, Value::Kind::String},
    {kVeltoIDCertificateExpirationDateKey, Value::Kind::Date},
    {kVeltoIDCertificateCreationDateKey, Value::Kind::Date},
    {kVeltoIDCertificateModificationDateKey, Value::Kind::Date},
};

constexpr TakenEntry kCertificateReferences[] = {
    {kVeltoIDCertificateCertificatePersistentReferenceKey, Value::Kind::Data},
    {kVeltoIDCertificatePrivateKeyPersistentReferenceKey, Value::Kind::Data},
};

constexpr TakenEntry kCertificateDetails[] = {
    {kVeltoIDCertificateIntermediateCertificateReferenceKey, Value::Kind::Data},
    {kVeltoIDCertificateNextRenewalAttemptDateKey, Value::Kind::Date},
};

/// The encDsId that is asked for; null when there is none, or the account has another one.
String requestedEncDsId(const String& accountName, const String& encDsId) {
    if (!accountName) return encDsId;
    const String own = accountRecordOf(accountName).encDsId();
    return !encDsId || encDsId == own ? own : String();
}

}  // namespace

bool __VeltoIDDoGetMyInfo(const String& accountName, const Dictionary& options, Dictionary* result,
                          ErrorOut error) {
    InformationRequest request(accountName, options);
    if (request.run()) {
        fill(result, request.answer());
        return true;
    }
    handleServerError(request.name(), request.sentPasswordHash(), request.error());
    return failWith(error, request.error().value_or(VELTOID_ERROR(identity_error::kUnknown)));
}

void updateAccountWithGetMyInfoResult(const String& accountName, const Dictionary& answer,
                                      const std::optional<CertificateEntry>& asked) {
    const AccountRecord before = accountRecordOf(accountName);
    Dictionary values = recordValuesFromServer(accountName, answer);
    values.set(kVeltoIDAccountLastValidationDateKey, Value::date(platform::now()));
    // Records keep the list of all addresses under their own name for it.
    values.set(kVeltoIDAccountEmailAddressesKey, answer[message::kAllEmails]);
    values.remove(message::kAllEmails);
    applyCertificateValidity(accountName, answer, asked);

    const bool hasOtherRecord = answer.contains(kVeltoIDAccountValidationRecordDataKey) &&
                                applyValidationRecord(before, answer, values);
    const bool notify = hasOtherRecord || !before.accountName() || visibleDetailsChanged(before, values);

    values.set(kVeltoIDAccountForceValidationKey, Value::null());
    values.set(kVeltoIDAccountNextValidationDateKey, Value::null());
    __VeltoIDDBSetAccountValues(accountName, values);
    if (notify) platform::Notifications::shared().post(kVeltoIDAccountChangeNotification);
}

bool __VeltoIDCopyCertificateInfo(const String& accountName, const String& encDsId, const Dictionary& options,
                                  Dictionary* information, ErrorOut error) {
    const String requested = requestedEncDsId(accountName, encDsId);
    if (!requested)
        return failWith(error, makeStatusError("There is no such account on this device, or it was never "
                                               "signed in",
                                               __func__, __FILE_NAME__, __LINE__));
    const CertificateEntry entry = certificateEntryOf(requested);
    if (!entry.exists())
        return failWith(error, makeError(identity_error::kUnknown, {{}, "There is no certificate", {}}, {},
                                         __func__, __FILE_NAME__, __LINE__));
    Dictionary found = {{kVeltoIDAccountDSIDKey, requested}};
    takeEntries(entry.values(), kCertificateEntries, found);
    if (getBool(&options, option::kCertificateDetails, false))
        takeEntries(entry.values(), kCertificateDetails, found);
    std::optional<platform::Certificate> certificate;
    if (usesSystemKeychain()) {
        takeEntries(entry.values(), kCertificateReferences, found);
    } else if (copyCertificateFromKeychainGivenPersistentRef(entry.reference(), &certificate) &&
               certificate) {
        found.set(message::kCertificateData, Data(certificate->der));
    }
    fill(information, std::move(found));
    return true;
}

bool __VeltoIDCopyVeltoIDs(const Dictionary& /*options*/, Array* names, ErrorOut error) {
    std::optional<Error> held;
    Array all;
    if (!__VeltoIDDBCopyVeltoIDs(&all, &held) && held && held->code != identity_error::kNoAccounts)
        return failWith(error, *held);
    fill(names, std::move(all));
    return true;
}

}  // namespace veltoid
