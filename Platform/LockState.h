// Whether this device has been unlocked since it was started, and news of that.
#pragma once

#include <functional>

namespace platform {

/// All operations may be called from any thread.
class LockState {
  public:
    virtual ~LockState() = default;
    static LockState& shared();
    /// Tests only: the caller keeps `state` alive until it is replaced by null.
    static void replaceShared(LockState* state);

    /// True once the keychain's "after first unlock" key can be had.
    virtual bool hasBeenUnlockedSinceBoot() const = 0;

    /// From now on calls `handler` on the main queue whenever the state changes; replaces an earlier handler.
    /// Null ends that.
    virtual void onChange(std::function<void()> handler) = 0;
};

}  // namespace platform
