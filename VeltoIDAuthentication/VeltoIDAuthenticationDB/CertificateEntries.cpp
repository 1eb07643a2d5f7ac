#include "VeltoIDAuthenticationDB/CertificateEntries.h"

#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/Store.h"

namespace veltoid {
namespace {

using database::Store;

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
        fillError(error, identityError(identity_error::kNoCertificateForAccount));
        return false;
    }
    if (keys != nullptr) *keys = std::move(all);
    return true;
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
        return store.set(&Store::certificates, encDsId, entry, Notify::Yes);
    });
}

bool __VeltoIDDBSetCertificateValue(const String& encDsId, const String& key, const Value& value,
                                    Notify notify) {
    if (!encDsId || !key) return false;
    return database::perform([&](Store& store) {
        const Dictionary* existing = Store::find(store.certificates, encDsId);
        if (existing == nullptr) return false;
        Dictionary entry = *existing;
        const bool removes = value.isAbsent() || value.isNull();
        if (removes ? !entry.contains(key.view()) : entry[key.view()] == value) return true;
        copyOrRemove(entry, key.view(), removes ? Value() : value);

        const bool isMark = key.view() == kVeltoIDDirtyKey;
        entry.set(kVeltoIDCertificateModificationDateKey, Value::date(platform::now()));
        if (isMark) notify = Notify::No;
        if (notify == Notify::Yes) entry.set(kVeltoIDDirtyKey, Value::boolean(true));
        if (key.view() == kVeltoIDCertificateModificationDateKey) notify = Notify::No;
        return store.set(&Store::certificates, encDsId, entry, notify);
    });
}

bool __VeltoIDDBCopyCertificateInfo(const String& encDsId, CertificateEntry* entry) {
    return database::perform([&](const Store& store) {
        const Dictionary* found = Store::find(store.certificates, encDsId);
        if (found != nullptr && entry != nullptr) *entry = CertificateEntry(encDsId, *found);
        return found != nullptr;
    });
}

bool __VeltoIDDBRemoveCertificateInfo(const String& encDsId) {
    return database::perform([&](Store& store) {
        Dictionary certificates = store.certificates;
        return encDsId && certificates.remove(encDsId.view()) &&
               store.replace(&Store::certificates, std::move(certificates), Notify::Yes);
    });
}

bool hasValidCertificateEntry(const String& encDsId) {
    CertificateEntry entry;
    if (!__VeltoIDDBCopyCertificateInfo(encDsId, &entry) || !entry.isIssued()) return false;
    const auto expires = entry.expires();
    return !expires || *expires > platform::now() - kVeltoIDCertificateExpirationGrace;
}

}  // namespace veltoid
