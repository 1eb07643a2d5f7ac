// The client's command line: what was asked for, of which agent.
#pragma once

#include <string>
#include <variant>

#include "Protocol/Names.h"
#include "veltoidctl/ClientCommands.h"

namespace veltoidctl {

struct Invocation {
    int (*command)(AgentConnection&, const Arguments&) = nullptr;
    Arguments arguments = {};
    /// The agent's name on the bus.
    std::string service = veltoid::kVeltoIDAuthenticationServiceName;
    /// Seconds; longer than the agent waits for a server in one request.
    double timeout = 30;
};

/// The exit status instead when help was asked for, or the use is wrong: what there is to say is printed.
std::variant<Invocation, int> parseCommandLine(int argc, char** argv);

}  // namespace veltoidctl
