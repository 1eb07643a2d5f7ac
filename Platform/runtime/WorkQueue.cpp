#include "Platform/runtime/WorkQueue.h"

#include <algorithm>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <list>
#include <mutex>
#include <thread>
#include <vector>

#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"

namespace platform {
namespace {

constexpr auto kIdleThreadLifetime = std::chrono::seconds(10);

/// The queues that the current thread is on, innermost last.
thread_local std::vector<const WorkQueue::State*> tCurrentQueues;

/// Whether the current thread runs a queued task, and so counts as work for the clock.
thread_local bool tRunsCountedTask = false;

/// One blocked thread. While it is blocked it does not count as work; the thread that ends the block counts
/// it again before it can run, so that a simulated clock never sees a moment without work.
class BlockedThread {
  public:
    void release() {
        // Notified under the lock: the thread may leave, and end this object, the moment it is released.
        const std::lock_guard lock(mutex_);
        if (counted_) Clock::shared().workBegan();
        released_ = true;
        changed_.notify_one();
    }

    void block() {
        std::unique_lock lock(mutex_);
        if (counted_) Clock::shared().workEnded();
        changed_.wait(lock, [this] { return released_; });
    }

  private:
    const bool counted_ = tRunsCountedTask;
    std::mutex mutex_;
    std::condition_variable changed_;
    bool released_ = false;
};

}  // namespace

struct WorkQueue::State {
    struct Item {
        Task task;
        BlockedThread* waiter = nullptr;
    };

    explicit State(std::string name) : label(std::move(name)) {}

    const std::string label;
    std::mutex mutex;
    std::deque<Item> items;
    /// Some thread runs this queue's tasks or has been told to.
    bool active = false;
    /// Set for the main queue once the event loop runs it.
    std::function<void()> wakeLoop;
};

namespace {

using StatePointer = std::shared_ptr<WorkQueue::State>;

class CurrentQueueScope {
  public:
    explicit CurrentQueueScope(const WorkQueue::State* state) { tCurrentQueues.push_back(state); }
    ~CurrentQueueScope() { tCurrentQueues.pop_back(); }
    CurrentQueueScope(const CurrentQueueScope&) = delete;
    CurrentQueueScope& operator=(const CurrentQueueScope&) = delete;
};

bool isOnQueue(const WorkQueue::State* state) {
    return std::find(tCurrentQueues.begin(), tCurrentQueues.end(), state) != tCurrentQueues.end();
}

void drain(const StatePointer& state);

/// Threads that run ready queues: one more whenever a queue becomes ready and none is idle, fewer when idle
/// for long.
class ThreadPool {
  public:
    ~ThreadPool() {
        std::unique_lock lock(mutex_);
        isStopping_ = true;
        becameReady_.notify_all();
        lock.unlock();
        for (std::thread& thread : threads_) thread.join();
        if (retired_.joinable()) retired_.join();
    }

    void run(StatePointer queue) {
        const std::lock_guard lock(mutex_);
        ready_.push_back(std::move(queue));
        if (idle_ >= ready_.size()) {
            becameReady_.notify_one();
        } else {
            const auto thread = threads_.emplace(threads_.end());
            *thread = std::thread([this, thread] { work(thread); });
        }
    }

    /// Ends the next waitUntilQuiet.
    void interrupt() {
        const std::lock_guard lock(mutex_);
        isInterrupted_ = true;
        becameQuiet_.notify_all();
    }

    /// Waits until no queue is ready or runs, or for an interruption; true in the first case.
    bool waitUntilQuiet() {
        std::unique_lock lock(mutex_);
        const auto isQuiet = [this] { return ready_.empty() && idle_ == threads_.size(); };
        becameQuiet_.wait(lock, [&] { return isInterrupted_ || isQuiet(); });
        return !std::exchange(isInterrupted_, false);
    }

  private:
    using Threads = std::list<std::thread>;

    void work(Threads::iterator self) {
        std::unique_lock lock(mutex_);
        do {
            while (!ready_.empty()) {
                const StatePointer queue = std::move(ready_.front());
                ready_.pop_front();
                lock.unlock();
                drain(queue);
                lock.lock();
            }
            if (++idle_ == threads_.size()) becameQuiet_.notify_all();
            becameReady_.wait_for(lock, kIdleThreadLifetime,
                                  [this] { return isStopping_ || !ready_.empty(); });
            --idle_;
        } while (!ready_.empty());
        if (!isStopping_) retire(self, lock);
    }

