// The named services: each client connection gets a serial queue of its own, on which its requests are
// handled.
#pragma once

#include <string>

#include "Protocol/Names.h"
#include "VeltoIDAuthd/PasswordCheckService.h"

namespace veltoid {

/// Main queue, once each. The authentication service may be there a second time without a name. False,
/// logged, when the name cannot be had.
[[nodiscard]] bool registerAuthenticationListener(const std::string& serviceName);
[[nodiscard]] bool registerPasswordCheckListener(const LinkedIdentityHandler& linkedIdentity);

}  // namespace veltoid
