#include "VeltoIDAuthenticationImpl/CertificateInformation.h"

#include "Logging/Failure.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/OptionKeys.h"
#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/EntryTable.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainItems.h"

namespace veltoid {
namespace {

constexpr TakenEntry kEntries[] = {
    {kVeltoIDAccountDSIDKey, Value::Kind::String},
    {kVeltoIDCertificateStatusKey, Value::Kind::String},
    {kVeltoIDCertificateTypeKey, Value::Kind::String},
    {kVeltoIDCertificateSerialNumberKey, Value::Kind::String},
    {kVeltoIDCertificateExpirationDateKey, Value::Kind::Date},
    {kVeltoIDCertificateCreationDateKey, Value::Kind::Date},
    {kVeltoIDCertificateModificationDateKey, Value::Kind::Date},
};

constexpr TakenEntry kReferences[] = {
    {kVeltoIDCertificateCertificatePersistentReferenceKey, Value::Kind::Data},
    {kVeltoIDCertificatePrivateKeyPersistentReferenceKey, Value::Kind::Data},
};

constexpr TakenEntry kDetails[] = {
    {kVeltoIDCertificateIntermediateCertificateReferenceKey, Value::Kind::Data},
    {kVeltoIDCertificateNextRenewalAttemptDateKey, Value::Kind::Date},
};

/// The encDsId that is asked for; null when there is none, or the account has another one.
String requestedEncDsId(const String& accountName, const String& encDsId) {
    if (!accountName) return encDsId;
    const String own = __VeltoIDDBCopyAccountValue(accountName, kVeltoIDAccountDSIDKey).asString();
    return !encDsId || encDsId == own ? own : String();
}

}  // namespace

bool __VeltoIDCopyCertificateInfo(const String& accountName, const String& encDsId, const Dictionary& options,
                                  Dictionary* information, ErrorOut error) {
    const String requested = requestedEncDsId(accountName, encDsId);
    if (!requested) return failWith(error, {kOSStatusErrorDomain, -1, {}});
    const CertificateEntry entry = certificateEntryOf(requested);
    if (!entry.exists()) return failWith(error, VELTOID_ERROR(identity_error::kUnknown));
    Dictionary found = {{kVeltoIDAccountDSIDKey, requested}};
    takeEntries(entry.values(), kEntries, found);
    if (getBool(&options, option::kCertificateDetails, false)) takeEntries(entry.values(), kDetails, found);
    std::optional<platform::Certificate> certificate;
    if (usesSystemKeychain()) {
        takeEntries(entry.values(), kReferences, found);
    } else if (copyCertificateFromKeychainGivenPersistentRef(entry.reference(), &certificate) &&
               certificate) {
        found.set(message::kCertificateData, Data(certificate->der));
    }
    fill(information, std::move(found));
    return true;
}

}  // namespace veltoid
