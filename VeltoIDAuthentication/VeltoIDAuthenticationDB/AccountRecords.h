// Account records: the stored state of each identity account, in the section "Accounts" under its name.
//
// Bodies run on the database queue; records come out as copies. "Writes" means to the preference store
// (Store.h); Notify.h says what else a change may do. Errors are of kIdentityErrorDomain unless said
// otherwise.
#pragma once

#include <optional>
#include <utility>

#include "Protocol/RecordKeys.h"
#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/Notify.h"

namespace veltoid {

/// A server is left alone for at most this long when it asks for that (seconds); a later date is not
/// believed.
inline constexpr double kMaxEmbargo = 1'209'600;

/// A record as its readers see it: the stored dictionary under the names of its entries. Shares the stored
/// value and copies nothing; entries of the wrong type count as absent.
class AccountRecord : Dictionary {
  public:
    using Date = std::optional<double>;
    using Seconds = std::optional<double>;

    AccountRecord() = default;
    AccountRecord(String accountName, Dictionary values)
        : Dictionary(std::move(values)), accountName_(std::move(accountName)) {}

    /// The database's key, by which every operation knows the account; null for a record that was never
    /// found.
    const String& accountName() const { return accountName_; }
    const Dictionary& values() const { return *this; }

    String encDsId() const { return string(kVeltoIDAccountDSIDKey); }
    String uuid() const { return string(kVeltoIDAccountUUIDKey); }
    String stableUUID() const { return string(kVeltoIDAccountStableUUIDKey); }
    String serverURL() const { return string(kVeltoIDAccountServerURLKey); }
    bool isDirty() const { return boolean(kVeltoIDDirtyKey).value_or(false); }
    /// Whether encDsId and a validated address or phone are known.
    bool isComplete() const {
        return contains(kVeltoIDAccountDSIDKey) &&
               (contains(kVeltoIDAccountValidatedEmailKey) || contains(kVeltoIDAccountValidatedPhonesKey));
    }

    // Password: an item of the keychain, or (old records) a hash of the record's own.
    Data passwordReference() const { return data(kVeltoIDAccountHashedPasswordKeychainReferenceKey); }
    String ownPasswordHash() const { return string(kVeltoIDAccountHashedPasswordKey); }
    bool hasPassword() const { return passwordReference() || ownPasswordHash(); }

    // Connecting to the server.
    Date lastConnectAttempt() const { return date(kVeltoIDMetaLastConnectAttemptKey); }
    /// The end of the embargo that is in force at `now`.
    Date embargoEnd(double now) const;
    /// Whether the server has refused this version of the agent since the account was last added.
    bool isClientTooOld() const;

    // What the account check puts off.
    Date nextCheck() const { return date(kVeltoIDAccountNextCheckDateKey); }
    Seconds checkBackOff() const { return number(kVeltoIDAccountCheckBackOffKey); }

    // Validation of the account's information.
    Date lastValidation() const { return date(kVeltoIDAccountLastValidationDateKey); }
    Date nextValidation() const { return date(kVeltoIDAccountNextValidationDateKey); }
    bool isValidationForced() const { return boolean(kVeltoIDAccountForceValidationKey).value_or(false); }
    Seconds validForInterval() const { return number(kVeltoIDAccountValidForIntervalKey); }

    // The signed validation record.
    String validationRecordIdentifier() const { return string(kVeltoIDAccountValidationRecordIdentifierKey); }
    Data validationRecordData() const { return data(kVeltoIDAccountValidationRecordDataKey); }
    Date validationRecordValidAsOf() const { return date(kVeltoIDAccountValidationRecordValidAsOfKey); }
    Date validationRecordNextCheck() const { return date(kVeltoIDAccountValidationRecordNextCheckDateKey); }
    Seconds validationRecordNextCheckInterval() const {
        return number(kVeltoIDAccountValidationRecordNextCheckIntervalKey);
    }

    // A certificate request: dates of those that were sent, and what is known of the pending one.
    Date requestGeneration() const { return date(kVeltoIDAccountCSRGenerationDateKey); }
    Seconds requestGenerationInterval() const { return number(kVeltoIDAccountCSRGenerationIntervalKey); }
    Array requestDates() const {
        const Array* dates = array(kVeltoIDAccountCertificateRequestDatesKey);
        return dates != nullptr ? *dates : Array();
    }
    Date requestsHeldUntil() const { return date(kVeltoIDAccountCertificateRequestsHeldUntilKey); }
    Data pendingKeyReference() const { return data(kVeltoIDCertificatePrivateKeyPersistentReferenceKey); }
    String certificateToken() const { return string(kVeltoIDAccountCertificateTokenKey); }
    Date certificateTokenExpiration() const { return date(kVeltoIDAccountCertificateTokenExpirationKey); }
    Date certificateTokenFaultsSince() const { return date(kVeltoIDAccountCertificateTokenFaultsSinceKey); }
    Date nextCertificateFetch() const { return date(kVeltoIDAccountCertificateNextCertificateFetchDateKey); }
    Seconds nextCertificateFetchDelta() const {
        return number(kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey);
    }

