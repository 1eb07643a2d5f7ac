#include "VeltoIDAuthenticationImpl/NextAction.h"

#include <algorithm>
#include <cmath>

#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/crypto/TrustEvaluation.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"
#include "VeltoIDXMLServerCommunications/Methods.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

constexpr const char* kFunction = "checkAccountAndDetermineNextAction";

// Seconds.
constexpr double kDefaultValidationInterval = 1'209'600;
constexpr double kValidationPostponement = 3'600;
constexpr double kValidationAttemptSpacing = 43'200;
constexpr double kPreExpirationIntervalWhenMissing = 30;
constexpr double kRecordDateTolerance = 86'400;
constexpr double kDefaultSuggestedDuration = 2'592'000;

/// Share of a validation record's suggested duration for which it is good.
constexpr double kRecordValidShare = 0.75;
/// Share of a certificate's own lifetime in which it is renewed at the latest.
constexpr double kLastShareOfLifetime = 0.25;

double now() { return platform::Clock::shared().now(); }

double metaInterval(const String& accountName, std::string_view key, double defaultValue) {
    return __VeltoIDDBCopyMetaInfoValue(accountName, {}, key, Value::Kind::Number)
        .asDouble()
        .value_or(defaultValue);
}

/// The dates from `start` for `length` seconds include now.
bool isWithin(std::optional<double> start, double length) {
    return start && *start <= now() && now() <= *start + length;
}

bool speaksAgainstThePassword(const std::optional<Error>& error) {
    return error && error->domain == kIdentityErrorDomain &&
           (error->code == identity_error::kInvalidAccountOrPassword ||
            error->code == identity_error::kAccountLogonDisabled);
}

/// One examination of one account.
class AccountCheck {
  public:
    AccountCheck(const String& accountName, const Dictionary& options)
        : accountName_(accountName),
          options_(options),
          networkAllowed_(getBool(&options, "CheckNetwork", false)) {}
    ~AccountCheck() { __VeltoIDSessionRelease(std::move(session_)); }
    AccountCheck(const AccountCheck&) = delete;
    AccountCheck& operator=(const AccountCheck&) = delete;

    AccountState run() {
        if (!__VeltoIDDBCopyVeltoIDAccount(accountName_, &record_)) return AccountState::NoCertificate;
        const auto embargo = record_.date(kVeltoIDAccountEarliestAllowedConnectionDateKey);
        if (embargo && *embargo > now()) networkAllowed_ = false;
        if (const auto state = examinePassword()) return *state;
        encDsId_ = record_.string(kVeltoIDAccountDSIDKey);
        if (!encDsId_) return AccountState::NoEncodedDSID;
        takeDueValidation();
        if (record_.string(kVeltoIDAccountCertificateTokenKey)) return AccountState::CertificatePending;
        if (const auto state = validateAccount()) return *state;
        if (!__VeltoIDDBCopyCertificateInfo(encDsId_, &entry_)) return AccountState::NoCertificate;
        return examineCertificate();
    }

  private:
    // --- Password and account

    std::optional<AccountState> examinePassword() const {
        const Data reference = record_.data(kVeltoIDAccountHashedPasswordKeychainReferenceKey);
        if (!reference) {
            VELTOID_LOG_FROM(kFunction, kNotice,
                             "checkAccount: Velto ID " << accountName_.view()
                                                       << " doesn't have a password; no next action.");
            return AccountState::PasswordInvalid;
        }
        if (copyPasswordFromKeychainGivenPersistentRef(reference, nullptr)) return std::nullopt;
        VELTOID_LOG_FROM(kFunction, kNotice,
                         "checkAccount: Velto ID "
                             << accountName_.view()
                             << " doesn't have a password or the password has been removed "
                                "from the keychain; no next action.");
        return AccountState::PasswordInaccessibleInKeychain;
    }

