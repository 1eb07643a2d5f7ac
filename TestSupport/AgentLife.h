// The life of the agent in simulated time, as its service manager has it: it starts, makes its first pass,
// leaves when it has been idle, and is started again when its time has come or a client speaks to it. Nothing
// but files outlives a start.
#pragma once

#include <algorithm>
#include <atomic>
#include <functional>
#include <optional>
#include <vector>

#include "Platform/bus/ServiceManager.h"
#include "Platform/runtime/Transactions.h"
#include "Platform/runtime/WorkQueue.h"
#include "TestSupport/SimulatedClock.h"
#include "VeltoIDAuthd/AccountCheck.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"

namespace veltoid::testing_support {

/// How many of the dates (in order) fall into the fullest stretch of `length` seconds that begins at `from`
/// or later and before `until`.
inline size_t mostWithin(const std::vector<double>& dates, double length, double from, double until) {
    size_t most = 0;
    for (auto first = std::lower_bound(dates.begin(), dates.end(), from);
         first != dates.end() && *first < until; ++first)
        most = std::max<size_t>(most, std::lower_bound(first, dates.end(), *first + length) - first);
    return most;
}

/// Main thread. The lifetime of the test is the agent's, anew at each start; while the agent is away it is
/// there for those who look at the files.
class AgentLife : private platform::ServiceManager {
  public:
    explicit AgentLife(platform::SimulatedClock& clock) : clock_(clock) {}

    /// Called at every pass (on the account check's queue), and every few seconds while the agent runs and
    /// when it has left (main thread, nothing works meanwhile).
    std::function<void()> onPass = [] {};
    std::function<void()> onLook = [] {};

    void liveUntil(double date) {
        while (clock_.now() < date) {
            if (!isRunning_) {
                const double start = alarm_.value_or(date);
                clock_.advanceBy(std::max(std::min(start, date) - clock_.now(), 0.0));
                if (start >= date) return;
                start_();
            }
            clock_.advanceBy(std::min(kLook, date - clock_.now()));
            if (hasLeft_) leave();
            onLook();
        }
    }

    /// A client's command.
    void ask(const std::function<void()>& command) {
        if (!isRunning_) start_();
        command();
        clock_.settle();
    }

    bool isRunning() const { return isRunning_; }
    /// When the service manager starts the agent; none: only a client does.
    std::optional<double> alarm() const { return alarm_; }
    const std::vector<double>& starts() const { return starts_; }

  private:
    static constexpr double kIdleExit = 30;
    static constexpr double kAfterStart = 30;
    static constexpr double kLook = 2.5;

    uint32_t setStartInterval(uint32_t seconds) override {
        alarm_ = clock_.now() + seconds;
        return 0;
    }

    void start_() {
        platform::TestLifetime::restart();
        starts_.push_back(clock_.now());
        hasLeft_ = false;
        isRunning_ = true;
        __VeltoIDDBSetUsePreferences(true);
        setProcessHooks(
            {.scheduleRelaunch = [](double date) { scheduleRelaunch(date, RelaunchDate::OnlyIfEarlier); },
             .scheduleRequestedLaunch = scheduleRequestedLaunch});
        leaveWhenIdle();
        restoreRequestedLaunch();
        scheduleRelaunch(clock_.now() + kAfterStart);
        startAccountCheck(kVeltoIDFirstAccountCheckDelay, [this] { onPass(); });
    }

    void leaveWhenIdle() {
        platform::transactions::whenNoneWasOpenFor(kIdleExit, [this] {
            if (platform::transactions::openCount() > 0) return leaveWhenIdle();
            __VeltoIDDBSynchronize();
            hasLeft_ = true;
        });
    }

    void leave() {
        isRunning_ = false;
        platform::TestLifetime::restart();
        __VeltoIDDBSetUsePreferences(true);
        // A timer that elapses while the agent runs starts nothing.
        if (alarm_ && *alarm_ <= clock_.now()) alarm_.reset();
    }

    platform::SimulatedClock& clock_;
    bool isRunning_ = false;
    std::atomic<bool> hasLeft_ = false;
    std::optional<double> alarm_;
    std::vector<double> starts_;
    const platform::InTestLifetime<platform::ServiceManager> inLifetime_{*this};
};

}  // namespace veltoid::testing_support
