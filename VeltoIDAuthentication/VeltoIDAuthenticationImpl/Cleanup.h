// Taking away what is of no use any more.
#pragma once

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationImpl/ItemOwnership.h"

namespace veltoid {

/// Removes, with their keychain items, the certificate entries that no account owns, that are invalid, or
/// that lack certificate or key; lifts connection embargoes that are over. The options are not looked at.
/// True. Caller's queue.
bool __VeltoIDCleanupAccountsAndCertificates(const Dictionary& options, ErrorOut error = nullptr);

/// The same for callers that hold the ownership lock.
void cleanUpAccountsAndCertificates(const OwnershipLock& ownership);

}  // namespace veltoid
