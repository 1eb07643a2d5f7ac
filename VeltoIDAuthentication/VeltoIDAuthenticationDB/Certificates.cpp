#include "VeltoIDAuthenticationDB/Certificates.h"

#include "Platform/Clock.h"
#include "VeltoIDAuthenticationDB/Keys.h"
#include "VeltoIDAuthenticationDB/Store.h"

namespace veltoid {
namespace {

using database::Store;

constexpr database::Sections kCertificatesSection{false, true, false};

Value now() { return Value::date(platform::Clock::shared().now()); }

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

bool __VeltoIDDBCopyCertificateKeys(Array* keys, ErrorOut /*error*/) {
    Array all = database::perform([](const Store& store) {
        Array names;
        for (const auto& [encDsId, entry] : store.certificates) names.append(encDsId);
        return names;
    });
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
        store.certificates.set(encDsId, entry);
        store.writeSections(kCertificatesSection, true);
        return true;
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
        store.certificates.set(encDsId, entry);
        store.writeSections(kCertificatesSection, signal && !isMark && key.view() != "ModificationDate");
        return true;
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
        if (!encDsId || !store.certificates.remove(encDsId.view())) return false;
        store.writeSections(kCertificatesSection, true);
        return true;
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
