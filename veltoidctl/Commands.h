// What the client can do, one function per command of its command line.
#pragma once

#include <string>

#include "veltoidctl/AgentConnection.h"
#include "veltoidctl/Password.h"

namespace veltoidctl {

/// Exit statuses.
inline constexpr int kDone = 0;
inline constexpr int kRefused = 1;
inline constexpr int kWrongUse = 2;
inline constexpr int kAgentUnreachable = 3;

/// What was asked for on the command line.
struct Arguments {
    std::string account;
    PasswordSource password = PasswordSource::Prompt;
    bool json = false;
    /// Ask the server even if the agent's information is fresh.
    bool refresh = false;
    /// Store the account without signing in.
    bool withoutSigningIn = false;
};

/// Each asks the agent, prints the answer (as text, or the whole reply as JSON) and returns the exit status.
int ping(AgentConnection& agent, const Arguments& arguments);
int add(AgentConnection& agent, const Arguments& arguments);
int forget(AgentConnection& agent, const Arguments& arguments);
int list(AgentConnection& agent, const Arguments& arguments);
int info(AgentConnection& agent, const Arguments& arguments);
int status(AgentConnection& agent, const Arguments& arguments);
int verify(AgentConnection& agent, const Arguments& arguments);
int database(AgentConnection& agent, const Arguments& arguments);

}  // namespace veltoidctl
