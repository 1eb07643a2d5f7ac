// One remote call on a session: the parameters that every call carries, and the commands that any reply may
// carry.
#pragma once

#include <functional>
#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDXMLServerCommunications/Session.h"

namespace veltoid {

/// Full name of a remote method: this followed by its short name.
inline constexpr std::string_view kVeltoIDMethodPrefix = "com.velto.dir.idm.web.collaboration.PersonService.";

/// Protocol version that this agent speaks.
inline constexpr int64_t kVeltoIDAuthProtocolVersion = 101;

/// What the process does when a reply asks for it. Any queue.
struct ProcessHooks {
    /// Is running at the date (seconds since 1970), which something that is due asks for.
    std::function<void(double date)> scheduleRelaunch = [](double) {};
    /// Is running at the date, which the server asks for.
    std::function<void(double date)> scheduleRequestedLaunch = [](double) {};
    /// Ends as soon as the work in hand is done; returns at once.
    std::function<void()> endProcess = [] {};
};

/// Handed down by the process at start.
void setProcessHooks(ProcessHooks hooks);

/// Asks the process to be running at the date (seconds since 1970). Any queue.
void requestRelaunch(double date);

/// A new dictionary of what every call carries: session identifier (when given), protocol and framework
/// version, time, system, and the meta and account information that the server has asked for.
Dictionary createCallParameters(const String& accountName, const String& sessionID,
                                const Dictionary& options);

/// What the server says of an account, as its record may take it: a name other than the record's own goes
/// under "ServerVeltoID", since the account is known by its own name, and a server's address is left out.
Dictionary recordValuesFromServer(const String& accountName, const Dictionary& values);

/// Calls the method and applies the commands of the reply: validity of the session, meta and account
/// information, relaunch, flush and exit. No reply changes the server's address, under whatever key. The
/// result is absent when the reply is no Dictionary. On the session's queue; blocks for at most 5 seconds.
bool xmlInvoke(VeltoIDAuthenticationSessionInfo& session, const String& methodName,
               const Dictionary& parameters, std::optional<Dictionary>* result, ErrorOut error);

}  // namespace veltoid
