#include "VeltoIDAuthenticationImpl/ItemOwnership.h"

#include <algorithm>

#include "Certificates/CertificateRequest.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"

namespace veltoid {
namespace {

constexpr std::string_view kCertificateKey = kVeltoIDCertificateCertificatePersistentReferenceKey;
constexpr std::string_view kPrivateKeyKey = kVeltoIDCertificatePrivateKeyPersistentReferenceKey;
constexpr std::string_view kIntermediateKey = kVeltoIDCertificateIntermediateCertificateReferenceKey;

/// A semaphore, so that time stands still neither for the one who waits nor for the one who is waited for.
struct Ownership {
    const platform::Semaphore semaphore{1};
};

const platform::Semaphore& ownershipSemaphore() {
    return platform::Lifetime::current().state<Ownership>().semaphore;
}

/// The reference under the key, if the other dictionary has another one or none.
Data replacedReference(const Dictionary& before, const Dictionary& after, std::string_view key) {
    const Data reference = before.data(key);
    return reference == after.data(key) ? Data() : reference;
}

bool isReferredTo(const Data& reference) {
    Array encDsIds;
    __VeltoIDDBCopyCertificateKeys(&encDsIds);
    return std::any_of(encDsIds.begin(), encDsIds.end(), [&](const Value& encDsId) {
        Dictionary entry;
        return __VeltoIDDBCopyCertificateInfo(encDsId.asString(), &entry) &&
               (entry.data(kCertificateKey) == reference || entry.data(kPrivateKeyKey) == reference ||
                entry.data(kIntermediateKey) == reference);
    });
}

void removeUnlessReferredTo(const std::optional<Array>& references, bool (*remove)(const Data& reference)) {
    if (!references) return;
    for (const Value& reference : *references)
        if (!isReferredTo(reference.asData())) remove(reference.asData());
}

}  // namespace

OwnershipLock::OwnershipLock() {
    while (!ownershipSemaphore().wait(platform::kForever)) {
    }
}
OwnershipLock::~OwnershipLock() { ownershipSemaphore().signal(); }

void discardPendingKey(const OwnershipLock& /*ownership*/, const String& accountName) {
    const Data reference = __VeltoIDDBCopyAccountValue(accountName, kPrivateKeyKey).asData();
    if (!reference) return;
    removeKeyFromKeychainGivenPersistentRef(reference);
    __VeltoIDDBSetAccountValue(accountName, kPrivateKeyKey, Value::null(), false);
}

void discardReplacedItems(const OwnershipLock& /*ownership*/, const Dictionary& before,
                          const Dictionary& after) {
    if (const Data reference = replacedReference(before, after, kCertificateKey))
        removeCertificateFromKeychainGivenPersistentRef(reference);
    if (const Data reference = replacedReference(before, after, kPrivateKeyKey))
        removeKeyFromKeychainGivenPersistentRef(reference);
    const Data intermediate = replacedReference(before, after, kIntermediateKey);
    if (intermediate && !isReferredTo(intermediate))
        removeCertificateFromKeychainGivenPersistentRef(intermediate);
}

void discardCertificate(const OwnershipLock& ownership, const String& encDsId, const DroppedItems& dropped) {
    if (!encDsId) return;
    Dictionary entry;
    __VeltoIDDBCopyCertificateInfo(encDsId, &entry);
    __VeltoIDDBRemoveCertificateInfo(encDsId);
    if (!dropped.certificate) entry.remove(kCertificateKey);
    if (!dropped.privateKey) entry.remove(kPrivateKeyKey);
    discardReplacedItems(ownership, entry, {});
}

void discardStrayItems(const OwnershipLock& /*ownership*/, const String& accountName,
                       const DroppedItems& dropped) {
    if (dropped.privateKey)
        removeUnlessReferredTo(copyKeysFromKeychainGivenOwner(accountName, kPrivateKeyKind),
                               removeKeyFromKeychainGivenPersistentRef);
    if (dropped.certificate)
        removeUnlessReferredTo(
            copyCertificatesFromKeychainGivenLabel(certificateLabelForAccount(accountName)),
            removeCertificateFromKeychainGivenPersistentRef);
}

}  // namespace veltoid
