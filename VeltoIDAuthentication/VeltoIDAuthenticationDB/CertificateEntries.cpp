#include "VeltoIDAuthenticationDB/CertificateEntries.h"

#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/Store.h"

namespace veltoid {
namespace {

using database::Store;

Value now() { return Value::date(platform::Clock::shared().now()); }

/// Stores the entry and writes the section.
bool storeEntry(Store& store, const String& encDsId, const Dictionary& entry, bool signal) {
    Dictionary certificates = store.certificates;
    certificates.set(encDsId, entry);
    return store.replace(&Store::certificates, std::move(certificates), signal);
}

/// Copies the info's value when there is one, else removes the entry's.
void copyOrRemove(Dictionary& entry, std::string_view key, const Value& value) {
    if (value.isAbsent()) {
        entry.remove(key);
    } else {
        entry.set(key, value);
    }
}

void applyInfo(Dictionary& entry, const Dictionary& info) {
    entry.set(kVeltoIDCertificateCertificatePersistentReferenceKey,
              info.data(kVeltoIDCertificateCertificatePersistentReferenceKey));
    for (const std::string_view key : {kVeltoIDCertificateExpirationDateKey, kVeltoIDCertificateStatusKey})
        copyOrRemove(entry, key, info[key]);
    copyOrRemove(entry, kVeltoIDCertificateSerialNumberKey, info.string(kVeltoIDCertificateSerialNumberKey));
}

}  // namespace

bool __VeltoIDDBCopyCertificateKeys(Array* keys, ErrorOut error) {
    bool loaded = false;
    Array all = database::perform([&](const Store& store) {
        loaded = store.isLoaded();
        Array names;
        for (const auto& [encDsId, entry] : store.certificates) names.append(encDsId);
        return names;
    });
    if (!loaded) {
        fillError(error, Error{String(kIdentityErrorDomain), identity_error::kNoCertificateForAccount, {}});
        return false;
    }
    if (keys != nullptr) *keys = std::move(all);
    return true;
}

bool __VeltoIDDBSetCertificateInfo(const String& encDsId, const std::optional<Dictionary>& info) {
    if (!encDsId) return false;
    return database::perform([&](Store& store) {
        const Dictionary* existing = Store::find(store.certificates, encDsId);
        Dictionary entry = existing != nullptr ? *existing : Dictionary{{"CreationDate", now()}};
        if (info) {
            entry.set(kVeltoIDAccountDSIDKey, encDsId);
            applyInfo(entry, *info);
        } else {
            entry = Dictionary();
        }
        entry.set(kVeltoIDDirtyKey, Value::boolean(true));
        entry.set("ModificationDate", now());
        return storeEntry(store, encDsId, entry, true);
    });
}

bool __VeltoIDDBSetCertificateValue(const String& encDsId, const String& key, const Value& value,
                                    bool signal) {
    if (!encDsId || !key) return false;
    return database::perform([&](Store& store) {
        const Dictionary* existing = Store::find(store.certificates, encDsId);
        if (existing == nullptr) return false;
        Dictionary entry = *existing;
        const bool removes = value.isAbsent() || value.isNull();
        if (removes ? !entry.contains(key.view()) : entry[key.view()] == value) return true;
        copyOrRemove(entry, key.view(), removes ? Value() : value);

        const bool isMark = key.view() == kVeltoIDDirtyKey;
        entry.set("ModificationDate", now());
        if (signal && !isMark) entry.set(kVeltoIDDirtyKey, Value::boolean(true));
        return storeEntry(store, encDsId, entry, signal && !isMark && key.view() != "ModificationDate");
    });
}

bool __VeltoIDDBCopyCertificateInfo(const String& encDsId, Dictionary* entry) {
    return database::perform([&](const Store& store) {
        const Dictionary* found = Store::find(store.certificates, encDsId);
        if (found != nullptr && entry != nullptr) *entry = *found;
        return found != nullptr;
    });
}

bool __VeltoIDDBRemoveCertificateInfo(const String& encDsId) {
    return database::perform([&](Store& store) {
        Dictionary certificates = store.certificates;
        return encDsId && certificates.remove(encDsId.view()) &&
               store.replace(&Store::certificates, std::move(certificates), true);
    });
}

bool hasValidCertificateEntry(const String& encDsId) {
    Dictionary entry;
    if (!encDsId || !__VeltoIDDBCopyCertificateInfo(encDsId, &entry)) return false;
    if (entry.string(kVeltoIDCertificateStatusKey).view() != kVeltoIDCertificateStatusIssued) return false;
    const std::optional<double> expires = entry.date(kVeltoIDCertificateExpirationDateKey);
    return !expires || *expires > platform::Clock::shared().now() - kVeltoIDCertificateExpirationGrace;
}

}  // namespace veltoid
