#include "Platform/Transactions.h"

#include <mutex>
#include <utility>
#include <vector>

#include "Platform/WorkQueue.h"

namespace platform::transactions {
namespace {

/// Guarded by its mutex; never destroyed.
struct State {
    std::mutex mutex;
    long open = 0;
    std::vector<std::function<void()>> waiting;

    static State& shared() {
        static auto* state = new State;
        return *state;
    }
};

void queueOnMain(std::vector<std::function<void()>> functions) {
    for (auto& function : functions) WorkQueue::main().async(std::move(function));
}

}  // namespace

void began() {
    State& state = State::shared();
    const std::lock_guard lock(state.mutex);
    ++state.open;
}

void ended() {
    State& state = State::shared();
    std::unique_lock lock(state.mutex);
    if (--state.open > 0 || state.waiting.empty()) return;
    auto waiting = std::exchange(state.waiting, {});
    lock.unlock();
    queueOnMain(std::move(waiting));
}

long openCount() {
    State& state = State::shared();
    const std::lock_guard lock(state.mutex);
    return state.open;
}

void whenNoneIsOpen(std::function<void()> function) {
    State& state = State::shared();
    std::unique_lock lock(state.mutex);
    if (state.open > 0) {
        state.waiting.push_back(std::move(function));
        return;
    }
    lock.unlock();
    queueOnMain({std::move(function)});
}

}  // namespace platform::transactions
