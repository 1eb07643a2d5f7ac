// The account check: one loop on a queue of its own that keeps every account usable without its user.
//
// A pass takes the accounts that were changed, or, if none was, those for which an action is foreseen; waits
// for the earliest of their dates; examines each and does what its state asks for. The loop is woken early by
// the semaphore that notifying changes of the database signal. While it waits no transaction is open, so that
// the agent may be ended meanwhile: it has handed the service manager the date at which it must be back.
//
// Two passes are never less than kMinTimeBetweenPasses apart. An account that is still due after a
// pass that could do nothing for it is put off for longer and longer, unless it is changed: its dates alone
// would keep the agent awake.
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
