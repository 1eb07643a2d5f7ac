// Taking an account off the device.
#pragma once

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationImpl/ItemOwnership.h"

namespace veltoid {

/// Removes the account with its password item and, unless another account shares its encDsId, its certificate
/// entry with certificate and key, then cleans up. Options "RemoveCertificateFromKeychain" and
/// "RemovePrivateKeyFromKeychain" (Booleans, true) say whether their items go too; what is kept is noted, and
/// no clean-up takes it. Hands out the record as it was. -100 for an unknown account, and, with everything as
/// it was, when the change cannot be stored. Caller's queue.
bool __VeltoIDForgetVeltoID(const String& accountName, const Dictionary& options, ErrorOut error = nullptr,
                            AccountRecord* forgotten = nullptr);

/// The same for callers that hold the ownership lock.
bool forgetAccount(const OwnershipLock& ownership, const String& accountName, const Dictionary& options,
                   ErrorOut error = nullptr, AccountRecord* forgotten = nullptr);

}  // namespace veltoid
