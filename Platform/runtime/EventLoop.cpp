#include "Platform/runtime/EventLoop.h"

#include <sys/eventfd.h>
#include <systemd/sd-event.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <list>
#include <utility>

#include "Platform/runtime/FileDescriptor.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"

namespace platform::event_loop {
namespace {

/// Main thread only, except that any thread writes to the descriptor.
struct Loop {
    sd_event* loop = nullptr;
    FileDescriptor wakeDescriptor;
    /// The loop keeps pointers to them, so they must not move.
    std::list<std::function<void()>> signalHandlers;

    ~Loop() { sd_event_unref(loop); }
};

Loop& state() { return Lifetime::current().state<Loop>(); }

[[noreturn]] void fail(const char* what, int error) {
    // NOLINTNEXTLINE(cert-err33-c): the process ends in any case
    std::fprintf(stderr, "event loop: %s: %s\n", what, std::strerror(error));
    std::abort();
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

/// Hands a new source over to the loop. It goes before new messages: their replies would have to stand behind
/// what waits here.
void keep(sd_event_source* source, int result, const char* what) {
    if (result >= 0) result = sd_event_source_set_priority(source, SD_EVENT_PRIORITY_IMPORTANT);
    if (result >= 0) result = sd_event_source_set_floating(source, 1);
    sd_event_source_unref(source);
    if (result < 0) fail(what, -result);
}

}  // namespace

void prepare() {
    sigset_t served;
    sigemptyset(&served);
    sigaddset(&served, SIGINT);
    sigaddset(&served, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &served, nullptr);
    std::signal(SIGPIPE, SIG_IGN);

    Loop& made = state();
    if (const int result = sd_event_new(&made.loop); result < 0) fail("creating", -result);
    made.wakeDescriptor = FileDescriptor(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    const int descriptor = made.wakeDescriptor.number();
    if (descriptor < 0) fail("creating wake descriptor", errno);
    sd_event_source* wake = nullptr;
    const int result = sd_event_add_io(made.loop, &wake, descriptor, EPOLLIN, woken, nullptr);
    keep(wake, result, "watching wake descriptor");
    main_queue::adopt([descriptor] {
        const uint64_t one = 1;
        if (write(descriptor, &one, sizeof one) < 0 && errno != EAGAIN) fail("waking", errno);
    });
}

void onSignal(int signal, std::function<void()> handler) {
    Loop& current = state();
    void* context = &current.signalHandlers.emplace_back(std::move(handler));
    sd_event_source* source = nullptr;
    const int result = sd_event_add_signal(current.loop, &source, signal, signalled, context);
    keep(source, result, "watching signal");
}

int run() {
    const int result = sd_event_loop(state().loop);
    if (result < 0) fail("running", -result);
    return result;
}

void stop(int status) { (void)sd_event_exit(state().loop, status); }

sd_event* handle() { return state().loop; }

}  // namespace platform::event_loop
