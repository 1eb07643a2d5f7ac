// Values in bus messages: reading one message's body into a sink, and a sink that appends to a message. For
// Platform and the programs beside the agent. The wire form is described in MessageService.h.
#pragma once

#include <optional>
#include <string_view>

#include "Platform/encoding/ValueSink.h"

struct sd_bus_message;

namespace platform::bus {

/// Writes the dictionary of the body into the sink, from the start of the body.
void readDictionary(sd_bus_message* message, ValueSink& sink);

/// The signed integer under `key` of the dictionary of the body.
std::optional<int64_t> peekInteger(sd_bus_message* message, std::string_view key);

/// Appends the dictionary that `writer` writes to the message. Returns a negative errno when it does not fit
/// into a message; the message is to be thrown away then.
int appendDictionary(sd_bus_message* message, const ValueWriter& writer);

}  // namespace platform::bus
