// Taking an account off the device.
#pragma once

#include "Values/Error.h"
#include "Values/Value.h"

namespace veltoid {

/// Removes the account with its password item and, unless another account shares its encDsId, its certificate
/// entry with certificate and key; options "RemoveCertificateFromKeychain" and "RemovePrivateKeyFromKeychain"
/// (Booleans, true) say whether their items go too. Cleans up on the way. -100 for an unknown account.
/// Caller's queue.
bool __VeltoIDForgetVeltoID(const String& accountName, const Dictionary& options, ErrorOut error = nullptr);

}  // namespace veltoid