    /// Each thread that leaves early is joined by the next one that does, the last one at the end.
    void retire(Threads::iterator self, std::unique_lock<std::mutex>& lock) {
        std::thread previous = std::exchange(retired_, std::move(*self));
        threads_.erase(self);
        lock.unlock();
        if (previous.joinable()) previous.join();
    }

    std::mutex mutex_;
    std::condition_variable becameReady_;
    std::condition_variable becameQuiet_;
    std::deque<StatePointer> ready_;
    Threads threads_;
    std::thread retired_;
    size_t idle_ = 0;
    bool isInterrupted_ = false;
    bool isStopping_ = false;
};

/// Runs a lifetime's queues.
class QueueRunner {
  public:
    ~QueueRunner() { std::erase(tCurrentQueues, main_.get()); }

    ThreadPool& pool() { return pool_; }
    const StatePointer& mainQueue() const { return main_; }

    void runDry();

  private:
    const StatePointer main_ = std::make_shared<WorkQueue::State>("main");
    ThreadPool pool_;
};

QueueRunner& runner() { return Lifetime::current().state<QueueRunner>(); }

/// Has a ready queue run; it counts as work until it has nothing to run or waits.
void runOnPool(const StatePointer& state) {
    Clock::shared().workBegan();
    runner().pool().run(state);
}

/// Hands the queue over to the next thread that waits for it, or to the pool. Called by the thread that has
/// it.
void passOn(const StatePointer& state, std::unique_lock<std::mutex>& lock) {
    if (state->items.empty()) {
        state->active = false;
    } else if (BlockedThread* waiter = state->items.front().waiter) {
        state->items.pop_front();
        lock.unlock();
        waiter->release();
    } else {
        lock.unlock();
        runOnPool(state);
    }
}

/// Runs a task as the queue's on the thread that has it. Nothing may escape from a task: a queue whose task
/// was left in the middle would never go on.
void runAndPassOn(const StatePointer& state, const std::function<void()>& task,
                  std::unique_lock<std::mutex>& lock) noexcept {
    {
        const CurrentQueueScope scope(state.get());
        task();
    }
    lock.lock();
    passOn(state, lock);
}

void runTask(const StatePointer& state, WorkQueue::Task& task) noexcept {
    const CurrentQueueScope scope(state.get());
    tRunsCountedTask = true;
    task();
    task = nullptr;
    tRunsCountedTask = false;
}

void drain(const StatePointer& state) {
    std::unique_lock lock(state->mutex);
    while (!state->items.empty() && state->items.front().waiter == nullptr) {
        WorkQueue::Task task = std::move(state->items.front().task);
        state->items.pop_front();
        lock.unlock();
        runTask(state, task);
        lock.lock();
    }
    passOn(state, lock);
    // Only now, when the thread that waited for the queue counts again.
    Clock::shared().workEnded();
}

void QueueRunner::runDry() {
    {
        const std::lock_guard lock(main_->mutex);
        if (main_->wakeLoop) main_->wakeLoop = [this] { pool_.interrupt(); };
    }
    do {
        if (main_->wakeLoop) main_queue::runPending();
    } while (!pool_.waitUntilQuiet());
}

[[noreturn]] void abortOnSyncOntoItself(const WorkQueue::State& target) {
    // NOLINTNEXTLINE(cert-err33-c): the process ends in any case
    std::fprintf(stderr, "sync onto queue \"%s\" from queue \"%s\", which runs on it\n", target.label.c_str(),
                 tCurrentQueues.back()->label.c_str());
    std::abort();
}

}  // namespace

WorkQueue::WorkQueue(std::string label) : state_(std::make_shared<State>(std::move(label))) {}

WorkQueue WorkQueue::main() { return WorkQueue(runner().mainQueue()); }

void WorkQueue::async(Task task) const {
    std::unique_lock lock(state_->mutex);
    state_->items.push_back({std::move(task), nullptr});
    if (state_->wakeLoop) {
        Clock::shared().workBegan();
        state_->wakeLoop();
    } else if (!state_->active) {
        state_->active = true;
        lock.unlock();
        runOnPool(state_);
    }
}

void WorkQueue::asyncAfter(double seconds, Task task) const {
    if (!(seconds > 0)) {
        async(std::move(task));
        return;
    }
    Clock::shared().callAfter(seconds, Clock::Use::Task,
                              [queue = *this, task = std::move(task)] { queue.async(task); });
}

void WorkQueue::runSync(const std::function<void()>& function) const {
    if (isOnQueue(state_.get())) abortOnSyncOntoItself(*state_);
    std::unique_lock lock(state_->mutex);
    if (state_->wakeLoop) {
        lock.unlock();
        BlockedThread caller;
        async([&] {
            function();
            caller.release();
        });
        caller.block();
        return;
    }
    if (state_->active) {
        BlockedThread waiter;
        state_->items.push_back({nullptr, &waiter});
        lock.unlock();
        waiter.block();
    } else {
        state_->active = true;
        lock.unlock();
    }
    runAndPassOn(state_, function, lock);
}

bool WorkQueue::tryRunNow(const Task& task) const {
    std::unique_lock lock(state_->mutex);
    if (state_->active || state_->wakeLoop || !state_->items.empty()) return false;
    state_->active = true;
    lock.unlock();
    runAndPassOn(state_, task, lock);
    return true;
}

bool WorkQueue::isEmpty() const {
    const std::lock_guard lock(state_->mutex);
    return state_->items.empty();
}

const std::string& WorkQueue::label() const { return state_->label; }

bool WorkQueue::isCurrent() const { return isOnQueue(state_.get()); }

const std::string* WorkQueue::currentLabel() {
    return tCurrentQueues.empty() ? nullptr : &tCurrentQueues.back()->label;
}

namespace main_queue {

void adopt(std::function<void()> wake) {
    const StatePointer& state = runner().mainQueue();
    tCurrentQueues.push_back(state.get());
    const std::lock_guard lock(state->mutex);
    state->wakeLoop = std::move(wake);
    if (!state->items.empty()) state->wakeLoop();
}

void runPending() {
    const StatePointer& state = runner().mainQueue();
    std::unique_lock lock(state->mutex);
    for (size_t left = state->items.size(); left > 0; --left) {
        WorkQueue::Task task = std::move(state->items.front().task);
        state->items.pop_front();
        lock.unlock();
        runTask(state, task);
        Clock::shared().workEnded();
        lock.lock();
    }
}

}  // namespace main_queue

// --- Semaphore

struct Semaphore::State {
    struct Waiter {
        BlockedThread thread;
        bool tookSignal = false;
    };

