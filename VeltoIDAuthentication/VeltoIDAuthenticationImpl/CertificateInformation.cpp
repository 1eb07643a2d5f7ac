#include "VeltoIDAuthenticationImpl/CertificateInformation.h"

#include "Protocol/MessageKeys.h"
#include "Protocol/OptionKeys.h"
#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDKeychainItems/KeychainCertificates.h"
#include "VeltoIDKeychainItems/KeychainItems.h"

namespace veltoid {
namespace {

struct InformationEntry {
    std::string_view key;
    Value::Kind kind;
};

constexpr InformationEntry kEntries[] = {
    {kVeltoIDAccountDSIDKey, Value::Kind::String},
    {kVeltoIDCertificateStatusKey, Value::Kind::String},
    {kVeltoIDCertificateTypeKey, Value::Kind::String},
    {kVeltoIDCertificateSerialNumberKey, Value::Kind::String},
    {kVeltoIDCertificateExpirationDateKey, Value::Kind::Date},
    {kVeltoIDCertificateCreationDateKey, Value::Kind::Date},
    {kVeltoIDCertificateModificationDateKey, Value::Kind::Date},
};

constexpr InformationEntry kReferences[] = {
    {kVeltoIDCertificateCertificatePersistentReferenceKey, Value::Kind::Data},
    {kVeltoIDCertificatePrivateKeyPersistentReferenceKey, Value::Kind::Data},
};

constexpr InformationEntry kDetails[] = {
    {kVeltoIDCertificateIntermediateCertificateReferenceKey, Value::Kind::Data},
    {kVeltoIDCertificateNextRenewalAttemptDateKey, Value::Kind::Date},
};

void takeEntries(const Dictionary& entry, std::span<const InformationEntry> entries,
                 Dictionary& information) {
    for (const InformationEntry& wanted : entries)
        if (const Value& value = entry[wanted.key]; value.kind() == wanted.kind)
            information.set(wanted.key, value);
}

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
    CertificateEntry entry;
    if (!requested) {
        fillError(error, Error{String(kOSStatusErrorDomain), -1, {}});
        return false;
    }
    if (!__VeltoIDDBCopyCertificateInfo(requested, &entry)) {
        fillError(error, VELTOID_ERROR(identity_error::kUnknown));
        return false;
    }
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
