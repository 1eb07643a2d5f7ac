// The status that clients ask for.
#pragma once

#include "Values/Value.h"

namespace veltoid {

/// "DeviceUnlockedSinceBoot".
Dictionary copyDeviceStatusDictionary();

/// "AccountStatuses" by account name, "DirtyAccounts", "DirtyAccountsAndCertificates",
/// "LastSuccessfulConnect", "LastConnectAttempt", "LaunchTime", "NextLaunchTime", "pid" and the device's
/// status, each when there is one. Client's queue.
Dictionary copyAccountStatusesDictionary(const Dictionary& options);

}  // namespace veltoid
