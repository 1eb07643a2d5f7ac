// The agent's log: lines with a fixed prefix, the function, file and line they come from, and the queue's
// label.
#pragma once

#include <sstream>
#include <string>

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

}  // namespace veltoid

// NOLINTBEGIN(bugprone-macro-parentheses): what is streamed is a chain of "<<", which parentheses would turn
// into a shift

/// Composes the line only when its level is recorded: VELTOID_LOG(kNotice, "text " << value).
#define VELTOID_LOG_FROM(function, level, streamed)                                         \
    do {                                                                                    \
        if (::veltoid::logLevelEnabled(::veltoid::log_level::level)) {                      \
            std::ostringstream veltoidLogText;                                              \
            veltoidLogText << streamed;                                                     \
            ::veltoid::logLine(::veltoid::log_level::level, __FILE__, (function), __LINE__, \
                               veltoidLogText.str().c_str());                               \
        }                                                                                   \
    } while (false)

#define VELTOID_LOG(level, streamed) VELTOID_LOG_FROM(__func__, level, streamed)

// NOLINTEND(bugprone-macro-parentheses)