    void takeDueValidation() {
        const auto next = record_.date(kVeltoIDAccountNextValidationDateKey);
        if (record_.boolean(kVeltoIDAccountForceValidationKey).value_or(false)) {
            setInRecord(kVeltoIDAccountForceValidationKey, Value::null(), false);
            validationIsDue_ = true;
        } else if (next && *next <= now()) {
            postponeValidation(true);
            validationIsDue_ = true;
        }
    }

    void postponeValidation(bool dirty) const {
        setInRecord(kVeltoIDAccountNextValidationDateKey, Value::date(now() + kValidationPostponement),
                    dirty);
    }

    /// Asks the server about the account if its information is old or its validation due. A state only when
    /// the check ends here; a server that cannot be reached does not end it.
    std::optional<AccountState> validateAccount() {
        const auto validated = record_.date(kVeltoIDAccountLastValidationDateKey);
        if (!networkAllowed_ ||
            (!validationIsDue_ && isWithin(validated, accountValidationInterval(accountName_))))
            return std::nullopt;
        const auto next = record_.date(kVeltoIDAccountNextValidationDateKey);
        if (validated && !validationIsDue_ && !(next && *next > now())) {
            // What is too old is asked for again, and in an hour once more if the server cannot be reached.
            postponeValidation(false);
            validationIsDue_ = true;
        }
        if (!record_.string(kVeltoIDAccountNameKey) || !password())
            return AccountState::PasswordInaccessibleInKeychain;
        std::optional<Error> error;
        if (!openSession(&error))
            return speaksAgainstThePassword(error) ? std::optional(AccountState::PasswordInvalid)
                                                   : std::nullopt;
        if (validationIsDue_) {
            const Dictionary forced = {{kVeltoIDAccountForceValidationKey, Value::boolean(true)}};
            __VeltoIDDoGetMyInfo(accountName_, forced, nullptr);
            __VeltoIDDBCopyVeltoIDAccount(accountName_, &record_);
        }
        return std::nullopt;
    }

    // --- Certificate

    AccountState examineCertificate() {
        AccountState state = classify();
        if (triedRecently_) return withValidationRecord(state);
        if (state == AccountState::Unknown) {
            askAboutCertificate();
            // The server's word counts at once.
            __VeltoIDDBCopyCertificateInfo(encDsId_, &entry_);
            if (isInvalid()) return AccountState::CertificateRevoked;
        }
        if (static_cast<int>(state) < 0) return state;
        std::optional<platform::Certificate> certificate;
        if (!readItems(&certificate)) return AccountState::NoCertificate;
        if (state == AccountState::Unknown)
            state = networkAllowed_ ? evaluate(*certificate) : AccountState::CertificateAssumedOK;
        if (state != AccountState::CertificateOK && state != AccountState::CertificateAssumedOK) return state;
        return isRenewalDue(*certificate) ? AccountState::CertificateShouldBeRenewed
                                          : withValidationRecord(state);
    }

    /// By the entry alone.
    AccountState classify() {
        const auto expires = entry_.date(kVeltoIDCertificateExpirationDateKey);
        if (isInvalid()) return AccountState::CertificateRevoked;
        if (expires && *expires < now()) return AccountState::CertificateExpired;
        const auto validated = entry_.date(kVeltoIDCertificateLastSuccessfulValidationDateKey);
        if (entry_.boolean(kVeltoIDDirtyKey).value_or(false) ||
            getBool(&options_, kVeltoIDAccountForceValidationKey, false) || !validated || *validated > now())
            return AccountState::Unknown;
        if (now() < *validated + certificateValidationInterval(accountName_))
            return AccountState::CertificateAssumedOK;
        const auto attempt = entry_.date(kVeltoIDCertificateLastValidationAttemptDateKey);
        triedRecently_ = attempt && now() <= *attempt + kValidationAttemptSpacing;
        return triedRecently_ ? AccountState::CertificateAssumedOK : AccountState::Unknown;
    }

    bool isInvalid() const {
        return entry_.string(kVeltoIDCertificateStatusKey) == kVeltoIDCertificateStatusInvalid;
    }

