// One agent after the other: the bus starts the next one as soon as the names are free, while the one before
// still answers and stores what it was asked to before. Each works on its own copy of what is stored, so the
// next does not begin until the one before has ended.
#pragma once

namespace platform::instance_lock {

/// Makes every agent of this user that starts from now on wait for the end of this lifetime.
void holdUpNext();

/// Returns when no agent that is leaving is left; at once where there is no place for state.
void waitForPrevious();

}  // namespace platform::instance_lock
