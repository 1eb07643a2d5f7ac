#include "VeltoIDAuthd/Agent.h"

#include <algorithm>
#include <cmath>
#include <csignal>
#include <cstdlib>
#include <functional>

#include "Logging/Log.h"
#include "Platform/bus/BusConnection.h"
#include "Platform/bus/ServiceManager.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/EventLoop.h"
#include "Platform/runtime/InstanceLock.h"
#include "Platform/runtime/WorkQueue.h"
#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthd/AccountCheck.h"
#include "VeltoIDAuthd/Listeners.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthd/Shutdown.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/FindPersonCache.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDKeychainItems/KeychainItems.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"

namespace veltoid {
namespace {

/// A relaunch is asked for at start, so that an agent that dies early comes back (seconds).
constexpr double kRelaunchAfterStart = 30;
constexpr double kLeaksPause = 1;

std::unique_ptr<platform::LockState> lockStateFor(const Agent::Configuration& configuration) {
    if (!configuration.line.usePreferences) return std::make_unique<platform::AlwaysUnlocked>();
    return std::make_unique<platform::KeychainLockState>(
        [name = configuration.product.unlockedNotification](std::function<void()> handler) {
            platform::bus::onPosted(name, std::move(handler));
        });
}

void flushOnInterrupt() {
    platform::event_loop::onSignal(SIGINT, [queue = platform::WorkQueue("flush on interrupt")] {
        queue.async([] { __VeltoIDDBSynchronize(); });
    });
}

void prepareDatabase(const CommandLine& line) {
    if (line.preferencesDomainName) __VeltoIDDBSetPreferencesDomainName(*line.preferencesDomainName);
    __VeltoIDDBSetUsePreferences(line.usePreferences);
    __VeltoIDDBSetFindPersonCacheUsePreferences(line.usePreferences);
    setUseSystemKeychain(line.usePreferences);
    for (const auto& [key, value] : line.metaInfoValues) {
        if (std::isfinite(numberFromText(value).asDouble().value_or(0)))
            __VeltoIDDBSetMetaInfoValue(nullptr, key, String(value));
        else
            VELTOID_LOG_FROM("prepareDatabase", kError, key, " is not stored: its value is not finite.");
    }
}

bool claimNames(const Agent::Configuration& configuration) {
    const CommandLine& line = configuration.line;
    return (!line.runsAuthentication() ||
            registerAuthenticationListener(
                line.authenticationServiceName.value_or(kVeltoIDAuthenticationServiceName))) &&
           (!line.checkPassword || registerPasswordCheckListener(configuration.linkedIdentity));
}

/// Every account is validated, at once unless the account check is about to start anyway, and clients that
/// know the connection may ask for more: enough work for a leak checker.
void workForLeakChecker() {
    for (const Value& name : accountNames())
        __VeltoIDDBSetAccountValue(name.asString(), kVeltoIDAccountForceValidationKey, Value::boolean(true));
    startAccountCheck(0);
    (void)registerAuthenticationListener({});
    (void)platform::Semaphore().wait(kLeaksPause);
}

}  // namespace

Agent::Agent(const Configuration& configuration)
    : lockState_(lockStateFor(configuration)),
      lifetime_(configuration.product, platform::Lifetime::Parts(configuration.parts).with(*lockState_)) {
    if (configuration.line.usePreferences && !platform::instance_lock::take()) return;
    platform::event_loop::prepare();
    isStarted_ = claimNames(configuration);
    if (isStarted_) start(configuration);
}

void Agent::start(const Configuration& configuration) {
    const CommandLine& line = configuration.line;
    prepareDatabase(line);
    setProcessHooks({[](double date) { scheduleRelaunch(date, RelaunchDate::OnlyIfEarlier); },
                     scheduleRequestedLaunch, shutDownByServer});
    flushOnInterrupt();
    prepareShutdown();
    if (line.runsAuthentication()) {
        restoreRequestedLaunch();
        scheduleRelaunch(platform::now() + kRelaunchAfterStart);
        // Half of the time for which an idle agent stays, so that it does not leave before.
        startAccountCheck(std::min(configuration.firstCheckDelay, idleExitSeconds() / 2));
    }
    platform::ServiceManager::shared().announceReady();
    if (line.leaks) workForLeakChecker();
}

int Agent::run() { return isStarted_ ? platform::event_loop::run() : EXIT_FAILURE; }

}  // namespace veltoid
