#include "VeltoIDAuthd/Relaunch.h"

#include <algorithm>
#include <cstdint>
#include <limits>
#include <memory>
#include <mutex>

#include "IPCHelpers/Transaction.h"
#include "Platform/bus/ServiceManager.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"
#include "Protocol/RecordKeys.h"
#include "Values/Error.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"

namespace veltoid {
namespace {

constexpr double kNoParticularTime = 1e10;
constexpr double kMaxInterval = std::numeric_limits<uint32_t>::max();

struct Launches {
    const double begun = platform::now();
    /// Guards the rest.
    std::mutex mutex;
    std::optional<double> next;
    double requestedByServer = 0;

    std::optional<double> requestAhead() const {
        return requestedByServer > platform::now() ? std::optional(requestedByServer) : std::nullopt;
    }
};

Launches& launches() { return platform::Lifetime::current().state<Launches>(); }

/// Main queue.
void handOver(double requested, RelaunchDate rule) {
    const double now = platform::now();
    const double target = requested > 0 ? requested : now + kNoParticularTime;
    Launches& current = launches();
    const std::lock_guard lock(current.mutex);
    if (rule == RelaunchDate::OnlyIfEarlier && current.next && target > *current.next) return;
    current.next.reset();
    if (target < now) return;
    current.next = target;
    const double delta = std::min(target, current.requestAhead().value_or(target)) - now;
    platform::ServiceManager::shared().setStartInterval(
        delta >= kMaxInterval ? std::numeric_limits<uint32_t>::max() : static_cast<uint32_t>(delta));
}

void setRequestedLaunch(double date) {
    const std::lock_guard lock(launches().mutex);
    launches().requestedByServer = date;
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

void scheduleRequestedLaunch(double date) {
    setRequestedLaunch(date);
    __VeltoIDDBSetMetaInfoValue(nullptr, kVeltoIDMetaRequestedLaunchDateKey, Value::date(date));
    scheduleRelaunch(date, RelaunchDate::OnlyIfEarlier);
}

void restoreRequestedLaunch() {
    const Value stored =
        __VeltoIDDBCopyMetaInfoValue(nullptr, {}, kVeltoIDMetaRequestedLaunchDateKey, Value::Kind::Date);
    setRequestedLaunch(stored.asDate().value_or(0));
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
    // What is due already is so when the next agent begins.
    if (earliest) scheduleRelaunch(std::max(*earliest, platform::now() + 1));
    __VeltoIDDBSynchronize();
}

std::optional<double> nextLaunchDate() {
    const std::lock_guard lock(launches().mutex);
    const auto requested = launches().requestAhead();
    return requested ? requested : launches().next;
}

double launchDate() { return launches().begun; }

}  // namespace veltoid
