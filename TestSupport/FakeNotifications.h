// Collects posted notifications for a test.
#pragma once

#include <mutex>
#include <utility>
#include <vector>

#include "Platform/bus/Notifications.h"
#include "TestSupport/TestLifetime.h"

namespace platform {

class FakeNotifications : public Notifications {
  public:
    void post(std::string name) override {
        const std::lock_guard lock(mutex_);
        names_.push_back(std::move(name));
    }

    /// What was posted since the last call.
    std::vector<std::string> take() {
        const std::lock_guard lock(mutex_);
        return std::exchange(names_, {});
    }

  private:
    std::mutex mutex_;
    std::vector<std::string> names_;
    const InTestLifetime<Notifications> inLifetime_{*this};
};

}  // namespace platform
