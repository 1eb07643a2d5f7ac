// What tests of queues and clocks stand on: the order in which things happened, and a queue that is held up.
#pragma once

#include <mutex>
#include <string>
#include <utility>

#include "Platform/runtime/WorkQueue.h"

namespace platform {

/// What happened, in order; from any thread.
class Journal {
  public:
    void add(const std::string& event) {
        const std::lock_guard lock(mutex_);
        text_ += text_.empty() ? event : " " + event;
    }
    /// What was added since the last time, separated by blanks.
    std::string take() {
        const std::lock_guard lock(mutex_);
        return std::exchange(text_, {});
    }

  private:
    std::mutex mutex_;
    std::string text_;
};

/// Occupies a queue from construction until it is opened.
class Gate {
  public:
    explicit Gate(const WorkQueue& queue) {
        queue.async([started = started_, opened = opened_] {
            started.signal();
            opened.wait();
        });
        started_.wait();
    }
    void open() const { opened_.signal(); }

  private:
    Semaphore started_;
    Semaphore opened_;
};

}  // namespace platform
