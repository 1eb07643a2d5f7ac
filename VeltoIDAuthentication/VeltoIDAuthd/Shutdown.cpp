#include "VeltoIDAuthd/Shutdown.h"

#include <atomic>
#include <charconv>
#include <cmath>
#include <csignal>
#include <cstdlib>
#include <string_view>

#include "Logging/Log.h"
#include "Platform/bus/BusConnection.h"
#include "Platform/bus/MessageService.h"
#include "Platform/bus/ServiceManager.h"
#include "Platform/runtime/EventLoop.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/Transactions.h"
#include "Platform/runtime/WorkQueue.h"
#include "VeltoIDAuthenticationDB/FindPersonCache.h"
#include "VeltoIDAuthenticationDB/Store.h"

namespace veltoid {
namespace {

constexpr const char* kIdleExitVariable = "HARBWELL_IDLE_EXIT";

/// How long the agent stays without anything to do (seconds).
constexpr double kDefaultIdleExit = 30;

/// How long open transactions may hold up the end after SIGTERM, and after a command (seconds).
constexpr double kMaxTermination = 10;
constexpr double kMaxCommandedEnd = 1;

/// How long the end waits for a busy service manager to take the relaunch time (seconds).
constexpr double kMaxHandOver = 2;

double readIdleExit() {
    const char* text = std::getenv(kIdleExitVariable);
    if (text == nullptr) return kDefaultIdleExit;
    const std::string_view number = text;
    double seconds = 0;
    const auto [end, error] = std::from_chars(number.data(), number.data() + number.size(), seconds);
    if (error == std::errc() && end == number.data() + number.size() && std::isfinite(seconds) &&
        seconds >= 0) {
        if (seconds == 0) seconds = platform::kForever;
        return seconds;
    }
    VELTOID_LOG_FROM("idleExitSeconds", kError, kIdleExitVariable, " is not a number of seconds; using ",
                     kDefaultIdleExit, ".");
    return kDefaultIdleExit;
}

struct Leaving {
    std::atomic<bool> hasBegun{false};
    const double idleExit = readIdleExit();
};

Leaving& leaving() { return platform::Lifetime::current().state<Leaving>(); }

/// Makes the delayed writes now.
void makeDurable() {
    __VeltoIDDBSynchronize();
    __VeltoIDDBWriteFindPersonCache();
}

void endProcess() {
    makeDurable();
    const platform::WorkQueue mainQueue = platform::WorkQueue::main();
    const auto end = [] {
        platform::ServiceManager::shared().announceStopping();
        platform::bus::flush();
        platform::event_loop::stop(EXIT_SUCCESS);
    };
    mainQueue.async([end] { platform::ServiceManager::shared().whenHandedOver(end); });
    mainQueue.asyncAfter(kMaxHandOver, end);
}

/// Answers the requests that have arrived and finishes the work under way. Stored values are synced at once:
/// their delayed write would keep the agent running for a while.
void endWhenWorkIsDone() {
    makeDurable();
    platform::transactions::whenNoneIsOpen([] {
        if (platform::transactions::openCount() > 0)
            endWhenWorkIsDone();
        else
            endProcess();
    });
}

void leave() {
    if (leaving().hasBegun.exchange(true)) return;
    // Before the names are free: a start that is asked for while the service manager believes that the agent
    // runs would come to nothing.
    platform::ServiceManager::shared().announceStopping();
    platform::message_service::announceTermination();
    platform::message_service::releaseNames(endWhenWorkIsDone);
}

void shutDownWithin(double seconds) {
    leave();
    platform::WorkQueue::main().asyncAfter(seconds, endProcess);
}

void terminate() { shutDownWithin(kMaxTermination); }

void shutDownWhenIdle(double seconds) {
    platform::transactions::whenNoneWasOpenFor(seconds, [seconds] {
        platform::ServiceManager::shared().canStartAgain([seconds](bool can) {
            if (can && platform::transactions::openCount() == 0)
                leave();
            else
                shutDownWhenIdle(seconds);
        });
    });
}

}  // namespace

double idleExitSeconds() { return leaving().idleExit; }

void prepareShutdown() {
    platform::event_loop::onSignal(SIGTERM, terminate);
    // Without its bus no client can reach the agent, and it would only hold up the end of a log-in session.
    platform::message_service::onConnectionLost(terminate);
    if (const double seconds = idleExitSeconds(); std::isfinite(seconds)) shutDownWhenIdle(seconds);
}

bool isLeaving() { return leaving().hasBegun; }

void shutDownByServer() { platform::WorkQueue::main().async(terminate); }

void shutDownByCommand() {
    platform::WorkQueue::main().async([] { shutDownWithin(kMaxCommandedEnd); });
}

}  // namespace veltoid
