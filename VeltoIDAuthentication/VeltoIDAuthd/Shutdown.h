// Shutdown: the agent ends when it has been idle for a while and can be started again, on SIGTERM, when a
// client or the server asks for it, and when its bus is gone. No request is lost: it releases its bus names
// first, so that later requests start the next agent, and then answers those that it has already received.
#pragma once

namespace veltoid {

/// How long the agent stays without anything to do (seconds); infinite when it stays for ever. From
/// HARBWELL_IDLE_EXIT.
double idleExitSeconds();

/// Serves SIGTERM, the end of the bus, and idleness. Main queue, once, before anything is served.
void prepareShutdown();

/// Begins the shutdown now. Requests that are still being served may delay it for a second. Any queue.
void shutDownByCommand();

/// The same for the server, whose answer is part of such a request: as on SIGTERM that may take ten seconds.
void shutDownByServer();

/// Whether the agent has been asked to leave: what can wait is not waited for. Any queue.
bool isLeaving();

}  // namespace veltoid
