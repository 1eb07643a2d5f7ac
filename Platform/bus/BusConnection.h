// The agent's one bus connection (sd-bus on the event loop). Main thread.
#pragma once

#include <functional>
#include <string>

struct sd_bus;

namespace platform::bus {

/// The connection, opened and attached to the event loop on first use; null when there is no bus (logged
/// once), and when the lifetime ends: nothing more goes out then.
sd_bus* connection();

/// Calls `serve` after each portion that was read from the bus. While it answers true it is called again
/// though nothing new may have come. Once, before the connection is used.
void afterReading(std::function<bool()> serve);

/// Has `serve` called soon.
void serveSoon();

/// What was sent and the bus has not read yet, in bytes of the kernel's memory.
size_t unreadBytes();

/// Emits Posted(name); nothing happens without a connection that was opened before.
void emitPosted(const std::string& name);

/// From now on calls `handler` when that name is posted, and once when the subscription holds: what was
/// posted before is not delivered, so the handler looks for itself.
void onPosted(const std::string& name, std::function<void()> handler);

/// Hands everything that was sent to the bus.
void flush();

/// Calls `handler` when the bus ends the connection.
void onDisconnect(std::function<void()> handler);

/// Reports a failed bus operation; the one place that puts bus errors into words.
void logFailure(const char* operation, int result);

}  // namespace platform::bus
