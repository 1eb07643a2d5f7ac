#include "VeltoIDAuthenticationImpl/NextAction.h"

#include "Logging/Log.h"
#include "Platform/crypto/TrustEvaluation.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/OptionKeys.h"
#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/KeychainIdentity.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"
#include "VeltoIDXMLServerCommunications/Methods.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

using enum AccountState;

constexpr const char* kFunction = "checkAccountAndDetermineNextAction";

/// Until a validation that was due is tried again (seconds).
constexpr double kValidationPostponement = 3'600;

/// What the server has just issued, or called good, it is not asked about (seconds).
constexpr double kServersWordHolds = 60;

/// One examination of one account.
class Examination {
  public:
    Examination(const String& accountName, const Dictionary& options)
        : accountName_(accountName),
          options_(options),
          networkAllowed_(getBool(&options, option::kCheckNetwork, false)) {}

    AccountState run() {
        if (!__VeltoIDDBCopyVeltoIDAccount(accountName_, &record_)) return NoCertificate;
        if (schedule().isEmbargoed()) networkAllowed_ = false;
        if (const auto state = examinePassword()) return *state;
        encDsId_ = record_.encDsId();
        if (!encDsId_) return NoEncodedDSID;
        takeDueValidation();
        if (record_.certificateToken()) return CertificatePending;
        if (const auto state = validateAccount()) return *state;
        if (!__VeltoIDDBCopyCertificateInfo(encDsId_, &entry_)) return NoCertificate;
        return examineCertificate();
    }

  private:
    std::optional<AccountState> examinePassword() const {
        const Data reference = record_.passwordReference();
        if (!reference) {
            VELTOID_LOG_FROM(kFunction, kNotice, "checkAccount: Velto ID ", accountName_,
                             " doesn't have a password; no next action.");
            return PasswordInvalid;
        }
        if (copyPasswordFromKeychainGivenPersistentRef(reference, nullptr)) {
            noteKeychainInUse();
            return std::nullopt;
        }
        VELTOID_LOG_FROM(
            kFunction, kNotice, "checkAccount: Velto ID ", accountName_,
            " doesn't have a password or the password has been removed from the keychain; no next action.");
        return PasswordInaccessibleInKeychain;
    }

    void takeDueValidation() {
        // Looking alone takes nothing.
        validationIsDue_ = networkAllowed_ && schedule().isDue(DueReason::Validation);
        if (!validationIsDue_) return;
        if (record_.isValidationForced()) {
            __VeltoIDDBSetAccountValue(accountName_, kVeltoIDAccountForceValidationKey, Value::null(),
                                       Notify::No);
        } else if (record_.nextValidation()) {
            postponeValidation(Notify::Yes);
        }
    }

    void postponeValidation(Notify notify) const {
        __VeltoIDDBSetAccountValue(accountName_, kVeltoIDAccountNextValidationDateKey,
                                   Value::date(platform::now() + kValidationPostponement), notify);
    }

    /// Asks the server about the account if its information is old or its validation due. A state only when
    /// the check ends here; a server that cannot be reached does not end it.
    std::optional<AccountState> validateAccount() {
        if (!networkAllowed_ || (!validationIsDue_ && schedule().isInformationFresh())) return std::nullopt;
        // A request for a certificate follows, which signs in and learns the same.
        if (!validationIsDue_ && !certificateEntryOf(encDsId_).exists() &&
            schedule().isDue(DueReason::Request))
            return std::nullopt;
        // What is too old is asked for again, and in an hour once more if the server cannot be reached.
        if (validationIsDue_ && !record_.isValidationForced() && !record_.nextValidation())
            postponeValidation(Notify::No);
        if (!password()) return PasswordInaccessibleInKeychain;
        std::optional<Error> error;
        if (!openSession(&error))
            return refusesPassword(error) ? std::optional(PasswordInvalid) : std::nullopt;
        if (validationIsDue_) {
            const Dictionary forced = {{option::kForceValidation, Value::boolean(true)}};
            __VeltoIDDoGetMyInfo(accountName_, forced, nullptr);
            __VeltoIDDBCopyVeltoIDAccount(accountName_, &record_);
        }
        return std::nullopt;
    }

