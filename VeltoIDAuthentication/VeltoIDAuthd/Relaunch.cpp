#include "VeltoIDAuthd/Relaunch.h"

#include <cstdint>
#include <limits>
#include <memory>
#include <mutex>

#include "IPCHelpers/Transaction.h"
#include "Platform/bus/ServiceManager.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"
#include "Values/Error.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"

namespace veltoid {
namespace {

constexpr double kNoParticularTime = 1e10;
constexpr double kMaxInterval = std::numeric_limits<uint32_t>::max();

/// The next date is changed on the main queue only; the lock is for the status, which reads it from a
/// client's queue.
struct Launches {
    const double begun = platform::now();
    std::mutex mutex;
    std::optional<double> next;
};

Launches& launches() { return platform::Lifetime::current().state<Launches>(); }

/// Main queue.
void handOver(double requested, RelaunchDate rule) {
    const double now = platform::now();
    const double target = requested > 0 ? requested : now + kNoParticularTime;
    auto& [begun, mutex, next] = launches();
    const std::lock_guard lock(mutex);
    if (rule == RelaunchDate::OnlyIfEarlier && next && target > *next) return;
    const double delta = target - now;
    next.reset();
    if (delta < 0) return;
    next = now + delta;
    platform::ServiceManager::shared().setStartInterval(
        delta >= kMaxInterval ? std::numeric_limits<uint32_t>::max() : static_cast<uint32_t>(delta));
}

}  // namespace

void scheduleRelaunch(std::optional<double> date, RelaunchDate rule) {
    (void)launches();
    const auto keepAlive = std::make_shared<Transaction>("scheduleRelaunch");
    platform::WorkQueue::main().async([keepAlive, requested = date.value_or(0), rule] {
        handOver(requested, rule);
        keepAlive->close();
    });
}

Array copyAccountsNeedingAction(std::optional<double>* earliestDate) {
    Array needing;
    std::optional<double> earliest;
    for (const Value& name : accountNames()) {
        const auto date = copyNextActionDateForAccount(name.asString());
        if (!date) continue;
        needing.append(name);
        if (!earliest || *date < *earliest) earliest = date;
    }
    fill(earliestDate, earliest);
    return needing;
}

void computeRelaunchFromAccounts() {
    std::optional<double> earliest;
    copyAccountsNeedingAction(&earliest);
    if (earliest) scheduleRelaunch(earliest);
    __VeltoIDDBSynchronize();
}

std::optional<double> nextLaunchDate() {
    const std::lock_guard lock(launches().mutex);
    return launches().next;
}

double launchDate() { return launches().begun; }

}  // namespace veltoid
