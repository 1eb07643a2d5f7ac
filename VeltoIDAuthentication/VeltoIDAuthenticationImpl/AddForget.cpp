#include "VeltoIDAuthenticationImpl/AddForget.h"

#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Platform/bus/Notifications.h"
#include "Protocol/Names.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/RecordKeys.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/CertificateIssuance.h"
#include "VeltoIDAuthenticationImpl/Cleanup.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

std::string describeError(const std::optional<Error>& error) {
    return error ? describeValue(*error) : std::string();
}

bool isAlreadyOnItsWay(const String& accountName, const Dictionary& options) {
    return !getBool(&options, "ForceCertificateCreation", false) &&
           (__VeltoIDDBHasCertificateToken(accountName) || __VeltoIDDBHasValidCertificate(accountName));
}

/// Signs in and fetches the account's information; null, with the error, when the sign-in failed.
Session signIn(const String& accountName, const String& hashedPassword, const Dictionary& options,
               String* encDsId, ErrorOut error) {
    Session session =
        __VeltoIDSessionDoCreateSession(accountName, hashedPassword, options, encDsId, nullptr, error);
    if (!session) return nullptr;
    if (*encDsId) __VeltoIDDBSetAccountValue(accountName, kVeltoIDAccountDSIDKey, *encDsId, true);
    if (!getBool(&options, "VeltoIDOptionsDoNotFetchVeltoIDAuthenticationRecord", false)) {
        const Dictionary fetchOptions =
            copyDictionarySettingValue(options, "ForceValidationRecordFetch", Value::boolean(true));
        __VeltoIDDoGetMyInfo(accountName, fetchOptions, nullptr);
    }
    return session;
}

/// Whether the add itself asks for a certificate instead of leaving that to the account check.
bool createsRequest(const String& encDsId, const Dictionary& options) {
    if (!encDsId || getBool(&options, "DoNotCreateCSR", false) ||
        getBool(&options, "CreateCSRAsynchronously", true))
        return false;
    return getBool(&options, "ForceCertificateCreation", false) || !hasValidCertificateEntry(encDsId);
}

struct AddOutcome {
    std::optional<Dictionary> record;
    /// As far as the server has told it.
    String encDsId;
    bool succeeded = false;
};

AddOutcome copyOutcome(const String& accountName, ErrorOut error) {
    Dictionary record;
    if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record, error)) return {};
    return {record, record.string(kVeltoIDAccountDSIDKey), true};
}

AddOutcome readd(const String& accountName) {
    std::optional<Error> copyError;
    AddOutcome outcome = copyOutcome(accountName, &copyError);
    const bool hasDSID = outcome.record && outcome.record->string(kVeltoIDAccountDSIDKey);
    VELTOID_LOG_FROM("__VeltoIDDoAddVeltoID", kNotice,
                     "VeltoIDAuth: Already existing account " << accountName.view() << " re-added; "
                                                              << (hasDSID ? "succeeded." : "failed, ")
                                                              << describeError(copyError));
    return outcome;
}

AddOutcome addAnew(const String& accountName, const String& hashedPassword, const Dictionary& options) {
    std::optional<Error> held;
    String encDsId;
    Session session;
    bool proceeds = getBool(&options, "DoNotCheckPassword", false);
    if (!proceeds) {
        session = signIn(accountName, hashedPassword, options, &encDsId, &held);
        proceeds = session != nullptr;
    }
    if (proceeds && createsRequest(encDsId, options)) {
        encDsId = nullptr;
        proceeds = __VeltoIDDoCreateCertificateRequestForVeltoID(accountName, options, &encDsId, &held);
    }
    AddOutcome outcome{{}, encDsId, false};
    if (proceeds) outcome = copyOutcome(accountName, &held);
    VELTOID_LOG_FROM("__VeltoIDDoAddVeltoID", kNotice,
                     "VeltoIDAuth: Adding account " << accountName.view() << " "
                                                    << (outcome.succeeded ? "succeeded." : "failed, ")
                                                    << describeError(held));
    __VeltoIDSessionRelease(std::move(session));
    return outcome;
}

/// The record with its password item, and the certificate unless another account has the same encDsId.
void forget(const String& accountName, const DroppedItems& dropped) {
    const OwnershipLock ownership;
    cleanUpAccountsAndCertificates(ownership);
    // The pending request's key has no certificate that anybody could still want it for.
    discardPendingKey(ownership, accountName);
    // The record as it is now: others may have forgotten it, or added it again, since it was looked for.
    Dictionary record;
    if (!__VeltoIDDBRemoveVeltoIDAccountAndPassword(accountName, &record)) return;
    const String encDsId = record.string(kVeltoIDAccountDSIDKey);
    if (!encDsId || !__VeltoIDDBCopyVeltoIDForDSID(encDsId, nullptr)) {
        discardCertificate(ownership, encDsId, dropped);
        discardStrayItems(ownership, accountName, dropped);
    }
}

}  // namespace

bool __VeltoIDDoAddVeltoID(const String& accountName, const String& hashedPassword, const Dictionary& options,
                           String* encDsId, std::optional<Dictionary>* accountRecord, ErrorOut error) {
    if (!__VeltoIDDBCreateVeltoIDAccount(accountName, hashedPassword, nullptr)) {
        fillError(error, VELTOID_ERROR(identity_error::kUnknown));
        return false;
    }
    const AddOutcome outcome = isAlreadyOnItsWay(accountName, options)
                                   ? readd(accountName)
                                   : addAnew(accountName, hashedPassword, options);
    platform::Notifications::shared().post(kVeltoIDAccountAddedOrRemovedNotification);
    if (encDsId != nullptr) *encDsId = outcome.encDsId;
    if (accountRecord != nullptr) *accountRecord = outcome.record;
    return true;
}

bool __VeltoIDForgetVeltoID(const String& accountName, const Dictionary& options, ErrorOut error) {
    if (accountName) {
        VELTOID_LOG(kNotice, "VeltoIDAuth: Forgetting account " << accountName.view() << ".");
        auto& notifications = platform::Notifications::shared();
        Dictionary record;
        if (__VeltoIDDBCopyVeltoIDAccount(accountName, &record)) {
            forget(accountName, {getBool(&options, "RemoveCertificateFromKeychain", true),
                                 getBool(&options, "RemovePrivateKeyFromKeychain", true)});
            notifications.post(kVeltoIDAccountAddedOrRemovedNotification);
            notifications.post(kVeltoIDAccountChangeNotification);
            return true;
        }
        notifications.post(kVeltoIDAccountChangeNotification);
    }
    fillError(error, VELTOID_ERROR(identity_error::kUnknown));
    return false;
}

}  // namespace veltoid