    AccountState examineCertificate() {
        takeCertificate();
        AccountState state = classify();
        if (triedRecently_) return withValidationRecord(state);
        if (state == Unknown) {
            askAboutCertificate();
            // The server's word counts at once.
            const Data before = entry_.reference();
            __VeltoIDDBCopyCertificateInfo(encDsId_, &entry_);
            if (entry_.isInvalid()) return CertificateRevoked;
            if (entry_.reference() != before) takeCertificate();
        }
        if (static_cast<int>(state) < 0) return state;
        if (const auto missing = missingItems()) return *missing;
        if (state == Unknown) state = networkAllowed_ ? evaluate(*certificate_) : CertificateAssumedOK;
        if (state != CertificateOK && state != CertificateAssumedOK) return state;
        return schedule().isDue(DueReason::Renewal) || schedule().isDue(DueReason::PreExpiry)
                   ? CertificateShouldBeRenewed
                   : withValidationRecord(state);
    }

    /// The certificate itself, as far as it can be had. Entries that an earlier agent has made may call it
    /// good for longer than it is.
    void takeCertificate() {
        certificate_.reset();
        copyCertificateFromKeychainGivenPersistentRef(entry_.reference(), &certificate_);
        const auto expires = entry_.expires();
        if (!certificate_ || (expires && *expires <= certificate_->notAfter)) return;
        setInEntry(kVeltoIDCertificateExpirationDateKey, Value::date(certificate_->notAfter));
        __VeltoIDDBCopyCertificateInfo(encDsId_, &entry_);
    }

    /// By the entry alone.
    AccountState classify() {
        if (entry_.isInvalid()) return CertificateRevoked;
        const AccountSchedule now = schedule();
        if (now.isDue(DueReason::Expiry)) return CertificateExpired;
        if (entry_.isDirty() || getBool(&options_, option::kForceValidation, false) ||
            now.isDue(DueReason::CertificateValidation))
            return Unknown;
        triedRecently_ = now.isCertificateValidationPutOff();
        return CertificateAssumedOK;
    }

    void askAboutCertificate() {
        const String serialNumber = entry_.serialNumber();
        const auto validated = entry_.lastSuccessfulValidation();
        if (validated && *validated <= platform::now() && platform::now() < *validated + kServersWordHolds)
            return;
        if (!networkAllowed_ || !serialNumber || (!session_ && !openSession(nullptr))) return;
        const Dictionary parameters = {
            {kVeltoIDCertificateSerialNumberKey, serialNumber},
            {kVeltoIDAccountValidationRecordIdentifierKey, record_.validationRecordIdentifier()}};
        Dictionary answer;
        if (!_VeltoIDSessionDoGetMyInfo(*session_, encDsId_, parameters, options_, &answer, nullptr)) return;
        updateAccountWithGetMyInfoResult(accountName_, answer, entry_);
        __VeltoIDDBCopyVeltoIDAccount(accountName_, &record_);
    }

    /// Nothing when certificate and private key can be had from the keychain. What only cannot be read now is
    /// no reason to ask for another certificate.
    std::optional<AccountState> missingItems() const {
        const ItemState certificate = certificateState();
        const ItemState key = privateKeyState();
        if (certificate == ItemState::Gone || key == ItemState::Gone) return NoCertificate;
        const bool areReadable = certificate == ItemState::Readable && key == ItemState::Readable;
        return areReadable ? std::nullopt : std::optional(Unknown);
    }

