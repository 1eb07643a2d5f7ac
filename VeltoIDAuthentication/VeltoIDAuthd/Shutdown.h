// How the agent leaves: when it was idle for a while and can be started again, on SIGTERM, and when its bus
// is gone. Nothing that was sent to it is lost: it gives up its names first, so that the bus starts the next
// agent for whoever comes then, and answers what came before.
#pragma once

namespace veltoid {

/// Serves SIGTERM, the end of the bus, and idleness. Main queue, once, before the services are registered.
void prepareShutdown();

/// Has the agent leave now. Others' requests may hold that up for a second. Any queue.
void shutDownByCommand();

/// Ends the agent (event_loop::run returns) once the main queue has done what it was asked for so far,
/// replies and relaunch included. On other queues than the main one this returns when the lifetime ends.
void endAfterPendingWork();

}  // namespace veltoid
