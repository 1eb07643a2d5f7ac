// Whether this device has been unlocked since it was started, and news of that: the passphrase of the
// keychain is what unlocks it, and who gave it posts the notification. Without a passphrase the device counts
// as unlocked.
#pragma once

#include <functional>

namespace platform {

/// Posted on the agent's object after the keychain was unlocked, by whoever did it.
inline constexpr const char* kUnlockedNotification = "com.velto.harbwell.veltoid.keychain.unlocked";

/// All operations may be called from any thread.
class LockState {
  public:
    virtual ~LockState() = default;
    static LockState& shared();
    /// From now on the device counts as unlocked: for a process without a keychain.
    static void assumeUnlocked();
    /// Tests only: the caller keeps `state` alive until it is replaced by null.
    static void replaceShared(LockState* state);

    /// True once the keychain's "after first unlock" key can be had.
    virtual bool hasBeenUnlockedSinceBoot() const = 0;

    /// From now on calls `handler` on the main queue whenever the device was unlocked; replaces an earlier
    /// handler. Null ends that.
    virtual void onChange(std::function<void()> handler) = 0;
};

}  // namespace platform
