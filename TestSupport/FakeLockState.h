// A device that a test locks and unlocks.
#pragma once

#include <mutex>
#include <utility>

#include "Platform/keychain/LockState.h"
#include "Platform/runtime/WorkQueue.h"
#include "TestSupport/TestLifetime.h"

namespace platform {

class FakeLockState : public LockState {
  public:
    explicit FakeLockState(bool unlocked) : unlocked_(unlocked) {}

    bool hasBeenUnlockedSinceBoot() const override {
        const std::lock_guard lock(mutex_);
        return unlocked_;
    }
    void onChange(std::function<void()> handler) override {
        const std::lock_guard lock(mutex_);
        handler_ = std::move(handler);
    }

    void unlock() {
        const std::lock_guard lock(mutex_);
        unlocked_ = true;
        if (handler_) WorkQueue::main().async(handler_);
    }
    void lock() {
        const std::lock_guard lock(mutex_);
        unlocked_ = false;
    }
    bool isWatched() const {
        const std::lock_guard lock(mutex_);
        return handler_ != nullptr;
    }

  private:
    mutable std::mutex mutex_;
    bool unlocked_;
    std::function<void()> handler_;
    const InTestLifetime<LockState> inLifetime_{*this};
};

}  // namespace platform
