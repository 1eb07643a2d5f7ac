#include "VeltoIDAuthd/AccountCheck.h"

#include <algorithm>
#include <atomic>

#include "IPCHelpers/Transaction.h"
#include "Platform/keychain/LockState.h"
#include "Platform/net/HTTPSession.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/KeychainIdentity.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDAuthenticationImpl/AccountActions.h"
#include "VeltoIDAuthenticationImpl/AccountBackOff.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/ItemOwnership.h"

namespace veltoid {
namespace {

// Seconds.
constexpr double kDay = 86'400;
constexpr double kDefaultRelaunchInterval = 1'209'600;
constexpr double kMinRelaunchInterval = 900;

// Between two attempts to read a database that cannot be read (seconds).
constexpr double kFirstRetry = 2;
constexpr double kMaxRetry = 60;
constexpr double kRetryGrowth = 1.5;
constexpr double kUnreadableKeychainRetry = 900;

double relaunchInterval() {
    const double seconds =
        metaInterval(nullptr, {}, kVeltoIDMetaRelaunchIntervalKey, kDefaultRelaunchInterval);
    return seconds > 0 ? std::clamp(seconds, kMinRelaunchInterval, kDefaultRelaunchInterval)
                       : kDefaultRelaunchInterval;
}

struct CheckState {
    /// Signals that come while the loop is busy are kept.
    const platform::Semaphore semaphore;
    const platform::WorkQueue queue{"accountCheckDispatch"};
    std::atomic<bool> isStarted{false};
    std::function<void()> onPass;

    void lifetimeEnds() { semaphore.signal(); }
};

CheckState& state() { return platform::Lifetime::current().state<CheckState>(); }

bool isEnding() { return platform::Lifetime::current().isEnding(); }

/// The loop's state belongs to its queue.
class AccountCheckLoop {
  public:
    void run() {
        waitForDatabase();
        __VeltoIDCleanupAccountsAndCertificates({});
        while (!isEnding()) {
            waitForUnlock();
            waitForDatabase();
            pass();
        }
    }

  private:
    /// While nothing is known of the accounts the agent stays, and tries again soon.
    static void waitForDatabase() {
        double pause = kFirstRetry;
        for (; !isEnding() && !__VeltoIDDBIsReadable(); pause = std::min(pause * kRetryGrowth, kMaxRetry)) {
            scheduleRelaunch(platform::now() + kMaxRetry);
            (void)state().semaphore.wait(pause);
        }
    }

    void waitForUnlock() {
        auto& lockState = platform::LockState::shared();
        if (lockState.hasBeenUnlockedSinceBoot()) return;
        lockState.onChange([&lockState] {
            wakeAccountCheck();
            lockState.onChange(nullptr);
        });
        while (!lockState.hasBeenUnlockedSinceBoot() && !isEnding()) {
            // Nobody tells when a keychain can be read again.
            const double pause = keychainTrouble() ? kUnreadableKeychainRetry : kDay;
            scheduleRelaunch(platform::now() + pause);
            wait(pause);
        }
        lockState.onChange(nullptr);
    }

    /// Waits without a transaction, until something signals, the clock jumps, or the time is over.
    void wait(double seconds) {
        transaction_.close();
        const bool signalled = state().semaphore.wait(seconds);
        transaction_.reopen();
        if (signalled && !woken_) woken_ = platform::now();
        while (state().semaphore.wait(0)) {
        }
    }

    /// How long to keep still, the distance from the last pass and from what has woken the loop since: who
    /// has changed something may not be done yet. A clock that was set back is no reason to wait for longer.
    double missingDistance() const {
        double most = 0;
        for (const auto& since : {lastPass_, woken_}) {
            const double missing = since ? *since + kMinTimeBetweenPasses - platform::now() : 0;
            if (missing <= kMinTimeBetweenPasses) most = std::max(most, missing);
        }
        return most;
    }

    /// Looks at the accounts that are due, or waits for the first of them.
    void pass() {
        std::optional<double> earliest;
        const Array accounts = copyAccountsNeedingAction(&earliest);
        if (accounts.empty() || !earliest || !platform::isHTTPSClientAvailable())
            return sleepWithoutAccounts();
        const double now = platform::now();
        const double missing = std::max(*earliest - now, missingDistance());
        if (missing > 0) {
            scheduleRelaunch(now + missing);
            return wait(std::min(missing, relaunchInterval()));
        }
        // It may have been locked while the loop slept: a pass that can read nothing counts for nothing.
        if (!platform::LockState::shared().hasBeenUnlockedSinceBoot()) return;
        lastPass_ = now;
        woken_.reset();
        if (state().onPass) state().onPass();
        for (const Value& name : accounts) {
            const auto date = copyNextActionDateForAccount(name.asString());
            if (date && *date <= platform::now()) check(accountRecordOf(name.asString()));
        }
    }

    void sleepWithoutAccounts() {
        scheduleRelaunch(platform::now() + relaunchInterval());
        wait(platform::kForever);
        if (accountNames().empty()) __VeltoIDCleanupAccountsAndCertificates({});
    }

    static void check(const AccountRecord& record) {
        if (!record.accountName() || isEnding()) return;
        const AccountPass pass(record);
        checkAccount(record);
        pass.end();
    }

    /// Closed while the loop waits.
    Transaction transaction_{"accountCheck"};
    std::optional<double> lastPass_;
    std::optional<double> woken_;
};

}  // namespace

void startAccountCheck(double firstDelaySeconds, std::function<void()> onPass) {
    CheckState& check = state();
    if (check.isStarted.exchange(true)) return;
    check.onPass = std::move(onPass);
    __VeltoIDDBSetChangeSemaphore(check.semaphore);
    check.queue.asyncAfter(firstDelaySeconds, [] { AccountCheckLoop().run(); });
}

void wakeAccountCheck() {
    if (state().isStarted) state().semaphore.signal();
}

}  // namespace veltoid