    void askAboutCertificate() {
        const String serialNumber = entry_.string(kVeltoIDCertificateSerialNumberKey);
        if (!networkAllowed_ || !serialNumber || (!session_ && !openSession(nullptr))) return;
        const Dictionary parameters = {{kVeltoIDCertificateSerialNumberKey, serialNumber},
                                       {kVeltoIDAccountValidationRecordIdentifierKey,
                                        record_.string(kVeltoIDAccountValidationRecordIdentifierKey)}};
        Dictionary answer;
        if (!_VeltoIDSessionDoGetMyInfo(*session_, encDsId_, parameters, options_, &answer, nullptr)) return;
        updateAccountWithGetMyInfoResult(accountName_, answer);
        __VeltoIDDBCopyVeltoIDAccount(accountName_, &record_);
    }

    /// Whether certificate and private key can be had from the keychain.
    bool readItems(std::optional<platform::Certificate>* certificate) const {
        const bool hasCertificate = readCertificate(certificate);
        return readPrivateKey() && hasCertificate;
    }

    bool readCertificate(std::optional<platform::Certificate>* certificate) const {
        const Data reference = entry_.data(kVeltoIDCertificateCertificatePersistentReferenceKey);
        if (!reference) {
            VELTOID_LOG_FROM(kFunction, kNotice,
                             "Failed trying to get certificate from keychain for veltoID "
                                 << accountName_.view() << " because certRef=NULL");
            return false;
        }
        if (copyCertificateFromKeychainGivenPersistentRef(reference, certificate) && *certificate)
            return true;
        VELTOID_LOG_FROM(
            kFunction, kNotice,
            "Failed trying to get certificate from keychain from persistent reference for veltoID "
                << accountName_.view() << " certRef=" << describeValue(reference));
        return false;
    }

    bool readPrivateKey() const {
        constexpr const char* kText =
            "Failed trying to get private key from keychain from persistent reference for veltoID ";
        const Data reference = entry_.data(kVeltoIDCertificatePrivateKeyPersistentReferenceKey);
        if (!reference) {
            VELTOID_LOG_FROM(kFunction, kNotice, kText << accountName_.view() << " privateKeyRef=NULL");
            return false;
        }
        // That it can be unsealed says enough: reading a key costs as much as all the rest of a check.
        if (copyKeyFromKeychainGivenPersistentRef(reference, nullptr)) return true;
        VELTOID_LOG_FROM(kFunction, kNotice,
                         kText << accountName_.view() << " certRef=" << describeValue(reference));
        return false;
    }

    AccountState evaluate(const platform::Certificate& certificate) {
        std::optional<platform::Certificate> intermediate;
        copyCertificateFromKeychainGivenPersistentRef(
            entry_.data(kVeltoIDCertificateIntermediateCertificateReferenceKey), &intermediate);
        std::vector<platform::Certificate> chain;
        if (intermediate) chain.push_back(*intermediate);
        const auto result = platform::evaluateTrust(certificate, chain);
        if (!result) return AccountState::Unknown;
        const AccountState state = stateOf(*result);
        setInEntry(kVeltoIDCertificateLastValidationAttemptDateKey, Value::date(now()));
        if (state == AccountState::CertificateOK || state == AccountState::CertificateAssumedOK)
            setInEntry(kVeltoIDCertificateLastSuccessfulValidationDateKey, Value::date(now()));
        return state;
    }

    AccountState stateOf(platform::TrustResult result) const {
        using enum platform::TrustResult;
        switch (result) {
            case Proceed:
            case Unspecified:
                return AccountState::CertificateOK;
            case RecoverableFailure:
                return AccountState::CertificateAssumedOK;
            case Deny:
                VELTOID_LOG_FROM(
                    kFunction, kNotice,
                    "Removing certificate, serial#="
                        << entry_.string(kVeltoIDCertificateSerialNumberKey).view() << " for veltoID "
                        << accountName_.view() << " dsID=" << encDsId_.view()
                        << " because it is not present in the certificates the server has for us.");
                return AccountState::CertificateRevoked;
            case FatalFailure:
                return AccountState::CertificateRevoked;
            case Invalid:
            case Confirm:
            case OtherError:
                break;
        }
        return AccountState::Unknown;
    }

