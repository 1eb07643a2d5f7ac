// Certificate entries: what is known of an account's client certificate, in the section "AuthCertificates"
// under the account's encDsId. Bodies run on the database queue; entries come out as copies.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/CertificateEntry.h"
#include "VeltoIDAuthenticationDB/Notify.h"

namespace veltoid {

/// An issued certificate counts as valid until one day after it has expired (seconds).
inline constexpr double kVeltoIDCertificateExpirationGrace = 86'400;

/// The keys of all entries, possibly none. -106 when they cannot be read.
bool __VeltoIDDBCopyCertificateKeys(Array* keys, ErrorOut error = nullptr);

/// Creates or updates the entry from the server's certificate result ("CertificateReference", "Expires",
/// "CertStatus", "SerialNumber"); without one the entry is emptied. Marks it dirty, writes and notifies.
/// False without encDsId.
bool __VeltoIDDBSetCertificateInfo(const String& encDsId, const std::optional<Dictionary>& info);

/// Sets one value, an absent or Null one removing it; a change stamps "ModificationDate", marks the entry
/// dirty when it notifies, and is written. False without encDsId, key or entry.
bool __VeltoIDDBSetCertificateValue(const String& encDsId, const String& key, const Value& value,
                                    Notify notify = Notify::Yes);

/// True and a copy of the entry when there is one.
bool __VeltoIDDBCopyCertificateInfo(const String& encDsId, CertificateEntry* entry);

/// True when an entry was removed.
bool __VeltoIDDBRemoveCertificateInfo(const String& encDsId);

/// Whether the encDsId has an entry that is issued and, a day of grace included, has not expired.
bool hasValidCertificateEntry(const String& encDsId);

}  // namespace veltoid
