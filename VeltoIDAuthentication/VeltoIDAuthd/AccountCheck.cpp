#include "VeltoIDAuthd/AccountCheck.h"

#include <algorithm>
#include <atomic>
#include <map>
#include <string>

#include "IPCHelpers/Transaction.h"
#include "Platform/keychain/LockState.h"
#include "Platform/net/HTTPSession.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDAuthenticationImpl/AccountActions.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/ItemOwnership.h"

namespace veltoid {
namespace {

// Seconds.
constexpr double kDay = 86'400;
constexpr double kDefaultRelaunchInterval = 1'209'600;
constexpr double kFirstDeferral = 60;
constexpr double kDeferralGrowth = 1.5;

double relaunchInterval() {
    return metaInterval(nullptr, {}, kVeltoIDMetaRelaunchIntervalKey, kDefaultRelaunchInterval,
                        UnreadableInterval::Zero);
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

/// Accounts that were due before a pass and are still due after it.
class Deferrals {
  public:
    /// When the account is next looked at, if its own date is `date`.
    double dateFor(const String& accountName, double date) const {
        const auto found = deferrals_.find(accountName.text());
        return found != deferrals_.end() ? std::max(date, found->second.until) : date;
    }

    /// After a pass over the account.
    void note(const String& accountName) {
        const auto next = copyNextActionDateForAccount(accountName);
        if (!next || *next > platform::now() || accountRecordOf(accountName).isDirty()) {
            deferrals_.erase(accountName.text());
            return;
        }
        Deferral& deferral = deferrals_[accountName.text()];
        deferral.interval =
            deferral.interval > 0 ? std::min(deferral.interval * kDeferralGrowth, kDay) : kFirstDeferral;
        deferral.until = platform::now() + deferral.interval;
    }

  private:
    struct Deferral {
        double until = 0;
        double interval = 0;
    };
    std::map<std::string, Deferral> deferrals_;
};

/// What the next pass looks at, and when; no date without accounts.
struct Plan {
    Array accounts;
    std::optional<double> date;
    /// The accounts were chosen by their marks, which are cleared now: a later pass would not find them.
    bool isForChanged = false;
};

/// The loop's state belongs to its queue.
class AccountCheckLoop {
  public:
    void run() {
        while (!isEnding()) {
            waitForUnlock();
            pass();
        }
    }

  private:
    void waitForUnlock() {
        auto& lockState = platform::LockState::shared();
        if (lockState.hasBeenUnlockedSinceBoot()) return;
        lockState.onChange([&lockState] {
            wakeAccountCheck();
            lockState.onChange(nullptr);
        });
        while (!lockState.hasBeenUnlockedSinceBoot() && !isEnding()) {
            scheduleRelaunch(platform::now() + kDay);
            (void)wait(kDay);
        }
        lockState.onChange(nullptr);
    }

    /// Waits for a signal without a transaction; true when one came. A jump of the clock ends it too.
    bool wait(double seconds, const platform::Semaphore& semaphore = state().semaphore) {
        transaction_.close();
        const bool signalled = semaphore.wait(seconds);
        transaction_.reopen();
        return signalled;
    }

    /// Waits until a pass is allowed again; what signals meanwhile is looked at by that pass.
    void keepDistance() {
        while (lastPass_ && !isEnding()) {
            const double missing = *lastPass_ + kMinTimeBetweenPasses - platform::now();
            // A clock that was set back is no reason to wait for longer.
            if (missing <= 0 || missing > kMinTimeBetweenPasses) break;
            (void)wait(missing, platform::Semaphore());
        }
        while (state().semaphore.wait(0)) {
        }
        lastPass_ = platform::now();
    }

    Plan plan() const {
        if (auto changed = __VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::ClearAll))
            return {std::move(*changed), platform::now(), true};
        Plan plan{copyAccountsNeedingAction(nullptr), {}, false};
        for (const Value& name : plan.accounts) {
            const auto date = copyNextActionDateForAccount(name.asString());
            if (!date) continue;
            const double deferred = deferrals_.dateFor(name.asString(), *date);
            plan.date = plan.date ? std::min(*plan.date, deferred) : deferred;
        }
        return plan;
    }

    void pass() {
        const Plan next = plan();
        if (!sleepUntilTimeFor(next)) return;
        keepDistance();
        if (isEnding() || !platform::LockState::shared().hasBeenUnlockedSinceBoot()) return giveBack(next);
        if (next.accounts.empty()) {
            __VeltoIDCleanupAccountsAndCertificates({});
        } else {
            check(next.accounts);
        }
    }

    /// The plan is for later: the keychain was locked while the loop slept, or the agent ends.
    static void giveBack(const Plan& plan) {
        if (!plan.isForChanged) return;
        for (const Value& name : plan.accounts)
            __VeltoIDDBSetAccountValue(name.asString(), kVeltoIDDirtyKey, Value::boolean(true), Notify::No);
    }

    /// False when a change or the clock has ended the sleep early: the plan may be another one now.
    bool sleepUntilTimeFor(const Plan& next) {
        if (next.accounts.empty() || !next.date || !platform::isHTTPSClientAvailable()) {
            scheduleRelaunch(platform::now() + relaunchInterval());
            return wait(platform::kForever);
        }
        const double most = std::max(relaunchInterval(), kMinTimeBetweenPasses);
        scheduleRelaunch(*next.date);
        (void)wait(std::clamp(*next.date - platform::now(), kMinTimeBetweenPasses, most));
        return next.isForChanged || *next.date <= platform::now();
    }

    void check(const Array& accounts) {
        if (state().onPass) state().onPass();
        for (const Value& name : accounts) {
            const String accountName = name.asString();
            AccountRecord record;
            if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record)) continue;
            __VeltoIDDBSetAccountValue(accountName, kVeltoIDDirtyKey, Value::null(), Notify::No);
            checkAccount(record);
            deferrals_.note(accountName);
        }
    }

    /// Closed while the loop waits.
    Transaction transaction_{"accountCheck"};
    std::optional<double> lastPass_;
    Deferrals deferrals_;
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
