#include "VeltoIDAuthenticationImpl/ItemOwnership.h"

#include <algorithm>
#include <set>
#include <string>

#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/KeychainIdentity.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"
#include "VeltoIDKeychainItems/KeychainPasswords.h"

namespace veltoid {
namespace {

/// A semaphore, since simulated time goes on while a task waits for one, but not while it waits for a mutex:
/// the keychain and the database, which are asked under the lock, may wait for a file.
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
        const CertificateEntry entry = certificateEntryOf(encDsId.asString());
        return entry.reference() == reference || entry.privateKeyReference() == reference ||
               entry.intermediateReference() == reference;
    });
}

/// The items are listed before the references: an item is stored together with its reference, so that one
/// that is listed and has none by then is nobody's.
void discardOrphans() {
    if (!keychainIsOurs()) return;
    const struct {
        std::optional<Array> items;
        bool (*remove)(const Data& reference);
    } kinds[] = {{copyAllPasswordsFromKeychain(), removePasswordFromKeychainGivenPersistentRef},
                 {copyAllKeysFromKeychain(), removeKeyFromKeychainGivenPersistentRef},
                 {copyAllCertificatesFromKeychain(), removeCertificateFromKeychainGivenPersistentRef}};
    const auto inUse = referencesInUse();
    if (!inUse) return;
    for (const auto& [items, remove] : kinds) {
        if (!items) continue;
        for (const Value& item : *items) {
            if (std::find(inUse->begin(), inUse->end(), item) != inUse->end()) continue;
            VELTOID_LOG_FROM("__VeltoIDCleanupAccountsAndCertificates", kNotice,
                             "Removing an item from the keychain that belongs to no account: ", item);
            remove(item.asData());
        }
    }
}

/// The encDsIds of all accounts; lifts their embargoes on the way.
std::set<std::string> encDsIdsOfAccounts() {
    std::set<std::string> encDsIds;
    for (const Value& name : accountNames()) {
        const AccountRecord record = accountRecordOf(name.asString());
        if (const String encDsId = record.encDsId()) encDsIds.insert(encDsId.text());
        if (record.values().contains(kVeltoIDAccountEarliestAllowedConnectionDateKey) &&
            !record.embargoEnd(platform::now()))
            __VeltoIDDBSetAccountValue(name.asString(), kVeltoIDAccountEarliestAllowedConnectionDateKey,
                                       Value::null(), Notify::No);
    }
    return encDsIds;
}

bool isOfUse(const String& encDsId) {
    const CertificateEntry entry = certificateEntryOf(encDsId);
    return !entry.isInvalid() &&
           entry.values().contains(kVeltoIDCertificateCertificatePersistentReferenceKey) &&
           entry.values().contains(kVeltoIDCertificatePrivateKeyPersistentReferenceKey);
}

}  // namespace

OwnershipLock::OwnershipLock() {
    while (!ownershipSemaphore().wait(platform::kForever)) {
    }
}
OwnershipLock::~OwnershipLock() { ownershipSemaphore().signal(); }

void discardPendingKey(const OwnershipLock& /*ownership*/, const String& accountName) {
    const Data reference = accountRecordOf(accountName).pendingKeyReference();
    if (!reference) return;
    // An agent that was killed while it stored the certificate has left the reference in both places.
    if (!isReferredTo(reference)) removeKeyFromKeychainGivenPersistentRef(reference);
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
    const CertificateEntry entry = certificateEntryOf(encDsId);
    if (!entry.exists()) return;
    __VeltoIDDBRemoveCertificateInfo(encDsId);
    Dictionary kept;
    if (!dropped.certificate)
        kept.set(kVeltoIDCertificateCertificatePersistentReferenceKey, entry.reference());
    if (!dropped.privateKey)
        kept.set(kVeltoIDCertificatePrivateKeyPersistentReferenceKey, entry.privateKeyReference());
    discardReplacedItems(ownership, entry, {encDsId, kept});
}

bool discardExaminedCertificate(const OwnershipLock& ownership, const CertificateEntry& examined) {
    if (!examined.isSameCertificateAs(certificateEntryOf(examined.encDsId()))) return false;
    discardCertificate(ownership, examined.encDsId());
    return true;
}

bool __VeltoIDCleanupAccountsAndCertificates(const Dictionary& /*options*/, ErrorOut /*error*/) {
    cleanUpAccountsAndCertificates(OwnershipLock());
    return true;
}

void cleanUpAccountsAndCertificates(const OwnershipLock& ownership) {
    const std::set<std::string> owned = encDsIdsOfAccounts();
    Array encDsIds;
    __VeltoIDDBCopyCertificateKeys(&encDsIds);
    for (const Value& key : encDsIds) {
        const String encDsId = key.asString();
        if (owned.contains(encDsId.text()) && isOfUse(encDsId)) continue;
        String accountName;
        __VeltoIDDBCopyVeltoIDForDSID(encDsId, &accountName);
        VELTOID_LOG_FROM(
            "__VeltoIDCleanupAccountsAndCertificates", kNotice,
            "Removing certificate and private key  from keychain, and certificate from db, for account ",
            accountName, " / dsID=", encDsId);
        discardCertificate(ownership, encDsId);
    }
    discardOrphans();
    __VeltoIDDBForgetUnknownNames();
}

}  // namespace veltoid
