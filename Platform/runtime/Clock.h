// Time. Nobody else reads the system clock, waits with a deadline or sleeps, so that a test can put a
// simulated clock in its place and run years in seconds.
#pragma once

#include <cstdint>
#include <functional>
#include <limits>

namespace platform {

/// A timeout or delay that never ends.
inline constexpr double kForever = std::numeric_limits<double>::infinity();

/// All operations may be called from any thread.
class Clock {
  public:
    using TimerID = uint64_t;

    virtual ~Clock() = default;

    /// The process's clock: the real one unless a test replaced it.
    static Clock& shared();

    /// Tests only, before any queue or timer is in use; the caller keeps the clock alive. Null: the real one.
    static void replaceShared(Clock* clock);

    /// Absolute time: seconds since 1970-01-01 00:00:00 UTC.
    virtual double now() const = 0;

    /// Calls `fire` once after `seconds` (time in suspend counts), on the clock's own thread: it must be
    /// short (queue a task, raise a signal). With `endsEarlyOnJump` it is called at once when the real-time
    /// clock is set, so that whoever waits for a date looks again.
    virtual TimerID callAfter(double seconds, bool endsEarlyOnJump, std::function<void()> fire) = 0;

    /// False when the timer has fired, is firing or is unknown.
    virtual bool cancel(TimerID timer) = 0;

    /// Work queues report work that can run; a simulated clock stands still until all of it has ended. A task
    /// that waits does not count meanwhile, nor does what is queued behind it.
    virtual void workBegan() {}
    virtual void workEnded() {}
};

/// The absolute time of the process's clock.
inline double now() { return Clock::shared().now(); }

}  // namespace platform
