#include "VeltoIDAuthenticationDB/AccountRecords.h"

#include <algorithm>
#include <vector>

#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountUUIDs.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/KeychainIdentity.h"
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

/// A password on its way into the keychain, with its reference on the way into a record.
class PasswordChange {
  public:
    PasswordChange(const String& name, const Dictionary& record)
        : name_(name), referenceBefore_(record.data(kVeltoIDAccountHashedPasswordKeychainReferenceKey)) {
        copyPasswordFromKeychainGivenPersistentRef(referenceBefore_, &before_);
    }

    bool make(const String& hashedPassword, Dictionary& record) {
        if (before_ && before_ == hashedPassword) {
            VELTOID_LOG_FROM("__VeltoIDDBCreateVeltoIDAccount", kNotice, "Password being added for account ",
                             name_, " matches password on keychain, so skipping over addPasswordToKeychain");
            return true;
        }
        if (!addPasswordToKeychain(name_, hashedPassword, nullptr, &reference_)) return false;
        record.set(kVeltoIDAccountHashedPasswordKeychainReferenceKey, reference_);
        return true;
    }

    /// The record is stored: an item that it named before has no owner any more.
    void keep() const {
        if (before_ && reference_ && reference_ != referenceBefore_)
            removePasswordFromKeychainGivenPersistentRef(referenceBefore_);
    }

    /// The record could not be stored.
    void takeBack() const {
        if (!reference_) return;
        if (before_ && reference_ == referenceBefore_)
            addPasswordToKeychain(name_, before_, nullptr, nullptr);
        else
            removePasswordFromKeychainGivenPersistentRef(reference_);
    }

  private:
    const String& name_;
    const Data referenceBefore_;
    String before_;
    /// Null while nothing was changed.
    Data reference_;
};

void markDirty(Dictionary& record) {
    record.set(kVeltoIDDirtyKey, Value::boolean(true));
    record.set(kVeltoIDAccountModificationDateKey, Value::date(platform::now()));
}

Error notStored(int line) {
    return makeError(identity_error::kUnknown,
                     {"The change could not be stored; nothing was changed.", {}, {}}, {},
                     "__VeltoIDDBRemoveVeltoIDAccountAndPassword", __FILE_NAME__, line);
}

/// Where records and entries refer to items of the keychain.
constexpr std::string_view kReferenceKeys[] = {kVeltoIDAccountHashedPasswordKeychainReferenceKey,
                                               kVeltoIDCertificateCertificatePersistentReferenceKey,
                                               kVeltoIDCertificatePrivateKeyPersistentReferenceKey,
                                               kVeltoIDCertificateIntermediateCertificateReferenceKey};

Array keptItems(const Store& store) {
    const Array* kept = store.metaInfo.array(kVeltoIDMetaKeptKeychainItemsKey);
    return kept != nullptr ? *kept : Array();
}

/// The sections as they are when the account is gone.
std::vector<Store::Change> withoutAccount(const Store& store, const AccountRecord& record,
                                          const UnownedItems& items) {
    Dictionary accounts = store.accounts;
    Dictionary certificates = store.certificates;
    Dictionary metaInfo = store.metaInfo;
    accounts.remove(record.accountName().view());
    const String encDsId = record.encDsId();
    const bool isShared = std::any_of(accounts.begin(), accounts.end(), [&](const auto& other) {
        const Dictionary* values = other.value.asDictionary();
        return values != nullptr && values->string(kVeltoIDAccountDSIDKey) == encDsId;
    });
    if (encDsId && !isShared) certificates.remove(encDsId.view());
    if (metaInfo[record.accountName().view()].isDictionary()) metaInfo.remove(record.accountName().view());
    Array kept = items.wanted;
    for (const Value& item : keptItems(store))
        if (std::find(items.unwanted.begin(), items.unwanted.end(), item) == items.unwanted.end())
            kept.append(item);
    database::change(metaInfo, kVeltoIDMetaKeptKeychainItemsKey, kept.empty() ? Value() : Value(kept));
    return {{&Store::accounts, accounts}, {&Store::certificates, certificates}, {&Store::metaInfo, metaInfo}};
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

AccountRecord::Date AccountRecord::embargoEnd(double now) const {
    const Date end = date(kVeltoIDAccountEarliestAllowedConnectionDateKey);
    return end && *end > now && *end <= now + kMaxEmbargo ? end : std::nullopt;
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
        PasswordChange password(name, record);
        if (hashedPassword && !password.make(hashedPassword, record)) return false;
        if (hashedPassword)
            for (const auto key : {kVeltoIDAccountClientTooOldKey, kVeltoIDAccountClientTooOldVersionKey,
                                   kVeltoIDAccountNextCheckDateKey, kVeltoIDAccountCheckBackOffKey})
                record.remove(key);
        if (hashedPassword) database::adoptKeychain(store);
        if (!record.contains(kVeltoIDAccountUUIDKey) || !record.contains(kVeltoIDAccountStableUUIDKey))
            database::deriveAccountUUIDs(name, record, store.metaInfo);
        markDirty(record);
        const bool stored = store.set(&Store::accounts, name, record, Notify::Yes);
        stored ? password.keep() : password.takeBack();
        return stored;
    });
}

