#include "Platform/keychain/LockState.h"

#include <atomic>
#include <utility>

#include "Platform/bus/BusConnection.h"
#include "Platform/keychain/Keychain.h"
#include "Platform/runtime/WorkQueue.h"

namespace platform {
namespace {

class KeychainLockState : public LockState {
  public:
    bool hasBeenUnlockedSinceBoot() const override {
        const auto protection = keychain::protection();
        return protection && *protection != keychain::Protection::Locked;
    }

    void onChange(std::function<void()> handler) override {
        WorkQueue::main().async([this, handler = std::move(handler)] {
            handler_ = handler;
            if (!handler_) return;
            if (std::exchange(isListening_, true))
                look();
            else
                bus::onPosted(kUnlockedNotification, [this] { look(); });
        });
    }

  private:
    /// What is posted may come from anybody, and may have been posted before anybody listened.
    void look() const {
        if (handler_ && hasBeenUnlockedSinceBoot()) handler_();
    }

    /// Main thread only.
    std::function<void()> handler_;
    bool isListening_ = false;
};

class AlwaysUnlocked : public LockState {
  public:
    bool hasBeenUnlockedSinceBoot() const override { return true; }
    void onChange(std::function<void()>) override {}
};

std::atomic<LockState*> replacement{nullptr};

}  // namespace

LockState& LockState::shared() {
    if (LockState* state = replacement.load(std::memory_order_acquire)) return *state;
    static auto* real = new KeychainLockState;
    return *real;
}

void LockState::assumeUnlocked() {
    static auto* unlocked = new AlwaysUnlocked;
    replaceShared(unlocked);
}

void LockState::replaceShared(LockState* state) { replacement.store(state, std::memory_order_release); }

}  // namespace platform
