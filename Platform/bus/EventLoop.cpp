#include "Platform/bus/EventLoop.h"

#include <sys/eventfd.h>
#include <systemd/sd-event.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "Platform/bus/BusConnection.h"
#include "Platform/bus/ServiceManager.h"
#include "Platform/runtime/WorkQueue.h"

namespace platform::event_loop {
namespace {

/// A service manager that is busy longer does not keep an ending process (seconds).
constexpr double kLongestHandOver = 2;

sd_event* loop = nullptr;
int wakeDescriptor = -1;

[[noreturn]] void fail(const char* what, int error) {
    // NOLINTNEXTLINE(cert-err33-c): the process ends in any case
    std::fprintf(stderr, "event loop: %s: %s\n", what, std::strerror(error));
    std::abort();
}

void wakeLoop() {
    const uint64_t one = 1;
    if (write(wakeDescriptor, &one, sizeof one) < 0 && errno != EAGAIN) fail("waking", errno);
}

// What a task throws has no caller to go to: the process ends there rather than inside the C library.
int woken(sd_event_source* /*source*/, int descriptor, uint32_t /*events*/, void* /*context*/) noexcept {
    uint64_t count = 0;
    if (read(descriptor, &count, sizeof count) < 0 && errno != EAGAIN) fail("reading wake-ups", errno);
    main_queue::runPending();
    return 0;
}

int signalled(sd_event_source* /*source*/, const signalfd_siginfo* /*info*/, void* context) noexcept {
    (*static_cast<std::function<void()>*>(context))();
    return 0;
}

}  // namespace

void prepare() {
    sigset_t served;
    sigemptyset(&served);
    sigaddset(&served, SIGINT);
    sigaddset(&served, SIGTERM);
    sigprocmask(SIG_BLOCK, &served, nullptr);
    std::signal(SIGPIPE, SIG_IGN);

    if (const int result = sd_event_default(&loop); result < 0) fail("creating", -result);
    wakeDescriptor = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (wakeDescriptor < 0) fail("creating wake descriptor", errno);
    sd_event_source* wake = nullptr;
    int result = sd_event_add_io(loop, &wake, wakeDescriptor, EPOLLIN, woken, nullptr);
    // Before new messages: their replies would have to stand behind those that wait here.
    if (result >= 0) result = sd_event_source_set_priority(wake, SD_EVENT_PRIORITY_IMPORTANT);
    if (result < 0) fail("watching wake descriptor", -result);
    main_queue::adopt(wakeLoop);
}

void onSignal(int signal, std::function<void()> handler) {
    // Lives as long as the process, like the signal's source.
    auto* kept = new std::function<void()>(std::move(handler));
    sd_event_source* source = nullptr;
    int result = sd_event_add_signal(loop, &source, signal, signalled, kept);
    if (result >= 0) result = sd_event_source_set_priority(source, SD_EVENT_PRIORITY_IMPORTANT);
    if (result < 0) fail("watching signal", -result);
}

void run() {
    const int result = sd_event_loop(loop);
    if (result < 0) fail("running", -result);
    exitProcess(result);
}

sd_event* handle() { return loop; }

void exitAfterPendingWork(int status) {
    const WorkQueue mainQueue = WorkQueue::main();
    const auto leave = [status] {
        ServiceManager::shared().announceStopping();
        bus::flush();
        exitProcess(status);
    };
    mainQueue.async([leave] { ServiceManager::shared().whenHandedOver(leave); });
    mainQueue.asyncAfter(kLongestHandOver, leave);
    if (!mainQueue.isCurrent()) Semaphore().wait();
}

void exitProcess(int status) {
    // NOLINTNEXTLINE(cert-err33-c): nobody is left to tell
    std::fflush(stdout);
    _exit(status);
}

}  // namespace platform::event_loop
