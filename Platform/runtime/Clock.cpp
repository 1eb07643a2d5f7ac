#include "Platform/runtime/Clock.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <ctime>
#include <map>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "Platform/runtime/FileDescriptor.h"
#include "Platform/runtime/Lifetime.h"

namespace platform {
namespace {

constexpr double kNanosecondsPerSecond = 1e9;

/// Timers further away than this are armed for it and looked at again.
constexpr double kMaxDeadline = 30.0 * 365 * 86'400;

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

    void lifetimeEnds() override {
        std::unique_lock lock(mutex_);
        isStopping_ = true;
        if (waking_.isOpen()) wake();
        lock.unlock();
        if (thread_.joinable()) thread_.join();
        endTimers();
    }

    bool cancel(TimerID id) override {
        const std::lock_guard lock(mutex_);
        return std::erase_if(timers_, [id](const auto& timer) { return timer.first.second == id; }) > 0;
    }

  private:
    struct Timer {
        Use use;
        std::function<void()> fire;
    };

    TimerID addTimer(double seconds, Use use, std::function<void()> fire) override {
        const std::lock_guard lock(mutex_);
        startThreadOnce();
        const double deadline = secondsOf(CLOCK_BOOTTIME) + std::clamp(seconds, 0.0, kMaxDeadline);
        const TimerID id = ++lastID_;
        const auto position = timers_.emplace(std::pair(deadline, id), Timer{use, std::move(fire)}).first;
        if (position == timers_.begin()) wake();
        return id;
    }

    void endTimers() override {
        std::unique_lock lock(mutex_);
        const auto ended = std::exchange(timers_, {});
        lock.unlock();
        for (const auto& [key, timer] : ended)
            if (timer.use != Use::Task) timer.fire();
    }

    void startThreadOnce() {
        if (waking_.isOpen() || isStopping_) return;
        expiry_ = FileDescriptor(timerfd_create(CLOCK_BOOTTIME, TFD_CLOEXEC | TFD_NONBLOCK));
        jump_ = FileDescriptor(timerfd_create(CLOCK_REALTIME, TFD_CLOEXEC | TFD_NONBLOCK));
        waking_ = FileDescriptor(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
        thread_ = std::thread([this] { serve(); });
    }

    void wake() const {
        const uint64_t one = 1;
        if (write(waking_.number(), &one, sizeof one) < 0 && errno != EAGAIN) std::abort();
    }

    /// A timer on the real-time clock that never expires: reading it fails when the clock is set.
    void watchForJump() const {
        itimerspec far{};
        far.it_value = timespecOf(now() + kMaxDeadline);
        timerfd_settime(jump_.number(), TFD_TIMER_ABSTIME | TFD_TIMER_CANCEL_ON_SET, &far, nullptr);
    }

    /// False when the thread is to end.
    bool armForNextDeadline() {
        const std::lock_guard lock(mutex_);
        itimerspec next{};
        if (!timers_.empty()) next.it_value = timespecOf(std::max(timers_.begin()->first.first, 1e-6));
        timerfd_settime(expiry_.number(), TFD_TIMER_ABSTIME, &next, nullptr);
        return !isStopping_;
    }

    bool takeJump() const {
        uint64_t expirations = 0;
        return read(jump_.number(), &expirations, sizeof expirations) < 0 && errno == ECANCELED;
    }

    std::vector<std::function<void()>> takeDue(bool jumped) {
        const std::lock_guard lock(mutex_);
        const double reached = secondsOf(CLOCK_BOOTTIME);
        std::vector<std::function<void()>> due;
        for (auto timer = timers_.begin(); timer != timers_.end();) {
            if (timer->first.first <= reached || (jumped && timer->second.use == Use::WaitForDate)) {
                due.push_back(std::move(timer->second.fire));
                timer = timers_.erase(timer);
            } else {
                ++timer;
            }
        }
        return due;
    }

    void serve() {
        watchForJump();
        while (armForNextDeadline()) {
            pollfd descriptors[] = {
                {expiry_.number(), POLLIN, 0}, {jump_.number(), POLLIN, 0}, {waking_.number(), POLLIN, 0}};
            poll(descriptors, std::size(descriptors), -1);
            uint64_t ignored = 0;
            for (const FileDescriptor* file : {&expiry_, &waking_})
                (void)!read(file->number(), &ignored, sizeof ignored);
            const bool jumped = takeJump();
            if (jumped) watchForJump();
            for (const auto& fire : takeDue(jumped)) fire();
        }
    }

    std::mutex mutex_;
    std::map<std::pair<double, TimerID>, Timer> timers_;
    TimerID lastID_ = 0;
    FileDescriptor expiry_;
    FileDescriptor jump_;
    FileDescriptor waking_;
    bool isStopping_ = false;
    /// Started once, and joined by the thread that ends the lifetime.
    std::thread thread_;
};

}  // namespace

Clock& Clock::shared() { return Lifetime::current().part<Clock, RealClock>(); }

Clock::TimerID Clock::callAfter(double seconds, Use use, std::function<void()> fire) {
    const TimerID timer = addTimer(seconds, use, std::move(fire));
    // A timer that was added after lifetimeEnds had ended the others is ended here.
    if (Lifetime::current().isEnding()) endTimers();
    return timer;
}

}  // namespace platform
