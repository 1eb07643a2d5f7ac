// When the agent is to be started again: it may be ended whenever nothing is pending, so it tells the service
// manager first.
#pragma once

#include <optional>

#include "Values/Value.h"

namespace veltoid {

/// Whether a date takes the place of an earlier one that was asked for before.
enum class RelaunchDate { Replaces, OnlyIfEarlier };

/// Asks for a relaunch at `date` (seconds since 1970; none or not positive: no particular time). Any queue:
/// the work is done on the main queue, inside a transaction.
void scheduleRelaunch(std::optional<double> date, RelaunchDate rule = RelaunchDate::Replaces);

/// Notes that the server wants the agent to be running at the date (seconds since 1970), across restarts. The
/// service manager gets the earlier of this and what is asked for above. Any queue but the database's.
void scheduleRequestedLaunch(double date);

/// What the server asked an earlier agent for counts again. Once, at start.
void restoreRequestedLaunch();

/// The names of the accounts for which an action is foreseen, and the earliest of their dates. Not on
/// the database's queue or the keychain's, which it waits for.
Array copyAccountsNeedingAction(std::optional<double>* earliestDate);

/// Asks for a relaunch at the earliest next action, if there is one, and makes the database durable.
void computeRelaunchFromAccounts();

/// When the agent was started (seconds since 1970), as far as it has ever asked for a relaunch.
double launchDate();

/// The date that the server asked for, while that is ahead; else that of the relaunch that was last asked
/// for; none when there is none. Any queue.
std::optional<double> nextLaunchDate();

}  // namespace veltoid
