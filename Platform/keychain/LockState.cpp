#include "Platform/keychain/LockState.h"

#include "Platform/keychain/Keychain.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/WorkQueue.h"

namespace platform {

LockState& LockState::shared() { return Lifetime::current().part<LockState, KeychainLockState>(); }

bool KeychainLockState::hasBeenUnlockedSinceBoot() const {
    const auto protection = keychain::protection();
    return protection && *protection != keychain::Protection::Locked;
}

void KeychainLockState::onChange(std::function<void()> handler) {
    WorkQueue::main().async([this, handler = std::move(handler)] {
        handler_ = handler;
        if (!handler_) return;
        if (std::exchange(isListening_, true))
            look();
        else if (subscribe_)
            subscribe_([this] { look(); });
    });
}

/// What is posted may come from anywhere, and may have been posted before anything listened.
void KeychainLockState::look() const {
    if (handler_ && hasBeenUnlockedSinceBoot()) handler_();
}

}  // namespace platform
