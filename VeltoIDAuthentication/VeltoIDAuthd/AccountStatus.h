// The status that clients ask for.
#pragma once

#include "Values/Value.h"

namespace veltoid {

/// "DeviceUnlockedSinceBoot".
Dictionary copyDeviceStatusDictionary();

/// "AccountStatuses" by account name, "DirtyAccounts", "DirtyAccountsAndCertificates",
/// "LastSuccessfulConnect", "LastConnectAttempt", "LaunchTime", "NextLaunchTime", "pid", "KeychainTrouble" (a
/// text) and the device's status, each when there is one. Of each account: "AccountState" (the name of an
/// AccountState), "ValidationDate", "NextActionTime", "NextFetchAttempt" while a certificate is pending,
/// "CertificateRequestsHeldUntil" while requests are held up, of the last contact with the server
/// "LastAttempt" (what for), "LastAttemptDate", "LastAttemptOutcome" and "LastAttemptReason", and
/// "AccountRequiresUserAction" unless that is not known yet. Client's queue.
Dictionary copyAccountStatusesDictionary(const Dictionary& options);

}  // namespace veltoid
