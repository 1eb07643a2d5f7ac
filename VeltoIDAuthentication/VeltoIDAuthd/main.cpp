// The agent: opens the log, reads the command line, registers its services and serves the main queue until it
// is ended.
#include <sys/prctl.h>
#include <sys/resource.h>

#include <clocale>
#include <csignal>
#include <cstdio>
#include <cstdlib>

#include "Logging/Log.h"
#include "Platform/bus/EventLoop.h"
#include "Platform/keychain/LockState.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/InstanceLock.h"
#include "Platform/runtime/SystemLog.h"
#include "Platform/runtime/WorkQueue.h"
#include "VeltoIDAuthd/AccountCheck.h"
#include "VeltoIDAuthd/AgentCommandLine.h"
#include "VeltoIDAuthd/Listeners.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthd/Shutdown.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/FindPersonCache.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/RecordKeys.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDKeychainItems/KeychainItems.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"

namespace veltoid {
namespace {

/// A relaunch is asked for at start, so that an agent that dies early comes back (seconds).
constexpr double kRelaunchAfterStart = 30;
constexpr double kLeaksPause = 1;

/// Memory of this process holds password hashes: it is never written to a core file, nor open to debuggers.
void keepMemoryPrivate() {
    const rlimit none{0, 0};
    setrlimit(RLIMIT_CORE, &none);
#ifndef VELTOID_SANITIZED
    // Sanitizers look at their own process the way a debugger does.
    prctl(PR_SET_DUMPABLE, 0);
#endif
}

[[noreturn]] void exitWithUsage(int argc, char* const* argv, const CommandLineError& error) {
    VELTOID_LOG_FROM("main", kError,
                     "Got an unexpected argument; ch = " << error.option << " index=" << error.index);
    std::printf("%s : [ --checkpassword ] [ --authentication ]\n", argc > 0 ? argv[0] : "unknown");
    platform::event_loop::exitProcess(-1);
}

void flushOnInterrupt() {
    static const auto* flushQueue = new platform::WorkQueue("flush on interrupt");
    platform::event_loop::onSignal(SIGINT, [] { flushQueue->async([] { __VeltoIDDBSynchronize(); }); });
}

void prepareDatabase(const CommandLine& line) {
    if (line.preferencesDomainName) __VeltoIDDBSetPreferencesDomainName(*line.preferencesDomainName);
    __VeltoIDDBSetUsePreferences(line.usePreferences);
    __VeltoIDDBSetFindPersonCacheUsePreferences(line.usePreferences);
    setUseSystemKeychain(line.usePreferences);
    if (!line.usePreferences) platform::LockState::assumeUnlocked();
    for (const auto& [key, value] : line.metaInfoValues)
        __VeltoIDDBSetMetaInfoValue(nullptr, key, String(value));
}

void startServices(const CommandLine& line) {
    if (line.runsAuthentication()) {
        scheduleRelaunch(platform::now() + kRelaunchAfterStart);
        startAccountCheck(kVeltoIDFirstAccountCheckDelay);
        registerAuthenticationListener(
            line.authenticationServiceName.value_or(kVeltoIDAuthenticationServiceName));
    }
    if (line.checkPassword) registerPasswordCheckListener();
}

/// Every account is validated, at once unless the account check is about to start anyway, and whoever knows
/// the connection may ask for more: enough work for a leak checker.
void workForLeakChecker() {
    Array names;
    __VeltoIDDBCopyVeltoIDs(&names);
    for (const Value& name : names)
        __VeltoIDDBSetAccountValue(name.asString(), kVeltoIDAccountForceValidationKey, Value::boolean(true),
                                   Notify::Yes);
    startAccountCheck(0);
    registerAuthenticationListener({});
    (void)platform::Semaphore().wait(kLeaksPause);
}

}  // namespace
}  // namespace veltoid

int main(int argc, char** argv) {
    using namespace veltoid;
    keepMemoryPrivate();
    std::setlocale(LC_CTYPE, "");
    platform::event_loop::prepare();
    platform::SystemLog::shared().open(program_invocation_short_name);

    CommandLineError error;
    const auto line = parseCommandLine(argc, argv, error);
    if (!line) exitWithUsage(argc, argv, error);
    if (line->usePreferences) platform::instance_lock::waitForPrevious();
    prepareDatabase(*line);
    setRelaunchScheduler([](double date) { scheduleRelaunch(date); });
    flushOnInterrupt();
    prepareShutdown();
    startServices(*line);
    if (line->leaks) workForLeakChecker();
    platform::event_loop::run();
}
