// The agent's one bus connection (sd-bus on the event loop). For Platform and, the names, for the programs
// beside the agent; main thread.
#pragma once

#include <functional>
#include <string>

struct sd_bus;

namespace platform::bus {

inline constexpr const char* kObjectPath = "/com/velto/harbwell/veltoid";
inline constexpr const char* kMessageInterface = "com.velto.harbwell.veltoid.MessageService";
inline constexpr const char* kNotificationInterface = "com.velto.harbwell.veltoid.Notifications";

/// The connection, opened and attached to the event loop on first use; null when there is no bus (logged
/// once).
sd_bus* connection();

/// Emits Posted(name); nothing happens without a connection that was opened before.
void emitPosted(const std::string& name);

/// Hands everything that was sent to the bus.
void flush();

/// Calls `handler` when the bus ends the connection.
void onDisconnect(std::function<void()> handler);

/// Reports a failed bus operation; the one place that puts bus errors into words.
void logFailure(const char* operation, int result);

}  // namespace platform::bus
