// Serial work queues over a pool of threads, the main queue, and the counting semaphore. Everything in the
// agent that runs, waits or is delayed goes through these, and through the Clock beneath them.
//
// A queue runs its tasks one at a time in the order in which they came. It costs no thread while it is empty.
// `sync` on an idle queue runs on the caller's thread: waking another thread costs more than most operations
// take.
//
// The end of a lifetime runs what is queued, until no queue has anything left (Lifetime.h).
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <type_traits>
#include <utility>

#include "Platform/runtime/Clock.h"

namespace platform {

/// A handle; copies name the same queue. All operations may be called from any thread.
class WorkQueue {
  public:
    using Task = std::function<void()>;

    explicit WorkQueue(std::string label);

    /// The queue labelled "main". Its tasks run on the event loop's thread while the loop runs (EventLoop.h),
    /// and like those of any other queue before.
    static WorkQueue main();

    void async(Task task) const;

    /// Queues the task after `seconds`; at once when not positive. Dropped if the lifetime ends before.
    void asyncAfter(double seconds, Task task) const;

    /// Runs `function` on this queue, after everything queued before it, and returns its result. Waiting for
    /// a queue that the caller is already on can never end: it aborts the process with both labels.
    template <typename Function>
    std::invoke_result_t<Function> sync(Function&& function) const {
        using Result = std::invoke_result_t<Function>;
        if constexpr (std::is_void_v<Result>) {
            runSync([&] { function(); });
        } else {
            std::optional<Result> result;
            runSync([&] { result.emplace(function()); });
            return std::move(*result);
        }
    }

    /// Runs `task` on the caller's thread as this queue's task if the queue is idle; otherwise does nothing.
    bool tryRunNow(const Task& task) const;

    /// Whether nothing waits to be run. A task that runs right now does not count.
    bool isEmpty() const;

    const std::string& label() const;

    /// Whether the caller runs on this queue right now.
    bool isCurrent() const;

    /// The label of the queue that the caller runs on, or null when it runs on none.
    static const std::string* currentLabel();

    friend bool operator==(const WorkQueue& a, const WorkQueue& b) { return a.state_ == b.state_; }

    struct State;

  private:
    explicit WorkQueue(std::shared_ptr<State> state) : state_(std::move(state)) {}
    void runSync(const std::function<void()>& function) const;

    std::shared_ptr<State> state_;
};

/// Counting semaphore. Copies name the same semaphore; all operations may be called from any thread.
class Semaphore {
  public:
    explicit Semaphore(long initialCount = 0);

    void signal() const;

    void wait() const { (void)wait(kForever); }

    /// Takes one signal, waiting for it at most `seconds`; false when there was none. A jump of the real-time
    /// clock ends the wait early (false), so that the caller looks at the date again, and so does the end of
    /// the lifetime.
    bool wait(double seconds) const;

  private:
    struct State;
    std::shared_ptr<State> state_;
};

/// What the event loop needs to run the main queue's tasks on its own thread.
namespace main_queue {

/// From now on the main queue's tasks wait until runPending; `wake` is called, from any thread, when there is
/// one. Called on the thread that will run them and end the lifetime, which is on the main queue until then.
void adopt(std::function<void()> wake);

/// Runs what is queued when it is called. On the adopting thread only.
void runPending();

}  // namespace main_queue

}  // namespace platform
