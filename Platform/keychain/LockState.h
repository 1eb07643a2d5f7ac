// Whether this device has been unlocked since it was started, and news of that: the passphrase of the
// keychain is what unlocks it, and the program that takes it posts the notification. Without a passphrase the
// device counts as unlocked.
#pragma once

#include <functional>
#include <utility>

namespace platform {

/// All operations may be called from any thread.
class LockState {
  public:
    virtual ~LockState() = default;
    /// The lifetime's one: as the keychain says, without news, unless another part was given.
    static LockState& shared();

    /// True once the keychain's "after first unlock" key can be had.
    virtual bool hasBeenUnlockedSinceBoot() const = 0;

    /// From now on calls `handler` on the main queue whenever the device was unlocked; replaces an earlier
    /// handler. Null ends that.
    virtual void onChange(std::function<void()> handler) = 0;
};

/// As the keychain says.
class KeychainLockState : public LockState {
  public:
    /// Has `handler` called on the main queue when the keychain may have been unlocked, and once when the
    /// subscription holds: what was posted before is not delivered, so the handler looks for itself.
    using Subscribe = std::function<void(std::function<void()> handler)>;

    explicit KeychainLockState(Subscribe subscribe = {}) : subscribe_(std::move(subscribe)) {}

    bool hasBeenUnlockedSinceBoot() const override;
    void onChange(std::function<void()> handler) override;

  private:
    void look() const;

    const Subscribe subscribe_;
    /// Main thread only.
    std::function<void()> handler_;
    bool isListening_ = false;
};

/// For a process without a keychain.
class AlwaysUnlocked : public LockState {
  public:
    bool hasBeenUnlockedSinceBoot() const override { return true; }
    void onChange(std::function<void()>) override {}
};

}  // namespace platform