  private:
    String accountName_;
};

/// The names of all accounts; -107 when there is none.
bool __VeltoIDDBCopyVeltoIDs(Array* names, ErrorOut error = nullptr);
/// The same; empty when there is none.
Array accountNames();

/// What an account must have to be found.
struct AccountRequirements {
    bool password = false;
    bool encDsId = false;
};

/// The first record that has what is required.
std::optional<AccountRecord> __VeltoIDDBCopyFirstVeltoIDAccount(const AccountRequirements& required);

/// -99 for no name, -108 for no record.
bool __VeltoIDDBCopyVeltoIDAccount(const String& name, AccountRecord* record, ErrorOut error = nullptr);

/// The record; without one, a record that has no name and no values.
AccountRecord accountRecordOf(const String& name);

/// The name of the first account with that encDsId; -1 with texts when there is none.
bool __VeltoIDDBCopyVeltoIDForDSID(const String& encDsId, String* name, ErrorOut error = nullptr);

/// Creates or updates the record; a password goes to the keychain, its reference into the record, and the
/// server is asked again whether it takes this agent. Marks the record dirty and writes with signal. False,
/// with record and password as they were, when the keychain refuses the password or the record cannot be
/// stored.
bool __VeltoIDDBCreateVeltoIDAccount(const String& name, const String& hashedPassword, const String& encDsId);

/// The password hash of a record: from the keychain, else the record's own. Runs on the caller's thread.
String __VeltoIDDBCopyHashedPassword(const AccountRecord& record);

/// Drops password and reference, deletes the keychain item, marks dirty, writes with signal. With
/// `refusedHash`, only a password of that hash: another one was stored meanwhile, or cannot be read now.
/// False, with the password in place, without a record, for another password, or when the record cannot be
/// stored.
bool __VeltoIDDBRemovePassword(const String& name, const String& refusedHash = nullptr);

/// What the stored record must still be like for a change that was decided earlier.
using RecordCondition = bool (*)(const AccountRecord& stored, const AccountRecord& examined);

/// Sets every key whose value differs; Null removes. A change stamps "ModificationDate", marks the record
/// dirty when it notifies (unless the values say otherwise), and is written. False without name, values or
/// record.
bool __VeltoIDDBSetAccountValues(const String& name, const Dictionary& values, Notify notify = Notify::Yes);

/// The same for the examined account, if the condition holds when the change is made; false if not.
bool setAccountValuesIf(RecordCondition condition, const AccountRecord& examined, const Dictionary& values,
                        Notify notify = Notify::Yes);

/// The same for one key; an absent value removes it.
bool __VeltoIDDBSetAccountValue(const String& name, const String& key, const Value& value,
                                Notify notify = Notify::Yes);

/// The stored value, of whatever kind; absent when there is none.
Value __VeltoIDDBCopyAccountValue(const String& name, const String& key);

/// Removes the record only: keychain items and certificate entry stay. No name: status-code domain, -1; no
/// record: -108.
bool __VeltoIDDBRemoveVeltoIDAccount(const String& name, ErrorOut error = nullptr);

/// References to items of the keychain that are wanted without an owner from now on, and to those that are
/// not any more.
struct UnownedItems {
    Array wanted;
    Array unwanted;
};

/// Removes the record, its password item, its meta information and, unless another account shares its
/// encDsId, its certificate entry, in one step: a new record of that name would take them up. The other items
/// of the keychain stay; what is to become of them is noted. Hands the record out. False, with everything as
/// it was: -108 without a record, -100 when the change cannot be stored.
bool __VeltoIDDBRemoveVeltoIDAccountAndPassword(const String& name, const UnownedItems& items,
                                                AccountRecord* removed, ErrorOut error = nullptr);

/// The references to keychain items that are in use: of records, of certificate entries, and those that are
/// wanted without an owner. None when the database cannot be read.
std::optional<Array> referencesInUse();

/// What becomes of the marks of changed records, and with ClearAll of changed certificate entries.
enum class DirtyMarks { Keep, ClearOfAccounts, ClearAll };

/// The names of the dirty records; none when there are none. Marks are cleared in memory until the section is
/// next written.
std::optional<Array> __VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks marks);

/// Adds the account's identifiers to the record where they are missing (AccountUUIDs.h). True when it added
/// one.
bool __VeltoIDDBDeriveAccountUUIDs(const String& name, Dictionary& record);

/// Whether the account's encDsId has a valid certificate entry.
bool __VeltoIDDBHasValidCertificate(const String& name);

/// Whether a certificate request of the account is pending.
bool __VeltoIDDBHasCertificateToken(const String& name);
}  // namespace veltoid
