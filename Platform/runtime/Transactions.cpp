#include "Platform/runtime/Transactions.h"

#include <algorithm>
#include <mutex>
#include <utility>
#include <vector>

#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"

namespace platform::transactions {
namespace {

/// Guarded by its mutex.
struct State {
    std::mutex mutex;
    long open = 0;
    std::vector<std::function<void()>> waiting;
    /// Null while no function waits for the process to be idle.
    std::function<void()> whenIdle;
    double idleSeconds = 0;
    double idleSince = 0;
    bool timerArmed = false;
};

State& shared() { return Lifetime::current().state<State>(); }

/// The timer is not moved when the process becomes busy and idle again, which it does with every request: it
/// fires when it may be time and is armed anew for what is left. Called with the lock held.
void armTimer(State& state, double seconds);

void timerFired() {
    State& state = shared();
    std::unique_lock lock(state.mutex);
    state.timerArmed = false;
    if (state.open > 0 || !state.whenIdle) return;
    const double now = Clock::shared().now();
    // In the future if the clock was set back: then the idle time begins again.
    state.idleSince = std::min(state.idleSince, now);
    const double left = state.idleSeconds - (now - state.idleSince);
    if (left > 0) {
        armTimer(state, left);
        return;
    }
    auto function = std::exchange(state.whenIdle, nullptr);
    lock.unlock();
    WorkQueue::main().async(std::move(function));
}

void armTimer(State& state, double seconds) {
    state.timerArmed = true;
    Clock::shared().callAfter(seconds, Clock::Use::Task, timerFired);
}

void becameIdle(State& state) {
    if (!state.whenIdle) return;
    state.idleSince = Clock::shared().now();
    if (!state.timerArmed) armTimer(state, state.idleSeconds);
}

void queueOnMain(std::vector<std::function<void()>> functions) {
    for (auto& function : functions) WorkQueue::main().async(std::move(function));
}

}  // namespace

void began() {
    State& state = shared();
    const std::lock_guard lock(state.mutex);
    ++state.open;
}

void ended() {
    State& state = shared();
    std::unique_lock lock(state.mutex);
    if (--state.open > 0) return;
    becameIdle(state);
    if (state.waiting.empty()) return;
    auto waiting = std::exchange(state.waiting, {});
    lock.unlock();
    queueOnMain(std::move(waiting));
}

long openCount() {
    State& state = shared();
    const std::lock_guard lock(state.mutex);
    return state.open;
}

void whenNoneIsOpen(std::function<void()> function) {
    State& state = shared();
    std::unique_lock lock(state.mutex);
    if (state.open > 0) {
        state.waiting.push_back(std::move(function));
        return;
    }
    lock.unlock();
    queueOnMain({std::move(function)});
}

void whenNoneWasOpenFor(double seconds, std::function<void()> function) {
    State& state = shared();
    const std::lock_guard lock(state.mutex);
    state.idleSeconds = seconds;
    state.whenIdle = std::move(function);
}

}  // namespace platform::transactions