String __VeltoIDDBCopyHashedPassword(const AccountRecord& record) {
    String password;
    if (copyPasswordFromKeychainGivenPersistentRef(record.passwordReference(), &password)) return password;
    return record.ownPasswordHash();
}

bool __VeltoIDDBRemovePassword(const String& name, const String& refusedHash) {
    return database::perform([&](Store& store) {
        const auto existing = recordOf(store, name);
        if (!existing || (refusedHash && existing->hasPassword() &&
                          __VeltoIDDBCopyHashedPassword(*existing) != refusedHash))
            return false;
        Dictionary record = existing->values();
        const bool hasOwn = record.remove(kVeltoIDAccountHashedPasswordKey);
        const bool hasReference = record.remove(kVeltoIDAccountHashedPasswordKeychainReferenceKey);
        if (!hasOwn && !hasReference) return true;
        markDirty(record);
        if (!store.set(&Store::accounts, name, record, Notify::Yes)) return false;
        removePasswordFromKeychainGivenPersistentRef(existing->passwordReference());
        return true;
    });
}

bool __VeltoIDDBSetAccountValues(const String& name, const Dictionary& values, Notify notify) {
    return setAccountValuesIf(nullptr, {name, {}}, values, notify);
}

bool setAccountValuesIf(RecordCondition condition, const AccountRecord& examined, const Dictionary& values,
                        Notify notify) {
    const String& name = examined.accountName();
    if (!name || values.empty()) return false;
    return database::perform([&](Store& store) {
        const auto existing = recordOf(store, name);
        if (!existing || (condition != nullptr && !condition(*existing, examined))) return false;
        Dictionary record = existing->values();
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

bool __VeltoIDDBRemoveVeltoIDAccountAndPassword(const String& name, const UnownedItems& items,
                                                AccountRecord* removed, ErrorOut error) {
    constexpr const char* kFunction = "__VeltoIDDBRemoveVeltoIDAccountAndPassword";
    return database::perform([&](Store& store) {
        const auto record = recordOf(store, name);
        if (!record) return failWith(error, VELTOID_ERROR_FROM(kFunction, missingAccountCode(store)));
        const Dictionary before[] = {store.accounts, store.certificates, store.metaInfo};
        if (!store.replace(withoutAccount(store, *record, items), Notify::Yes))
            return failWith(error, notStored(__LINE__));
        const Data password = record->passwordReference();
        if (!removePasswordFromKeychainGivenPersistentRef(password) && keychainHasPasswordItem(password) &&
            store.replace({{&Store::accounts, before[0]},
                           {&Store::certificates, before[1]},
                           {&Store::metaInfo, before[2]}},
                          Notify::No))
            return failWith(error, notStored(__LINE__));
        fill(removed, *record);
        return true;
    });
}

std::optional<Array> referencesInUse() {
    return database::perform([](const Store& store) -> std::optional<Array> {
        if (!store.isLoaded()) return std::nullopt;
        Array references = keptItems(store);
        for (const Dictionary* section : {&store.accounts, &store.certificates})
            for (const auto& [key, value] : *section)
                if (const Dictionary* entry = value.asDictionary())
                    for (const std::string_view reference : kReferenceKeys)
                        if (const Data item = entry->data(reference)) references.append(item);
        return references;
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
