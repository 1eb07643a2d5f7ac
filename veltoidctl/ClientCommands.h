// What the client can do, one function per command of its command line.
#pragma once

#include "veltoidctl/AgentConnection.h"
#include "veltoidctl/Arguments.h"

namespace veltoidctl {

/// Each asks the agent, prints the answer (as text, or the whole reply as JSON) and returns the exit status.
int ping(AgentConnection& agent, const Arguments& arguments);
int add(AgentConnection& agent, const Arguments& arguments);
int forget(AgentConnection& agent, const Arguments& arguments);
int list(AgentConnection& agent, const Arguments& arguments);
int info(AgentConnection& agent, const Arguments& arguments);
int status(AgentConnection& agent, const Arguments& arguments);
int verify(AgentConnection& agent, const Arguments& arguments);
int find(AgentConnection& agent, const Arguments& arguments);
int certificate(AgentConnection& agent, const Arguments& arguments);
int exportCertificate(AgentConnection& agent, const Arguments& arguments);
int setBreadcrumb(AgentConnection& agent, const Arguments& arguments);
int getBreadcrumb(AgentConnection& agent, const Arguments& arguments);
int database(AgentConnection& agent, const Arguments& arguments);

/// The passphrase of the keychain that the agent of this user has.
int keychainStatus(AgentConnection& agent, const Arguments& arguments);
int setPassphrase(AgentConnection& agent, const Arguments& arguments);
int removePassphrase(AgentConnection& agent, const Arguments& arguments);
int unlockKeychain(AgentConnection& agent, const Arguments& arguments);
int lockKeychain(AgentConnection& agent, const Arguments& arguments);

}  // namespace veltoidctl
