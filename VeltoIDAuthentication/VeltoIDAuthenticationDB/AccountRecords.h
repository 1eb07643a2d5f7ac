// Account records: the stored state of one identity account, in the section "Accounts" under the account's
// name.
//
// Bodies run on the database queue; records come out as copies. "Writes" means to the preference store
// (Store.h); Notify.h says what else a change may do. Errors are of domain HWIdentityErrorDomain
// unless said otherwise.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/AccountRecord.h"
#include "VeltoIDAuthenticationDB/Notify.h"

namespace veltoid {

/// The names of all accounts; -107 when there is none.
bool __VeltoIDDBCopyVeltoIDs(Array* names, ErrorOut error = nullptr);

/// What an account must have to be found.
struct AccountRequirements {
    bool password = false;
    bool encDsId = false;
};

/// The first record that has what is required.
std::optional<AccountRecord> __VeltoIDDBCopyFirstVeltoIDAccount(const AccountRequirements& required);

/// -99 for no name, -108 for no record.
bool __VeltoIDDBCopyVeltoIDAccount(const String& name, AccountRecord* record, ErrorOut error = nullptr);

/// The name of the first account with that encDsId; -1 with texts when there is none.
bool __VeltoIDDBCopyVeltoIDForDSID(const String& encDsId, String* name, ErrorOut error = nullptr);

/// Creates or updates the record; a password goes to the keychain, its reference into the record. Marks the
/// record dirty and writes with signal. False, with the record as it was, when the keychain refuses the
/// password.
bool __VeltoIDDBCreateVeltoIDAccount(const String& name, const String& hashedPassword, const String& encDsId);

/// The password hash of a record: from the keychain, else the record's own. Runs on the caller's thread.
String __VeltoIDDBCopyHashedPassword(const AccountRecord& record);

/// Drops password and reference, deletes the keychain item, marks dirty, writes with signal. False without a
/// record.
bool __VeltoIDDBRemovePassword(const String& name);

/// Sets every key whose value differs; Null removes. A change stamps "ModificationDate", marks the record
/// dirty when it notifies (unless the values say otherwise), and is written. False without name, values or
/// record.
bool __VeltoIDDBSetAccountValues(const String& name, const Dictionary& values, Notify notify = Notify::Yes);

/// The same for one key; an absent value removes it.
bool __VeltoIDDBSetAccountValue(const String& name, const String& key, const Value& value,
                                Notify notify = Notify::Yes);

/// The stored value, of whatever kind; absent when there is none.
Value __VeltoIDDBCopyAccountValue(const String& name, const String& key);

/// Removes the record only: keychain items and certificate entry stay. No name: status-code domain, -1; no
/// record: -108.
bool __VeltoIDDBRemoveVeltoIDAccount(const String& name, ErrorOut error = nullptr);

/// Removes the record with its password item, in one step: a new record of that name would take the item up.
/// Hands the record out; false without one, or when the change cannot be stored.
bool __VeltoIDDBRemoveVeltoIDAccountAndPassword(const String& name, AccountRecord* removed);

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
