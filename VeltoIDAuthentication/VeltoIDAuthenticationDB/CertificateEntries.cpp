#include "VeltoIDAuthenticationDB/CertificateEntries.h"

#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/Store.h"

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

}  // namespace

bool __VeltoIDDBCopyCertificateKeys(Array* keys, ErrorOut error) {
    return database::perform([&](const Store& store) {
        if (!store.isLoaded())
            return failWith(error, identityError(identity_error::kNoCertificateForAccount));
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
        if (!database::change(entry, key, value)) return true;

        const bool isMark = key.view() == kVeltoIDDirtyKey;
        entry.set(kVeltoIDCertificateModificationDateKey, Value::date(platform::now()));
        if (isMark) notify = Notify::No;
        if (notify == Notify::Yes) entry.set(kVeltoIDDirtyKey, Value::boolean(true));
        if (key.view() == kVeltoIDCertificateModificationDateKey) notify = Notify::No;
        return store.set(&Store::certificates, encDsId, entry, notify);
    });
}

bool __VeltoIDDBCopyCertificateInfo(const String& encDsId, CertificateEntry* entry) {
    CertificateEntry found = certificateEntryOf(encDsId);
    const bool exists = found.exists();
    if (exists) fill(entry, std::move(found));
    return exists;
}

CertificateEntry certificateEntryOf(const String& encDsId) {
    return database::perform([&](const Store& store) {
        const Dictionary* found = Store::find(store.certificates, encDsId);
        return found != nullptr ? CertificateEntry(encDsId, *found) : CertificateEntry();
    });
}

bool __VeltoIDDBRemoveCertificateInfo(const String& encDsId) {
    return database::perform([&](Store& store) { return store.remove(&Store::certificates, encDsId); });
}

bool hasValidCertificateEntry(const String& encDsId) {
    const CertificateEntry entry = certificateEntryOf(encDsId);
    const auto expires = entry.expires();
    return entry.isIssued() && (!expires || *expires > platform::now() - kVeltoIDCertificateExpirationGrace);
}

}  // namespace veltoid
