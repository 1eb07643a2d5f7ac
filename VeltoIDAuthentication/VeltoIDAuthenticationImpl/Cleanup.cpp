#include "VeltoIDAuthenticationImpl/Cleanup.h"

#include <set>
#include <string>

#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"

namespace veltoid {
namespace {

/// The encDsIds of all accounts; lifts their embargoes on the way.
std::set<std::string> encDsIdsOfAccounts() {
    std::set<std::string> encDsIds;
    Array names;
    __VeltoIDDBCopyVeltoIDs(&names);
    for (const Value& name : names) {
        AccountRecord record;
        if (!__VeltoIDDBCopyVeltoIDAccount(name.asString(), &record)) continue;
        if (const String encDsId = record.encDsId()) encDsIds.insert(encDsId.text());
        const auto embargo = record.earliestConnection();
        if (embargo && *embargo < platform::now())
            __VeltoIDDBSetAccountValue(name.asString(), kVeltoIDAccountEarliestAllowedConnectionDateKey,
                                       Value::null(), Notify::No);
    }
    return encDsIds;
}

bool isOfUse(const String& encDsId) {
    CertificateEntry entry;
    return __VeltoIDDBCopyCertificateInfo(encDsId, &entry) && !entry.isInvalid() &&
           entry.values().contains(kVeltoIDCertificateCertificatePersistentReferenceKey) &&
           entry.values().contains(kVeltoIDCertificatePrivateKeyPersistentReferenceKey);
}

}  // namespace

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
        VELTOID_LOG_FROM("__VeltoIDCleanupAccountsAndCertificates", kNotice,
                         "Removing certificate and private key  from keychain, and certificate from db, for "
                         "account "
                             << accountName.view() << " / dsID=" << encDsId.view());
        discardCertificate(ownership, encDsId);
    }
}

}  // namespace veltoid
