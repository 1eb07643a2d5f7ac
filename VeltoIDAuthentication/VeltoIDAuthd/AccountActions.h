// What the account check does for an account, by its state. All on the account-check queue; server calls
// block it.
#pragma once

#include "Values/Value.h"

namespace veltoid {

/// The meta value as a number of seconds: the default when there is none, 0 when it is no finite Number.
double metaSeconds(std::string_view key, double defaultValue);

/// Examines the account, network allowed, and does what its state asks for: learn the encDsId, drop a
/// password that cannot be used, ask for a certificate or fetch it, fetch the validation record. `record` is
/// the account's, as it was before.
void checkAccount(const String& accountName, const Dictionary& record);

/// Asks for a new certificate. One that has expired or was revoked is removed first; otherwise the next
/// attempt is planned first. False, without asking, until the account's "CSRGenerationInterval" has passed
/// since its "CSRGenerationDate", and while its requests are held up.
bool renewCertificateForAccount(const String& accountName, const String& encDsId, const Dictionary& options,
                                bool expiredOrRevoked);

/// Fetches the validation record; after a failure plans the next attempt, later each time.
void fetchValidationRecordForAccount(const String& accountName, const Dictionary& record,
                                     const Dictionary& options);

}  // namespace veltoid
