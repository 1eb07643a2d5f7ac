// Time. Nothing else reads the system clock, waits with a deadline or sleeps, so that a test can give a
// simulated clock to the lifetime and run years in seconds.
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

    /// The lifetime's clock.
    static Clock& shared();

    /// What a timer is for: work that is dropped when the lifetime ends, or a wait that is over then; one for
    /// a date is over as well when the real-time clock is set, so that the date is looked at again.
    enum class Use { Task, Wait, WaitForDate };

    /// Absolute time: seconds since 1970-01-01 00:00:00 UTC.
    virtual double now() const = 0;

    /// Calls `fire` once after `seconds` (time in suspend counts), on the clock's own thread or, when the
    /// lifetime ends, on another: it must be short (queue a task, raise a signal).
    TimerID callAfter(double seconds, Use use, std::function<void()> fire);

    /// False when the timer has fired, is firing or is unknown.
    virtual bool cancel(TimerID timer) = 0;

    /// Work queues report work that can run; a simulated clock stands still until all of it has ended. A task
    /// that waits does not count meanwhile, nor does what is queued behind it.
    virtual void workBegan() {}
    virtual void workEnded() {}

    /// Fires the timers of waits and drops the others.
    virtual void lifetimeEnds() { endTimers(); }

  protected:
    virtual TimerID addTimer(double seconds, Use use, std::function<void()> fire) = 0;
    virtual void endTimers() = 0;
};

/// The absolute time of the process's clock.
inline double now() { return Clock::shared().now(); }

}  // namespace platform
