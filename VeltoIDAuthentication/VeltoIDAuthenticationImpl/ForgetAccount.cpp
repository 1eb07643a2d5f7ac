#include "VeltoIDAuthenticationImpl/ForgetAccount.h"

#include "Logging/Log.h"
#include "Platform/bus/Notifications.h"
#include "Protocol/Names.h"
#include "Protocol/OptionKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationImpl/ItemOwnership.h"

namespace veltoid {
namespace {

/// The record with its password item, and the certificate unless another account has the same encDsId.
void forget(const String& accountName, const DroppedItems& dropped) {
    const OwnershipLock ownership;
    cleanUpAccountsAndCertificates(ownership);
    discardPendingKey(ownership, accountName);
    // The record as it is now: it may have been forgotten, or added again, since it was looked for.
    AccountRecord record;
    if (!__VeltoIDDBRemoveVeltoIDAccountAndPassword(accountName, &record)) return;
    const String encDsId = record.encDsId();
    if (!encDsId || !__VeltoIDDBCopyVeltoIDForDSID(encDsId, nullptr)) {
        discardCertificate(ownership, encDsId, dropped);
        discardStrayItems(ownership, accountName, dropped);
    }
}

}  // namespace

bool __VeltoIDForgetVeltoID(const String& accountName, const Dictionary& options, ErrorOut error) {
    if (accountName) {
        VELTOID_LOG(kNotice, "VeltoIDAuth: Forgetting account ", accountName, ".");
        auto& notifications = platform::Notifications::shared();
        if (__VeltoIDDBCopyVeltoIDAccount(accountName, nullptr)) {
            forget(accountName, {getBool(&options, option::kRemoveCertificate, true),
                                 getBool(&options, option::kRemovePrivateKey, true)});
            notifications.post(kVeltoIDAccountAddedOrRemovedNotification);
            notifications.post(kVeltoIDAccountChangeNotification);
            return true;
        }
        notifications.post(kVeltoIDAccountChangeNotification);
    }
    return failWith(error, VELTOID_ERROR(identity_error::kUnknown));
}

}  // namespace veltoid
