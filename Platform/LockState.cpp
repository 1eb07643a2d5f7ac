#include "Platform/LockState.h"

namespace platform {

bool hasBeenUnlockedSinceBoot() { return true; }

}  // namespace platform
