// The agent: all that it has hangs off one object, which the process creates and ends.
#pragma once

#include <memory>

#include "Platform/keychain/LockState.h"
#include "Platform/runtime/Lifetime.h"
#include "Protocol/Product.h"
#include "VeltoIDAuthd/AccountCheck.h"
#include "VeltoIDAuthd/AgentCommandLine.h"
#include "VeltoIDAuthd/PasswordCheckService.h"

namespace veltoid {

/// One at a time, created, run and destroyed on the same thread, which is the main thread meanwhile.
class Agent {
  public:
    struct Configuration {
        CommandLine line;
        platform::Product product = kProduct;
        /// What stands in for the platform's own parts.
        platform::Lifetime::Parts parts = {};
        LinkedIdentityHandler linkedIdentity = {};
        /// Seconds until the first account check.
        double firstCheckDelay = kVeltoIDFirstAccountCheckDelay;
    };

    /// Takes the store's lock and the services' names, opens the database and starts; nothing is served
    /// before `run`. Waits for an earlier agent that is leaving.
    explicit Agent(const Configuration& configuration);

    /// Serves until the agent is told to end; the exit status. A failure at once, with nothing written, when
    /// another process has the lock or a name.
    int run();

  private:
    void start(const Configuration& configuration);

    const std::unique_ptr<platform::LockState> lockState_;
    bool isStarted_ = false;
    /// Its end is the agent's.
    platform::Lifetime lifetime_;
};

}  // namespace veltoid