    ItemState certificateState() const {
        if (certificate_) return ItemState::Readable;
        const Data reference = entry_.reference();
        VELTOID_LOG_FROM(kFunction, kNotice, "Failed trying to get certificate from keychain ",
                         reference ? "from persistent reference for veltoID " : "for veltoID ", accountName_,
                         reference ? logText(" certRef=", reference) : " because certRef=NULL");
        // What can be read is no certificate.
        const ItemState state = stateOfItem(platform::KeychainItemClass::Certificate, reference);
        return state == ItemState::Readable ? ItemState::Gone : state;
    }

    ItemState privateKeyState() const {
        const Data reference = entry_.privateKeyReference();
        // That it can be unsealed says enough: reading a key costs as much as all the rest of a check.
        if (copyKeyFromKeychainGivenPersistentRef(reference, nullptr)) return ItemState::Readable;
        VELTOID_LOG_FROM(
            kFunction, kNotice,
            "Failed trying to get private key from keychain from persistent reference for veltoID ",
            accountName_, reference ? logText(" certRef=", reference) : " privateKeyRef=NULL");
        // It may have become readable since.
        const ItemState state = stateOfItem(platform::KeychainItemClass::Key, reference);
        return state == ItemState::Readable ? ItemState::Unreadable : state;
    }

    AccountState evaluate(const platform::Certificate& certificate) {
        std::optional<platform::Certificate> intermediate;
        copyCertificateFromKeychainGivenPersistentRef(entry_.intermediateReference(), &intermediate);
        std::vector<platform::Certificate> chain;
        if (intermediate) chain.push_back(*intermediate);
        const auto result = platform::evaluateTrust(certificate, chain);
        if (!result) return Unknown;
        const AccountState state = stateOf(*result);
        setInEntry(kVeltoIDCertificateLastValidationAttemptDateKey, Value::date(platform::now()));
        setInEntry(kVeltoIDDirtyKey, Value::boolean(false));
        if (state == CertificateOK || state == CertificateAssumedOK)
            setInEntry(kVeltoIDCertificateLastSuccessfulValidationDateKey, Value::date(platform::now()));
        return state;
    }

    AccountState stateOf(platform::TrustResult result) const {
        using enum platform::TrustResult;
        if (result == Proceed || result == Unspecified) return CertificateOK;
        if (result == RecoverableFailure) return CertificateAssumedOK;
        if (result == Deny)
            VELTOID_LOG_FROM(kFunction, kNotice, "Removing certificate, serial#=", entry_.serialNumber(),
                             " for veltoID ", accountName_, " dsID=", encDsId_,
                             " because it is not present in the certificates the server has for us.");
        return result == Deny || result == FatalFailure ? CertificateRevoked : Unknown;
    }

    AccountState withValidationRecord(AccountState state) const {
        return schedule().isDue(DueReason::ValidationRecord) ? ValidationRecordNeedsToBeUpdated : state;
    }

    AccountSchedule schedule() const { return {record_, entry_, options_}; }

    String password() const { return __VeltoIDDBCopyHashedPassword(record_); }

    bool openSession(ErrorOut error) {
        session_ =
            __VeltoIDSessionDoCreateSession(accountName_, password(), options_, nullptr, nullptr, error);
        return session_ != nullptr;
    }

    void setInEntry(std::string_view key, const Value& value) const {
        __VeltoIDDBSetCertificateValues(entry_, {{key, value}}, Notify::No);
    }

    const String& accountName_;
    const Dictionary& options_;
    bool networkAllowed_;
    bool validationIsDue_ = false;
    bool triedRecently_ = false;
    AccountRecord record_;
    CertificateEntry entry_;
    std::optional<platform::Certificate> certificate_;
    String encDsId_;
    Session session_;
};

}  // namespace

AccountState checkAccountAndDetermineNextAction(const String& accountName, const Dictionary& options,
                                                ErrorOut error) {
    if (accountName) return Examination(accountName, options).run();
    fillError(error, VELTOID_ERROR(identity_error::kUnknown));
    return Unknown;
}

}  // namespace veltoid
