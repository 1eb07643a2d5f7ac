#include "VeltoIDAuthenticationImpl/NextAction.h"

#include "Logging/Log.h"
#include "Platform/Clock.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/Accounts.h"
#include "VeltoIDAuthenticationDB/Certificates.h"
#include "VeltoIDAuthenticationDB/Keys.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDKeychainItems/Passwords.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

// Seconds.
constexpr double kReconnectInterval = 300;
constexpr double kNeverForOldClients = 3'153'600'000;
constexpr double kAccountValidationInterval = 1'209'600;
constexpr double kCertificateValidationInterval = 1'209'600;
constexpr double kCSRGenerationInterval = 3'600;

/// Servers of this version and later give out validation records.
constexpr int32_t kFirstVersionWithValidationRecords = 101;

double metaInterval(const String& accountName, std::string_view key, double defaultValue) {
    return __VeltoIDDBCopyMetaInfoValue(accountName, {}, key, Value::Kind::Number)
        .asDouble()
        .value_or(defaultValue);
}

/// The earliest of the dates that were considered.
class EarliestDate {
  public:
    void consider(std::optional<double> date, double offset = 0) {
        if (date && (!earliest_ || *date + offset < *earliest_)) earliest_ = *date + offset;
    }
    void set(double date) { earliest_ = date; }
    const std::optional<double>& value() const { return earliest_; }

  private:
    std::optional<double> earliest_;
};

/// Collects the dates of one account.
class NextActionDate {
  public:
    NextActionDate(const String& accountName, const Dictionary& record)
        : accountName_(accountName), record_(record), encDsId_(record.string(kVeltoIDAccountDSIDKey)) {}

    std::optional<double> find() {
        if (record_.boolean(kVeltoIDDirtyKey).value_or(false)) earliest_.set(now_);
        if (!encDsId_) considerSignIn();
        const bool embargoed = applyEmbargo();
        if (!embargoed) {
            considerValidation();
            considerValidationRecord();
        }
        considerCertificate(embargoed);
        return earliest_.value();
    }

  private:
    void considerSignIn() {
        if (const auto attempt = record_.date(kVeltoIDMetaLastConnectAttemptKey)) {
            earliest_.consider(attempt, kReconnectInterval);
        } else {
            earliest_.set(now_);
        }
    }

    /// True while nothing but the certificate's expiry can lead to an action.
    bool applyEmbargo() {
        const Value& embargo = record_[kVeltoIDAccountEarliestAllowedConnectionDateKey];
        if (const auto date = embargo.asDate(); date && *date > now_) {
            earliest_.set(*date);
            return true;
        }
        if (!embargo.isAbsent() || !record_.boolean(kVeltoIDAccountClientTooOldKey).value_or(false))
            return false;
        earliest_.set(now_ + kNeverForOldClients);
        return true;
    }

    void considerValidation() {
        if (record_.boolean(kVeltoIDAccountForceValidationKey).value_or(false)) {
            earliest_.set(now_);
        } else if (const auto next = record_.date(kVeltoIDAccountNextValidationDateKey)) {
            earliest_.consider(next);
        } else {
            earliest_.consider(
                record_.date(kVeltoIDAccountLastValidationDateKey),
                metaInterval(accountName_, "AccountValidationInterval", kAccountValidationInterval));
        }
    }

    void considerValidationRecord() {
        if (__VeltoIDSessionGetServerVersion() < kFirstVersionWithValidationRecords) return;
        if (const auto next = record_.date(kVeltoIDAccountValidationRecordNextCheckDateKey)) {
            earliest_.consider(next);
        } else if (!record_.contains(kVeltoIDAccountValidationRecordIdentifierKey)) {
            earliest_.consider(now_);
        }
    }

    void considerCertificate(bool embargoed) {
        Dictionary entry;
        if (encDsId_ && __VeltoIDDBCopyCertificateInfo(encDsId_, &entry)) {
            earliest_.consider(entry.date(kVeltoIDCertificateExpirationDateKey));
            if (embargoed) return;
            earliest_.consider(entry.date("NextRenewalAttempt"));
            earliest_.consider(
                entry.date(kVeltoIDCertificateLastSuccessfulValidationDateKey),
                metaInterval(accountName_, "CertificateValidationInterval", kCertificateValidationInterval));
        } else if (!embargoed) {
            considerRequest();
        }
    }

    void considerRequest() {
        const auto nextFetch = record_.date("NextCertificateFetchDate");
        const auto generated = record_.date("CSRGenerationDate");
        if (nextFetch) {
            earliest_.consider(nextFetch);
        } else if (generated && *generated <= now_) {
            earliest_.consider(generated,
                               getDouble(&record_, "CSRGenerationInterval", kCSRGenerationInterval));
        } else {
            earliest_.set(now_);
        }
    }

    const String& accountName_;
    const Dictionary& record_;
    const String encDsId_;
    const double now_ = platform::Clock::shared().now();
    EarliestDate earliest_;
};

}  // namespace

AccountState checkAccountAndDetermineNextAction(const String& accountName, const Dictionary& /*options*/,
                                                ErrorOut error) {
    if (!accountName) {
        fillError(error, VELTOID_ERROR(identity_error::kUnknown));
        return AccountState::Unknown;
    }
    Dictionary record;
    if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record)) return AccountState::NoCertificate;
    const Data passwordReference = record.data(kVeltoIDAccountHashedPasswordKeychainReferenceKey);
    if (!passwordReference) {
        VELTOID_LOG(kNotice, "checkAccount: Velto ID " << accountName.view()
                                                       << " doesn't have a password; no next action.");
        return AccountState::PasswordInvalid;
    }
    if (!copyPasswordFromKeychainGivenPersistentRef(passwordReference, nullptr)) {
        VELTOID_LOG(kNotice,
                    "checkAccount: Velto ID "
                        << accountName.view()
                        << " doesn't have a password or the password has been removed from the keychain; no "
                           "next action.");
        return AccountState::PasswordInaccessibleInKeychain;
    }
    const String encDsId = record.string(kVeltoIDAccountDSIDKey);
    if (!encDsId) return AccountState::NoEncodedDSID;
    if (record.string(kVeltoIDAccountCertificateTokenKey)) return AccountState::CertificatePending;
    if (!__VeltoIDDBCopyCertificateInfo(encDsId, nullptr)) return AccountState::NoCertificate;
    return AccountState::Unknown;
}

bool copyNextActionDateForAccount(const String& accountName, std::optional<double>* date) {
    if (date != nullptr) date->reset();
    Dictionary record;
    if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record) ||
        !record.contains(kVeltoIDAccountHashedPasswordKeychainReferenceKey))
        return false;
    if (date != nullptr) *date = NextActionDate(accountName, record).find();
    return true;
}

}  // namespace veltoid
