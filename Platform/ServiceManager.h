// The service manager that starts the agent again.
#pragma once

#include <cstdint>

namespace platform {

/// Main queue.
class ServiceManager {
  public:
    virtual ~ServiceManager() = default;
    static ServiceManager& shared();
    /// Tests only: the caller keeps `manager` alive until it is replaced by null.
    static void replaceShared(ServiceManager* manager);

    /// Asks for the agent to be started again after `seconds`; the previous interval (0: none) is returned
    /// and no longer holds.
    virtual uint32_t setStartInterval(uint32_t seconds) = 0;
};

}  // namespace platform
