#include "VeltoIDAuthenticationDB/AccountRecords.h"

#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountUUIDs.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

using database::Store;

/// An account that is not there may only be out of reach.
int64_t missingAccountCode(const Store& store) {
    return store.isLoaded() ? identity_error::kUnknownAccount : identity_error::kUnspecified;
}

/// The record of a name; none when there is none.
std::optional<AccountRecord> recordOf(const Store& store, const String& name) {
    const Dictionary* found = Store::find(store.accounts, name);
    return found != nullptr ? std::optional(AccountRecord(name, *found)) : std::nullopt;
}

/// The first record that the condition holds for.
template <typename Condition>
std::optional<AccountRecord> firstRecord(const Store& store, Condition condition) {
    for (const auto& [name, value] : store.accounts)
        if (const Dictionary* values = value.asDictionary())
            if (AccountRecord record(name, *values); condition(record)) return record;
    return std::nullopt;
}

/// Whether the keychain holds exactly this password for the record.
bool keychainHoldsPassword(const Dictionary& record, const String& hashedPassword) {
    String stored;
    return copyPasswordFromKeychainGivenPersistentRef(
               record.data(kVeltoIDAccountHashedPasswordKeychainReferenceKey), &stored) &&
           stored == hashedPassword;
}

/// Brings the password into the keychain and its reference into the record.
bool storePassword(const String& name, const String& hashedPassword, Dictionary& record) {
    if (keychainHoldsPassword(record, hashedPassword)) {
        VELTOID_LOG_FROM("__VeltoIDDBCreateVeltoIDAccount", kNotice, "Password being added for account ",
                         name, " matches password on keychain, so skipping over addPasswordToKeychain");
        return true;
    }
    Data reference;
    if (!addPasswordToKeychain(name, hashedPassword, nullptr, &reference)) return false;
    if (!record.contains(kVeltoIDAccountHashedPasswordKeychainReferenceKey))
        record.set(kVeltoIDAccountHashedPasswordKeychainReferenceKey, reference);
    return true;
}

void markDirty(Dictionary& record) {
    record.set(kVeltoIDDirtyKey, Value::boolean(true));
    record.set(kVeltoIDAccountModificationDateKey, Value::date(platform::now()));
}

void removeDirtyMarks(Dictionary& section) {
    const Dictionary before = section;
    for (const auto& [key, value] : before) {
        const Dictionary* entry = value.asDictionary();
        if (entry == nullptr || !entry->contains(kVeltoIDDirtyKey)) continue;
        Dictionary cleaned = *entry;
        cleaned.remove(kVeltoIDDirtyKey);
        section.set(key, cleaned);
    }
}

}  // namespace

bool AccountRecord::isClientTooOld() const {
    return boolean(kVeltoIDAccountClientTooOldKey).value_or(false) &&
           number(kVeltoIDAccountClientTooOldVersionKey) == kVeltoIDDBAccessorVersion;
}

bool __VeltoIDDBCopyVeltoIDs(Array* names, ErrorOut error) {
    return database::perform([&](const Store& store) {
        if (store.accounts.empty())
            return failWith(error, VELTOID_ERROR_FROM("__VeltoIDDBCopyVeltoIDs",
                                                      store.isLoaded() ? identity_error::kNoAccounts
                                                                       : identity_error::kUnspecified));
        fill(names, database::keysOf(store.accounts));
        return true;
    });
}

Array accountNames() {
    return database::perform([](const Store& store) { return database::keysOf(store.accounts); });
}

std::optional<AccountRecord> __VeltoIDDBCopyFirstVeltoIDAccount(const AccountRequirements& required) {
    return database::perform([&](const Store& store) {
        return firstRecord(store, [&](const AccountRecord& record) {
            return (!required.password || record.hasPassword()) && (!required.encDsId || record.encDsId());
        });
    });
}

bool __VeltoIDDBCopyVeltoIDAccount(const String& name, AccountRecord* record, ErrorOut error) {
    if (!name) return failWith(error, VELTOID_ERROR(identity_error::kInvalidParameters));
    return database::perform([&](const Store& store) {
        auto found = recordOf(store, name);
        if (!found)
            return failWith(error,
                            VELTOID_ERROR_FROM("__VeltoIDDBCopyVeltoIDAccount", missingAccountCode(store)));
        fill(record, std::move(*found));
        return true;
    });
}

AccountRecord accountRecordOf(const String& name) {
    AccountRecord record;
    __VeltoIDDBCopyVeltoIDAccount(name, &record);
    return record;
}

bool __VeltoIDDBCopyVeltoIDForDSID(const String& encDsId, String* name, ErrorOut error) {
    const auto found = database::perform([&](const Store& store) {
        return firstRecord(
            store, [&](const AccountRecord& record) { return encDsId && record.encDsId() == encDsId; });
    });
    if (!found)
        return failWith(error, makeError(identity_error::kUnspecified, {"Unknown error", "?", "?"}, {},
                                         __func__, __FILE_NAME__, __LINE__));
    fill(name, found->accountName());
    return true;
}