    bool isRenewalDue(const platform::Certificate& certificate) const {
        const auto next = entry_.date(kVeltoIDCertificateNextRenewalAttemptDateKey);
        if (!next) return false;
        const auto expires = entry_.date(kVeltoIDCertificateExpirationDateKey);
        return *next < now() || (expires && now() + preExpiration(certificate) >= *expires);
    }

    /// How long before the expiry a renewal is due, whatever its planned date: the interval that is asked
    /// for, but of a certificate's own lifetime only the last quarter, or a short-lived one would be renewed
    /// without end. A negative interval counts by its size.
    double preExpiration(const platform::Certificate& certificate) const {
        const Value stored =
            __VeltoIDDBCopyMetaInfoValue(accountName_, options_, kVeltoIDMetaPreExpirationIntervalKey);
        const double interval =
            stored.isAbsent() ? kPreExpirationIntervalWhenMissing : stored.asDouble().value_or(0);
        if (!std::isfinite(interval)) return 0;
        if (interval < 0) return -interval;
        return std::min(interval,
                        kLastShareOfLifetime * std::max(certificate.notAfter - certificate.notBefore, 0.0));
    }

    // --- Validation record

    AccountState withValidationRecord(AccountState state) const {
        return __VeltoIDSessionGetServerVersion() >= kVeltoIDFirstVersionWithValidationRecords &&
                       isRecordDue()
                   ? AccountState::ValidationRecordNeedsToBeUpdated
                   : state;
    }

    bool isRecordDue() const {
        if (const auto next = record_.date(kVeltoIDAccountValidationRecordNextCheckDateKey))
            return *next <= now();
        const auto validAsOf = record_.date(kVeltoIDAccountValidationRecordValidAsOfKey);
        const double duration = getDouble(&record_, kVeltoIDAccountValidationRecordSuggestedValidIntervalKey,
                                          kDefaultSuggestedDuration);
        return record_.data(kVeltoIDAccountValidationRecordDataKey).size() == 0 || !validAsOf ||
               now() < *validAsOf - kRecordDateTolerance || now() > *validAsOf + kRecordValidShare * duration;
    }

    // ---

    String password() const { return __VeltoIDDBCopyHashedPassword(record_); }

    bool openSession(ErrorOut error) {
        session_ = __VeltoIDSessionDoCreateSession(record_.string(kVeltoIDAccountNameKey), password(),
                                                   options_, nullptr, nullptr, error);
        return session_ != nullptr;
    }

    void setInRecord(std::string_view key, const Value& value, bool dirty) const {
        __VeltoIDDBSetAccountValue(accountName_, key, value, dirty);
    }
    void setInEntry(std::string_view key, const Value& value) const {
        __VeltoIDDBSetCertificateValue(encDsId_, key, value, false);
    }

    const String& accountName_;
    const Dictionary& options_;
    bool networkAllowed_;
    bool validationIsDue_ = false;
    bool triedRecently_ = false;
    Dictionary record_;
    Dictionary entry_;
    String encDsId_;
    Session session_;
};

}  // namespace

double accountValidationInterval(const String& accountName) {
    return metaInterval(accountName, "AccountValidationInterval", kDefaultValidationInterval);
}

double certificateValidationInterval(const String& accountName) {
    return metaInterval(accountName, "CertificateValidationInterval", kDefaultValidationInterval);
}

AccountState checkAccountAndDetermineNextAction(const String& accountName, const Dictionary& options,
                                                ErrorOut error) {
    if (accountName) return AccountCheck(accountName, options).run();
    fillError(error, VELTOID_ERROR(identity_error::kUnknown));
    return AccountState::Unknown;
}

}  // namespace veltoid
