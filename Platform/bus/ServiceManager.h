// The service manager that starts the agent again.
#pragma once

#include <cstdint>
#include <functional>

namespace platform {

/// Main queue. The operations that have a body are optional: it acts as if there were no manager.
class ServiceManager {
  public:
    virtual ~ServiceManager() = default;
    static ServiceManager& shared();

    /// Asks for the agent to be started again after `seconds`; the previous interval (0: none) is returned
    /// and no longer holds. Returns at once: a transaction is open until the manager has agreed.
    virtual uint32_t setStartInterval(uint32_t seconds) = 0;

    /// Calls `function` once the manager has agreed to the last interval, or has failed to.
    virtual void whenHandedOver(const std::function<void()>& function) { function(); }

    /// Answers whether the agent, once it has left, is started again when its time has come or a client
    /// speaks to it.
    virtual void canStartAgain(const std::function<void(bool)>& answer) { answer(false); }

    /// Tells the manager that the agent can be spoken to.
    virtual void announceReady() {}

    /// Tells the manager that the agent is about to leave: a client that needs it from now on gets the next
    /// one.
    virtual void announceStopping() {}
};

}  // namespace platform
