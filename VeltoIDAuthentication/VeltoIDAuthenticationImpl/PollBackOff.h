// How long to wait before a pending certificate is asked for again. All in seconds.
#pragma once

#include <optional>

#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {

/// Up to here waits grow by half each time; from here on they are spread at random over the second day.
inline constexpr double kMaxPollingDelay = 86'400;

/// Longer waits than this, whether the server or a record asks for them, are not believed.
inline constexpr double kMaxFetchDelay = 604'800;

/// A random delay between one and two days, so that devices that fail together do not come back together.
double randomPollingDelay();

/// The delay to store after a wait of `delay`.
double delayAfterPending(double delay);

/// The delay to store after a wait of `delay` whose question was not answered; at most
/// randomPollingDelay().
double delayAfterFailure(double delay);

/// The record's "NextCertificateFetchDelta", if that is a finite number.
std::optional<double> storedFetchDelta(const AccountRecord& record);

/// How long the server wants to be left alone: what it says now (`delay`, absent or a Number), else what the
/// record has noted, else a minute. What cannot be believed (infinite, longer than a week) is cut off.
double pendingDelay(const Value& delay, const AccountRecord& record);

/// The delay that a fresh token came with: none if the server gave none; 15 seconds for one that is negative,
/// longer than a day or no number.
std::optional<double> tokenDelay(const Value& delay);

}  // namespace veltoid
