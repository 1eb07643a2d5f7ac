// Replies, as the client handles them.
#pragma once

#include <nlohmann/json.hpp>

namespace veltoidctl {

/// Insertion order is the agent's own.
using Json = nlohmann::ordered_json;

}  // namespace veltoidctl
