#include "Platform/runtime/Clock.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cmath>
#include <ctime>
#include <map>
#include <mutex>
#include <thread>
#include <vector>

namespace platform {
namespace {

constexpr double kNanosecondsPerSecond = 1e9;

/// Timers further away than this are armed for it and looked at again.
constexpr double kFarthestDeadline = 30.0 * 365 * 86'400;

double secondsOf(clockid_t clock) {
    timespec time{};
    clock_gettime(clock, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / kNanosecondsPerSecond;
}

timespec timespecOf(double seconds) {
    const double whole = std::floor(seconds);
    return {static_cast<time_t>(whole), static_cast<long>((seconds - whole) * kNanosecondsPerSecond)};
}

/// Dates from CLOCK_REALTIME, waits on CLOCK_BOOTTIME so that time in suspend counts. One thread serves all
/// timers; it exists from the first timer on and sleeps until the next deadline or a jump of the real-time
/// clock. All members are guarded by the mutex.
class RealClock : public Clock {
  public:
    double now() const override { return secondsOf(CLOCK_REALTIME); }

    TimerID callAfter(double seconds, bool endsEarlyOnJump, std::function<void()> fire) override {
        const std::lock_guard lock(mutex_);
        startThreadOnce();
        const double deadline = secondsOf(CLOCK_BOOTTIME) + std::clamp(seconds, 0.0, kFarthestDeadline);
        const TimerID id = ++lastID_;
        const auto position =
            timers_.emplace(std::pair(deadline, id), Timer{endsEarlyOnJump, std::move(fire)}).first;
        deadlines_[id] = deadline;
        if (position == timers_.begin()) wake();
        return id;
    }

    bool cancel(TimerID id) override {
        const std::lock_guard lock(mutex_);
        const auto deadline = deadlines_.find(id);
        if (deadline == deadlines_.end()) return false;
        timers_.erase({deadline->second, id});
        deadlines_.erase(deadline);
        return true;
    }

  private:
    struct Timer {
        bool endsEarlyOnJump;
        std::function<void()> fire;
    };

    void startThreadOnce() {
        if (timerDescriptor_ >= 0) return;
        timerDescriptor_ = timerfd_create(CLOCK_BOOTTIME, TFD_CLOEXEC | TFD_NONBLOCK);
        jumpDescriptor_ = timerfd_create(CLOCK_REALTIME, TFD_CLOEXEC | TFD_NONBLOCK);
        wakeDescriptor_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
        std::thread([this] { serve(); }).detach();
    }

    void wake() const {
        const uint64_t one = 1;
        if (write(wakeDescriptor_, &one, sizeof one) < 0 && errno != EAGAIN) std::abort();
    }

    /// A timer on the real-time clock that never expires: reading it fails when the clock is set.
    void watchForJump() const {
        itimerspec far{};
        far.it_value = timespecOf(now() + kFarthestDeadline);
        timerfd_settime(jumpDescriptor_, TFD_TIMER_ABSTIME | TFD_TIMER_CANCEL_ON_SET, &far, nullptr);
    }

    void armForNextDeadline() {
        const std::lock_guard lock(mutex_);
        itimerspec next{};
        if (!timers_.empty()) next.it_value = timespecOf(std::max(timers_.begin()->first.first, 1e-6));
        timerfd_settime(timerDescriptor_, TFD_TIMER_ABSTIME, &next, nullptr);
    }

    bool takeJump() const {
        uint64_t expirations = 0;
        return read(jumpDescriptor_, &expirations, sizeof expirations) < 0 && errno == ECANCELED;
    }

    std::vector<std::function<void()>> takeDue(bool jumped) {
        const std::lock_guard lock(mutex_);
        const double reached = secondsOf(CLOCK_BOOTTIME);
        std::vector<std::function<void()>> due;
        for (auto timer = timers_.begin(); timer != timers_.end();) {
            if (timer->first.first <= reached || (jumped && timer->second.endsEarlyOnJump)) {
                due.push_back(std::move(timer->second.fire));
                deadlines_.erase(timer->first.second);
                timer = timers_.erase(timer);
            } else {
                ++timer;
            }
        }
        return due;
    }

    [[noreturn]] void serve() {
        watchForJump();
        for (;;) {
            armForNextDeadline();
            pollfd descriptors[] = {
                {timerDescriptor_, POLLIN, 0}, {jumpDescriptor_, POLLIN, 0}, {wakeDescriptor_, POLLIN, 0}};
            poll(descriptors, std::size(descriptors), -1);
            uint64_t ignored = 0;
            if (read(timerDescriptor_, &ignored, sizeof ignored) < 0 && errno != EAGAIN) continue;
            if (read(wakeDescriptor_, &ignored, sizeof ignored) < 0 && errno != EAGAIN) continue;
            const bool jumped = takeJump();
            if (jumped) watchForJump();
            for (const auto& fire : takeDue(jumped)) fire();
        }
    }

    std::mutex mutex_;
    std::map<std::pair<double, TimerID>, Timer> timers_;
    std::map<TimerID, double> deadlines_;
    TimerID lastID_ = 0;
    int timerDescriptor_ = -1;
    int jumpDescriptor_ = -1;
    int wakeDescriptor_ = -1;
};

std::atomic<Clock*> replacement{nullptr};

}  // namespace

Clock& Clock::shared() {
    if (Clock* clock = replacement.load(std::memory_order_acquire)) return *clock;
    static auto* real = new RealClock;
    return *real;
}

void Clock::replaceShared(Clock* clock) { replacement.store(clock, std::memory_order_release); }

}  // namespace platform
