#include "VeltoIDAuthenticationDB/CertificateEntries.h"

#include <vector>

#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"

namespace veltoid {
namespace {

using database::Store;

void applyInfo(Dictionary& entry, const Dictionary& info) {
    entry.set(kVeltoIDCertificateCertificatePersistentReferenceKey,
              info.data(kVeltoIDCertificateCertificatePersistentReferenceKey));
    for (const std::string_view key : {kVeltoIDCertificateExpirationDateKey, kVeltoIDCertificateStatusKey})
        database::change(entry, key, info[key]);
    database::change(entry, kVeltoIDCertificateSerialNumberKey,
                     info.string(kVeltoIDCertificateSerialNumberKey));
}

CertificateEntry entryOf(const Store& store, const String& encDsId) {
    const Dictionary* found = Store::find(store.certificates, encDsId);
    return found != nullptr ? CertificateEntry(encDsId, *found) : CertificateEntry();
}

/// Stores the certificates as they are now; with a notification the accounts of the encDsId count as changed,
/// since the account check looks at accounts.
bool storeCertificates(Store& store, const String& encDsId, Dictionary certificates, Notify notify) {
    std::vector<Store::Change> changes = {{&Store::certificates, std::move(certificates)}};
    if (notify == Notify::Yes) {
        Dictionary accounts = store.accounts;
        for (const auto& [name, value] : store.accounts) {
            const Dictionary* record = value.asDictionary();
            if (record == nullptr || record->string(kVeltoIDAccountDSIDKey) != encDsId) continue;
            Dictionary marked = *record;
            marked.set(kVeltoIDDirtyKey, Value::boolean(true));
            accounts.set(name, marked);
        }
        changes.push_back({&Store::accounts, std::move(accounts)});
    }
    return store.replace(std::move(changes), notify);
}

bool storeEntry(Store& store, const String& encDsId, const Dictionary& entry, Notify notify) {
    Dictionary certificates = store.certificates;
    certificates.set(encDsId, entry);
    return storeCertificates(store, encDsId, std::move(certificates), notify);
}

/// Only a significant change marks the entry and notifies.
bool setValues(Store& store, const String& encDsId, const Dictionary& values, Notify notify) {
    const Dictionary* existing = Store::find(store.certificates, encDsId);
    if (existing == nullptr) return false;
    Dictionary entry = *existing;
    bool changed = false;
    bool isMarked = false;
    bool significant = false;
    for (const auto& [key, value] : values) {
        if (!database::change(entry, key, value)) continue;
        changed = true;
        isMarked = isMarked || key.view() == kVeltoIDDirtyKey;
        significant = significant || (key.view() != kVeltoIDDirtyKey &&
                                      key.view() != kVeltoIDCertificateModificationDateKey);
    }
    if (!changed) return true;
    entry.set(kVeltoIDCertificateModificationDateKey, Value::date(platform::now()));
    if (notify == Notify::Yes && !isMarked) entry.set(kVeltoIDDirtyKey, Value::boolean(true));
    return storeEntry(store, encDsId, entry, significant ? notify : Notify::No);
}

}  // namespace

bool __VeltoIDDBCopyCertificateKeys(Array* keys, ErrorOut error) {
    return database::perform([&](const Store& store) {
        if (!store.isLoaded())
            return failWith(error, VELTOID_ERROR_FROM("__VeltoIDDBCopyCertificateKeys",
                                                      identity_error::kNoCertificateForAccount));
        fill(keys, database::keysOf(store.certificates));
        return true;
    });
}

bool __VeltoIDDBSetCertificateInfo(const String& encDsId, const std::optional<Dictionary>& info) {
    if (!encDsId) return false;
    return database::perform([&](Store& store) {
        const Dictionary* existing = Store::find(store.certificates, encDsId);
        Dictionary entry =
            existing != nullptr
                ? *existing
                : Dictionary{{kVeltoIDCertificateCreationDateKey, Value::date(platform::now())}};
        if (info) {
            entry.set(kVeltoIDAccountDSIDKey, encDsId);
            applyInfo(entry, *info);
        } else {
            entry = Dictionary();
        }
        entry.set(kVeltoIDDirtyKey, Value::boolean(true));
        entry.set(kVeltoIDCertificateModificationDateKey, Value::date(platform::now()));
        return storeEntry(store, encDsId, entry, Notify::Yes);
    });
}

bool __VeltoIDDBSetCertificateValue(const String& encDsId, const String& key, const Value& value,
                                    Notify notify) {
    if (!key) return false;
    return __VeltoIDDBSetCertificateValues(encDsId, {{key.view(), value.isAbsent() ? Value::null() : value}},
                                           notify);
}

bool __VeltoIDDBSetCertificateValues(const String& encDsId, const Dictionary& values, Notify notify) {
    if (!encDsId) return false;
    return database::perform([&](Store& store) { return setValues(store, encDsId, values, notify); });
}

bool __VeltoIDDBSetCertificateValues(const CertificateEntry& examined, const Dictionary& values,
                                     Notify notify) {
    if (!examined.exists()) return false;
    return database::perform([&](Store& store) {
        return examined.isSameCertificateAs(entryOf(store, examined.encDsId())) &&
               setValues(store, examined.encDsId(), values, notify);
    });
}

bool __VeltoIDDBCopyCertificateInfo(const String& encDsId, CertificateEntry* entry) {
    CertificateEntry found = certificateEntryOf(encDsId);
    const bool exists = found.exists();
    if (exists) fill(entry, std::move(found));
    return exists;
}

CertificateEntry certificateEntryOf(const String& encDsId) {
    return database::perform([&](const Store& store) { return entryOf(store, encDsId); });
}

bool __VeltoIDDBRemoveCertificateInfo(const String& encDsId) {
    return database::perform([&](Store& store) {
        Dictionary certificates = store.certificates;
        return encDsId && certificates.remove(encDsId.view()) &&
               storeCertificates(store, encDsId, std::move(certificates), Notify::Yes);
    });
}

bool hasValidCertificateEntry(const String& encDsId) {
    const CertificateEntry entry = certificateEntryOf(encDsId);
    const auto expires = entry.expires();
    if (!entry.isIssued() || (expires && *expires <= platform::now() - kVeltoIDCertificateExpirationGrace))
        return false;
    std::optional<platform::Certificate> certificate;
    copyCertificateFromKeychainGivenPersistentRef(entry.reference(), &certificate);
    return !certificate || certificate->notAfter > platform::now();
}

}  // namespace veltoid
