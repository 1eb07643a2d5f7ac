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

/// A semaphore, since simulated time goes on while a task waits for one, but not while it waits for a mutex.
struct Ownership {
    const platform::Semaphore semaphore{1};
};

const platform::Semaphore& ownershipSemaphore() {
    return platform::Lifetime::current().state<Ownership>().semaphore;
}

bool isReferredTo(const Data& reference) {
    Array encDsIds;
    __VeltoIDDBCopyCertificateKeys(&encDsIds);
    return std::any_of(encDsIds.begin(), encDsIds.end(), [&](const Value& encDsId) {
        CertificateEntry entry;
        return __VeltoIDDBCopyCertificateInfo(encDsId.asString(), &entry) &&
               (entry.reference() == reference || entry.privateKeyReference() == reference ||
                entry.intermediateReference() == reference);
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
    const Data reference =
        __VeltoIDDBCopyAccountValue(accountName, kVeltoIDCertificatePrivateKeyPersistentReferenceKey)
            .asData();
    if (!reference) return;
    removeKeyFromKeychainGivenPersistentRef(reference);
    __VeltoIDDBSetAccountValue(accountName, kVeltoIDCertificatePrivateKeyPersistentReferenceKey,
                               Value::null(), Notify::No);
}

void discardReplacedItems(const OwnershipLock& /*ownership*/, const CertificateEntry& before,
                          const CertificateEntry& after) {
    // A removal without reference does nothing.
    if (before.reference() != after.reference())
        removeCertificateFromKeychainGivenPersistentRef(before.reference());
    if (before.privateKeyReference() != after.privateKeyReference())
        removeKeyFromKeychainGivenPersistentRef(before.privateKeyReference());
    const Data intermediate = before.intermediateReference();
    if (intermediate && intermediate != after.intermediateReference() && !isReferredTo(intermediate))
        removeCertificateFromKeychainGivenPersistentRef(intermediate);
}

void discardCertificate(const OwnershipLock& ownership, const String& encDsId, const DroppedItems& dropped) {
    CertificateEntry entry;
    if (!__VeltoIDDBCopyCertificateInfo(encDsId, &entry)) return;
    __VeltoIDDBRemoveCertificateInfo(encDsId);
    Dictionary kept;
    if (!dropped.certificate)
        kept.set(kVeltoIDCertificateCertificatePersistentReferenceKey, entry.reference());
    if (!dropped.privateKey)
        kept.set(kVeltoIDCertificatePrivateKeyPersistentReferenceKey, entry.privateKeyReference());
    discardReplacedItems(ownership, entry, {encDsId, kept});
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
