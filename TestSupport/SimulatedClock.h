// A clock for tests: time stands still while anything works and jumps to the next deadline when a test
// advances it, so that years pass in seconds and in the same order each time.
#pragma once

#include <condition_variable>
#include <map>
#include <mutex>
#include <utility>

#include "Platform/runtime/Clock.h"
#include "TestSupport/TestLifetime.h"

namespace platform {

/// The clock of the test's lifetime for as long as it exists. All members are guarded by the mutex.
class SimulatedClock : public Clock {
  public:
    explicit SimulatedClock(double startSeconds = 1'750'000'000) : now_(startSeconds) {}

    double now() const override {
        const std::lock_guard lock(mutex_);
        return now_;
    }

    bool cancel(TimerID id) override {
        const std::lock_guard lock(mutex_);
        for (auto timer = timers_.begin(); timer != timers_.end(); ++timer) {
            if (timer->first.second != id) continue;
            timers_.erase(timer);
            return true;
        }
        return false;
    }

    void workBegan() override {
        const std::lock_guard lock(mutex_);
        ++working_;
    }

    void workEnded() override {
        const std::lock_guard lock(mutex_);
        if (--working_ == 0) becameIdle_.notify_all();
    }

    /// Waits until nothing works any more. Not from inside a task.
    void settle() {
        std::unique_lock lock(mutex_);
        becameIdle_.wait(lock, [this] { return working_ == 0; });
    }

    /// Lets `seconds` pass, firing every timer in between at its time and settling after each.
    void advanceBy(double seconds) {
        settle();
        std::unique_lock lock(mutex_);
        const double target = elapsed_ + seconds;
        while (!timers_.empty() && timers_.begin()->first.first <= target) {
            const auto timer = timers_.extract(timers_.begin());
            now_ += timer.key().first - elapsed_;
            elapsed_ = timer.key().first;
            lock.unlock();
            timer.mapped().fire();
            settle();
            lock.lock();
        }
        now_ += target - elapsed_;
        elapsed_ = target;
    }

    /// Sets the date without time passing, as a user or a time server does.
    void jumpTo(double seconds) {
        settle();
        std::unique_lock lock(mutex_);
        now_ = seconds;
        std::map<std::pair<double, TimerID>, Timer> woken;
        for (auto timer = timers_.begin(); timer != timers_.end();) {
            const auto current = timer++;
            if (current->second.use == Use::WaitForDate) woken.insert(timers_.extract(current));
        }
        lock.unlock();
        for (const auto& [key, timer] : woken) timer.fire();
        settle();
    }

  private:
    struct Timer {
        Use use;
        std::function<void()> fire;
    };

    TimerID addTimer(double seconds, Use use, std::function<void()> fire) override {
        const std::lock_guard lock(mutex_);
        timers_.emplace(std::pair(elapsed_ + seconds, ++lastID_), Timer{use, std::move(fire)});
        return lastID_;
    }

    void endTimers() override {
        std::unique_lock lock(mutex_);
        const auto ended = std::exchange(timers_, {});
        lock.unlock();
        for (const auto& [key, timer] : ended)
            if (timer.use != Use::Task) timer.fire();
    }

    mutable std::mutex mutex_;
    std::condition_variable becameIdle_;
    double now_;
    double elapsed_ = 0;
    long working_ = 0;
    TimerID lastID_ = 0;
    std::map<std::pair<double, TimerID>, Timer> timers_;
    const InTestLifetime<Clock> inLifetime_{*this};
};

}  // namespace platform
