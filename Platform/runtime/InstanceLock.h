// One agent for a store: each works on its own copy of what is stored, so that a second one would bring back
// what the first has removed, and lose what it has added. The lock is a file of its own in the state folder,
// not the databases', which other programs may read meanwhile.
#pragma once

namespace platform::instance_lock {

/// How long the start waits for an agent that is just leaving (seconds).
inline constexpr double kMaxWait = 15;

/// Takes the lock, before anything is read from the store, and keeps it until the end of the lifetime or of
/// the process, whichever comes first. False, with a log line that names the process, when another one has
/// not given it up after kMaxWait. True without it where there is no state folder yet, or where the file
/// system has no locks. Main thread, before the event loop is prepared: a signal to end still ends the
/// process.
bool take();

/// Whether the store may be read: the lock is held, or none was asked for. A lock that could not be taken for
/// want of the state folder is asked for again. Any thread.
bool mayRead();

}  // namespace platform::instance_lock