    std::mutex mutex;
    long count = 0;
    std::deque<std::shared_ptr<Waiter>> waiters;
};

Semaphore::Semaphore(long initialCount) : state_(std::make_shared<State>()) { state_->count = initialCount; }

void Semaphore::signal() const {
    std::unique_lock lock(state_->mutex);
    if (state_->waiters.empty()) {
        ++state_->count;
        return;
    }
    const std::shared_ptr<State::Waiter> waiter = std::move(state_->waiters.front());
    state_->waiters.pop_front();
    waiter->tookSignal = true;
    lock.unlock();
    waiter->thread.release();
}

bool Semaphore::wait(double seconds) const {
    const auto waiter = std::make_shared<State::Waiter>();
    {
        const std::lock_guard lock(state_->mutex);
        if (state_->count > 0) {
            --state_->count;
            return true;
        }
        if (!(seconds > 0)) return false;
        state_->waiters.push_back(waiter);
    }
    std::optional<Clock::TimerID> timer;
    if (seconds < kForever) {
        timer = Clock::shared().callAfter(seconds, Clock::Use::WaitForDate, [state = state_, waiter] {
            std::unique_lock lock(state->mutex);
            const auto position = std::find(state->waiters.begin(), state->waiters.end(), waiter);
            if (position == state->waiters.end()) return;
            state->waiters.erase(position);
            lock.unlock();
            waiter->thread.release();
        });
    }
    waiter->thread.block();
    if (timer) Clock::shared().cancel(*timer);
    const std::lock_guard lock(state_->mutex);
    return waiter->tookSignal;
}

}  // namespace platform
