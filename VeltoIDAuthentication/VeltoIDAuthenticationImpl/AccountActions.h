// What the account check does for an account, by its state. All on the account-check queue; server calls
// block it.
#pragma once

#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {

/// Examines the account, network allowed, and does what its state asks for: learn the encDsId, drop a
/// password that cannot be used, ask for a certificate or fetch it, fetch the validation record. `record` is
/// the account's, as it was before.
void checkAccount(const AccountRecord& record);

/// Fetches the validation record; after a failure plans the next attempt, later each time.
void fetchValidationRecordForAccount(const AccountRecord& record, const Dictionary& options);

}  // namespace veltoid
