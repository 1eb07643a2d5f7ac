// How long to wait before a pending certificate is asked for again. All in seconds.
#pragma once

#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {

/// A pending certificate is asked for at least so often, unless the server wants longer waits: its user waits
/// for it.
inline constexpr double kMaxOwnPollDelay = 3'600;

/// The shortest wait, whatever the server says.
inline constexpr double kMinPollDelay = 15;

/// Waits that grow without end are spread at random over the second day from here on.
inline constexpr double kMaxPollingDelay = 86'400;

/// Longer waits than this, whether the server or a record asks for them, are not believed.
inline constexpr double kMaxFetchDelay = 604'800;

/// A random delay between one and two days, so that devices that fail together do not come back together.
double randomPollingDelay();

/// How long to wait before the certificate is asked for: what the server says now (`delay`, absent or a
/// Number; kMinPollDelay at least, a week at most), else what the record has noted, else a minute.
double pendingDelay(const Value& delay, const AccountRecord& record);

/// The delay that a fresh token came with: a minute if the server gave none, kMinPollDelay for one that
/// is shorter, or longer than a day.
double tokenDelay(const Value& delay);

/// Lets the next fetch of the account's pending certificate be made after `delay`, and one after that half as
/// long again later, up to kMaxOwnPollDelay. False when that cannot be stored.
bool putOffFetch(const String& accountName, double delay);

}  // namespace veltoid
