// Whether this device has been unlocked since it was started.
#pragma once

namespace platform {

/// True once the keychain's "after first unlock" key can be had. The key is wrapped by the device key alone,
/// so the device counts as unlocked from the start. Any thread.
bool hasBeenUnlockedSinceBoot();

}  // namespace platform
