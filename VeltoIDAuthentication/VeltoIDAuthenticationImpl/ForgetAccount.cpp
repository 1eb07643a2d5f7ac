#include "VeltoIDAuthenticationImpl/ForgetAccount.h"

#include "Certificates/CertificateRequest.h"
#include "Logging/Log.h"
#include "Platform/bus/Notifications.h"
#include "Protocol/Names.h"
#include "Protocol/OptionKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainKeys.h"

namespace veltoid {
namespace {

/// What becomes of the account's certificate and key, and of those that were kept when it was forgotten
/// before.
UnownedItems unownedItems(const String& accountName, const Dictionary& options) {
    UnownedItems items;
    const CertificateEntry entry = certificateEntryOf(accountRecordOf(accountName).encDsId());
    const auto decide = [&](std::string_view removal, const Data& item, const std::optional<Array>& kept) {
        if (getBool(&options, removal, true)) {
            for (const Value& each : kept.value_or(Array())) items.unwanted.append(each);
        } else if (item) {
            items.wanted.append(item);
        }
    };
    decide(option::kRemoveCertificate, entry.reference(),
           copyCertificatesFromKeychainGivenLabel(certificateLabelForAccount(accountName)));
    decide(option::kRemovePrivateKey, entry.privateKeyReference(),
           copyKeysFromKeychainGivenOwner(accountName, kPrivateKeyKind));
    return items;
}

}  // namespace

bool __VeltoIDForgetVeltoID(const String& accountName, const Dictionary& options, ErrorOut error,
                            AccountRecord* forgotten) {
    return forgetAccount(OwnershipLock(), accountName, options, error, forgotten);
}

bool forgetAccount(const OwnershipLock& ownership, const String& accountName, const Dictionary& options,
                   ErrorOut error, AccountRecord* forgotten) {
    if (!accountName) return failWith(error, VELTOID_ERROR(identity_error::kUnknown));
    VELTOID_LOG_FROM("__VeltoIDForgetVeltoID", kNotice, "VeltoIDAuth: Forgetting account ", accountName, ".");
    auto& notifications = platform::Notifications::shared();
    std::optional<Error> held;
    const bool isForgotten = __VeltoIDDBRemoveVeltoIDAccountAndPassword(
        accountName, unownedItems(accountName, options), forgotten, &held);
    if (isForgotten) {
        cleanUpAccountsAndCertificates(ownership);
        notifications.post(kVeltoIDAccountAddedOrRemovedNotification);
    }
    notifications.post(kVeltoIDAccountChangeNotification);
    if (isForgotten) return true;
    const bool isUnknown = held && held->code == identity_error::kUnknownAccount;
    return failWith(error, isUnknown || !held ? VELTOID_ERROR(identity_error::kUnknown) : *held);
}

}  // namespace veltoid
