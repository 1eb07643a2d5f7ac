#include "VeltoIDAuthd/AccountCheck.h"

#include <algorithm>
#include <atomic>
#include <map>
#include <mutex>
#include <string>

#include "IPCHelpers/Transaction.h"
#include "Platform/keychain/LockState.h"
#include "Platform/net/OptionalLibrary.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/WorkQueue.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/RecordKeys.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDAuthenticationImpl/AccountActions.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"
#include "VeltoIDAuthenticationImpl/Cleanup.h"

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

/// Signals that come while the loop is busy are kept.
const platform::Semaphore& checkSemaphore() {
    static const auto* semaphore = new platform::Semaphore;
    return *semaphore;
}

std::atomic<bool> isStarted{false};

std::function<void()>& passObserver() {
    static auto* observer = new std::function<void()>;
    return *observer;
}

/// Accounts that a pass left as due as it found them.
class Deferrals {
  public:
    /// When the account is next looked at, if its own date is `date`.
    double dateFor(const String& accountName, double date) const {
        const auto found = deferrals_.find(accountName.text());
        return found != deferrals_.end() ? std::max(date, found->second.until) : date;
    }

    /// After a pass over the account.
    void note(const String& accountName) {
        std::optional<double> next;
        const bool isForeseen = copyNextActionDateForAccount(accountName, &next) && next;
        const bool isChanged =
            __VeltoIDDBCopyAccountValue(accountName, kVeltoIDDirtyKey).asBoolean().value_or(false);
        if (!isForeseen || isChanged || *next > platform::now()) {
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
    /// The accounts' marks are taken: no other pass will find them.
    bool isForChanged = false;
};

/// The loop's state belongs to its queue.
class AccountCheckLoop {
  public:
    [[noreturn]] void run() {
        while (true) {
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
        while (!lockState.hasBeenUnlockedSinceBoot()) {
            scheduleRelaunch(platform::now() + kDay);
            (void)wait(kDay);
        }
        lockState.onChange(nullptr);
    }

    /// Waits for a signal without a transaction; true when one came. A jump of the clock ends it too.
    bool wait(double seconds) {
        transaction_.close();
        const bool signalled = checkSemaphore().wait(seconds);
        transaction_.reopen();
        return signalled;
    }

    /// Waits until a pass is allowed again; what signals meanwhile is looked at by that pass.
    void keepDistance() {
        const platform::Semaphore neverSignalled;
        while (lastPass_) {
            const double missing = *lastPass_ + kMinTimeBetweenPasses - platform::now();
            // A clock that was set back is no reason to wait for longer.
            if (missing <= 0 || missing > kMinTimeBetweenPasses) break;
            transaction_.close();
            (void)neverSignalled.wait(missing);
            transaction_.reopen();
        }
        while (checkSemaphore().wait(0)) {
        }
        lastPass_ = platform::now();
    }

    Plan plan() const {
        if (auto changed = __VeltoIDDBCopyDirtyVeltoIDs(DirtyMarks::ClearAll))
            return {std::move(*changed), platform::now(), true};
        std::optional<double> ignored;
        Plan plan{copyAccountsNeedingAction(&ignored), {}, false};
        for (const Value& name : plan.accounts) {
            std::optional<double> date;
            if (!copyNextActionDateForAccount(name.asString(), &date) || !date) continue;
            const double deferred = deferrals_.dateFor(name.asString(), *date);
            plan.date = plan.date ? std::min(*plan.date, deferred) : deferred;
        }
        return plan;
    }

    void pass() {
        const Plan next = plan();
        if (!sleepUntilTimeFor(next)) return;
        keepDistance();
        if (!platform::LockState::shared().hasBeenUnlockedSinceBoot()) return giveBack(next);
        if (next.accounts.empty()) {
            __VeltoIDCleanupAccountsAndCertificates({});
        } else {
            check(next.accounts);
        }
    }

    /// The plan is for later: the keychain was locked while the loop slept.
    static void giveBack(const Plan& plan) {
        if (!plan.isForChanged) return;
        for (const Value& name : plan.accounts)
            __VeltoIDDBSetAccountValue(name.asString(), kVeltoIDDirtyKey, Value::boolean(true), Notify::No);
    }

    /// False when the sleep has ended before its time, by a change or by the clock: the plan may be another
    /// one now.
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
        if (passObserver()) passObserver()();
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

void startAccountCheck(double firstDelaySeconds) {
    static std::once_flag once;
    std::call_once(once, [firstDelaySeconds] {
        __VeltoIDDBSetChangeSemaphore(checkSemaphore());
        isStarted = true;
        static const auto* queue = new platform::WorkQueue("accountCheckDispatch");
        queue->asyncAfter(firstDelaySeconds, [] { AccountCheckLoop().run(); });
    });
}

void observeAccountCheck(std::function<void()> observer) { passObserver() = std::move(observer); }

void wakeAccountCheck() {
    if (isStarted) checkSemaphore().signal();
}

}  // namespace veltoid