bool __VeltoIDDBCreateVeltoIDAccount(const String& name, const String& hashedPassword,
                                     const String& encDsId) {
    if (!name) return false;
    return database::perform([&](Store& store) {
        // Before the password goes anywhere: an item that no record names would never be found again.
        if (!store.isLoaded()) return false;
        const Dictionary* existing = Store::find(store.accounts, name);
        Dictionary record = existing != nullptr
                                ? *existing
                                : Dictionary{{kVeltoIDAccountCreationDateKey, Value::date(platform::now())}};
        record.set(kVeltoIDAccountNameKey, name);
        record.set(kVeltoIDAccountDSIDKey, encDsId);
        if (hashedPassword && !storePassword(name, hashedPassword, record)) return false;
        if (hashedPassword)
            for (const auto key : {kVeltoIDAccountClientTooOldKey, kVeltoIDAccountClientTooOldVersionKey})
                record.remove(key);
        if (!record.contains(kVeltoIDAccountUUIDKey) || !record.contains(kVeltoIDAccountStableUUIDKey))
            database::deriveAccountUUIDs(name, record, store.metaInfo);
        markDirty(record);
        return store.set(&Store::accounts, name, record, Notify::Yes);
    });
}

String __VeltoIDDBCopyHashedPassword(const AccountRecord& record) {
    String password;
    if (copyPasswordFromKeychainGivenPersistentRef(record.passwordReference(), &password)) return password;
    return record.ownPasswordHash();
}

bool __VeltoIDDBRemovePassword(const String& name) {
    return database::perform([&](Store& store) {
        const Dictionary* existing = Store::find(store.accounts, name);
        if (existing == nullptr) return false;
        if (!existing->contains(kVeltoIDAccountHashedPasswordKey) &&
            !existing->contains(kVeltoIDAccountHashedPasswordKeychainReferenceKey))
            return true;
        Dictionary record = *existing;
        record.remove(kVeltoIDAccountHashedPasswordKey);
        removePasswordFromKeychainGivenPersistentRef(
            record.data(kVeltoIDAccountHashedPasswordKeychainReferenceKey));
        record.remove(kVeltoIDAccountHashedPasswordKeychainReferenceKey);
        markDirty(record);
        return store.set(&Store::accounts, name, record, Notify::Yes);
    });
}

bool __VeltoIDDBSetAccountValues(const String& name, const Dictionary& values, Notify notify) {
    if (!name || values.empty()) return false;
    return database::perform([&](Store& store) {
        const Dictionary* existing = Store::find(store.accounts, name);
        if (existing == nullptr) return false;
        Dictionary record = *existing;
        bool changed = false;
        bool significant = false;
        for (const auto& [key, value] : values) {
            changed = database::change(record, key, value) || changed;
            significant = significant || (key.view() != kVeltoIDAccountModificationDateKey &&
                                          key.view() != kVeltoIDDirtyKey);
        }
        if (!changed) return true;
        record.set(kVeltoIDAccountModificationDateKey, Value::date(platform::now()));
        if (notify == Notify::Yes && values.boolean(kVeltoIDDirtyKey) != false)
            record.set(kVeltoIDDirtyKey, Value::boolean(true));
        return store.set(&Store::accounts, name, record, significant ? notify : Notify::No);
    });
}

bool __VeltoIDDBSetAccountValue(const String& name, const String& key, const Value& value, Notify notify) {
    if (!key) return false;
    return __VeltoIDDBSetAccountValues(name, {{key.view(), value.isAbsent() ? Value::null() : value}},
                                       notify);
}

Value __VeltoIDDBCopyAccountValue(const String& name, const String& key) {
    return database::perform([&](const Store& store) {
        const Dictionary* record = Store::find(store.accounts, name);
        return record != nullptr && key ? (*record)[key.view()] : Value();
    });
}

bool __VeltoIDDBRemoveVeltoIDAccount(const String& name, ErrorOut error) {
    if (!name)
        return failWith(error, makeStatusError("No account was named", __func__, __FILE_NAME__, __LINE__));
    return database::perform([&](Store& store) {
        const bool exists = store.accounts.contains(name.view());
        if (store.remove(&Store::accounts, name)) return true;
        return failWith(
            error, VELTOID_ERROR_FROM("__VeltoIDDBRemoveVeltoIDAccount",
                                      exists ? identity_error::kUnspecified : missingAccountCode(store)));
    });
}

bool __VeltoIDDBRemoveVeltoIDAccountAndPassword(const String& name, AccountRecord* removed) {
    return database::perform([&](Store& store) {
        const auto record = recordOf(store, name);
        if (!record || !store.remove(&Store::accounts, name)) return false;
        removePasswordFromKeychainGivenPersistentRef(record->passwordReference());
        *removed = *record;
        return true;
    });
}

std::optional<Array> __VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks marks) {
    return database::perform([&](Store& store) -> std::optional<Array> {
        Array names;
        for (const auto& [name, value] : store.accounts) {
            const Dictionary* record = value.asDictionary();
            if (record != nullptr && AccountRecord(name, *record).isDirty()) names.append(name);
        }
        if (marks != DirtyMarks::Keep) removeDirtyMarks(store.accounts);
        if (marks == DirtyMarks::ClearAll) removeDirtyMarks(store.certificates);
        if (names.empty()) return std::nullopt;
        return names;
    });
}

bool __VeltoIDDBDeriveAccountUUIDs(const String& name, Dictionary& record) {
    return database::perform(
        [&](const Store& store) { return database::deriveAccountUUIDs(name, record, store.metaInfo); });
}

bool __VeltoIDDBHasValidCertificate(const String& name) {
    return hasValidCertificateEntry(accountRecordOf(name).encDsId());
}

bool __VeltoIDDBHasCertificateToken(const String& name) {
    return __VeltoIDDBCopyAccountValue(name, kVeltoIDAccountCertificateTokenKey).isString();
}

}  // namespace veltoid
