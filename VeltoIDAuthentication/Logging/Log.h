// The agent's log: lines with a fixed prefix, the function, file and line they come from, and the queue's
// label.
#pragma once

#include <sstream>
#include <string>
#include <type_traits>

#include "Logging/Describe.h"

namespace veltoid {

/// Levels of the system log.
namespace log_level {
inline constexpr int kAlert = 1;
inline constexpr int kError = 3;
inline constexpr int kWarning = 4;
inline constexpr int kNotice = 5;
inline constexpr int kInfo = 6;
}  // namespace log_level

/// Whether a line of this level is recorded (levels 0 to 5 are). The first call of the process writes the
/// start banner. Any thread.
bool logLevelEnabled(int level);

/// Writes "SERVER MESSAGE (FUNCTION()/FILE #LINE) QUEUE"; "-" for a null message, nothing for a null function
/// or path. The agent is not ended in the middle of a line. Any thread.
void logLine(int level, const char* sourcePath, const char* functionName, int lineNumber,
             const char* message);

/// The pieces one after the other: a String as it is, every other value described.
template <typename... Pieces>
std::string logText(const Pieces&... pieces) {
    std::ostringstream text;
    const auto add = [&](const auto& piece) {
        if constexpr (std::is_same_v<decltype(piece), const String&>) {
            text << piece.view();
        } else if constexpr (requires { text << piece; }) {
            text << piece;
        } else {
            text << describeValue(piece);
        }
    };
    (add(pieces), ...);
    return text.str();
}

}  // namespace veltoid

/// Composes the line only when its level is recorded: VELTOID_LOG(kNotice, "text ", value).
#define VELTOID_LOG_FROM(function, level, ...)                                              \
    do {                                                                                    \
        if (::veltoid::logLevelEnabled(::veltoid::log_level::level))                        \
            ::veltoid::logLine(::veltoid::log_level::level, __FILE__, (function), __LINE__, \
                               ::veltoid::logText(__VA_ARGS__).c_str());                    \
    } while (false)

#define VELTOID_LOG(level, ...) VELTOID_LOG_FROM(__func__, level, __VA_ARGS__)
