// Shutdown: the agent ends when it has been idle for a while and can be started again, on SIGTERM, and when
// its bus is gone. No request is lost: it releases its bus names first, so that later requests start the next
// agent, and then answers those that it has already received.
#pragma once

namespace veltoid {

/// How long the agent stays without anything to do (seconds); infinite when it stays for ever. From
/// HARBWELL_IDLE_EXIT.
double idleExitSeconds();

/// Serves SIGTERM, the end of the bus, and idleness. Main queue, once, before the services are registered.
void prepareShutdown();

/// Begins the shutdown now. Requests that are still being served may delay it for a second. Any queue.
void shutDownByCommand();

/// Whether the agent has been asked to leave: what can wait is not waited for. Any queue.
bool isLeaving();

/// Ends the agent (event_loop::run returns) once the main queue has done what it was asked for so far,
/// replies and relaunch included. On other queues than the main one this returns when the lifetime ends.
void endAfterPendingWork();

}  // namespace veltoid
