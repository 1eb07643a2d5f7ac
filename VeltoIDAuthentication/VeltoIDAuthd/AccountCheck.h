// The account check: one loop on a queue of its own that keeps every account usable without its user.
//
// A pass examines the accounts that are due and does what their state asks for; until then the loop waits for
// the earliest date of all accounts. It is woken early by the semaphore that notifying changes of the
// database signal. While it waits no transaction is open, so that the agent may be ended meanwhile: it has
// handed the service manager the date at which it must be back. Only a database that cannot be read keeps it
// up.
//
// Two passes are never less than kMinTimeBetweenPasses apart. An account that a pass could not help is put
// off for longer and longer (AccountBackOff.h).
#pragma once

#include <functional>

namespace veltoid {

// Seconds.
inline constexpr double kMinTimeBetweenPasses = 5;
inline constexpr double kVeltoIDFirstAccountCheckDelay = 10;

/// Starts the loop, once; the first pass comes after `firstDelaySeconds` (at once when not positive). The
/// loop waits for the device's first unlock before that. `onPass` is called on the loop's queue whenever a
/// pass begins to look at accounts. Any queue.
void startAccountCheck(double firstDelaySeconds, std::function<void()> onPass = {});

/// Makes the next pass come early, as a notifying change of the database does. Does nothing before the start.
/// Any queue.
void wakeAccountCheck();

}  // namespace veltoid
