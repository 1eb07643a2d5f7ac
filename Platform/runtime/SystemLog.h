// The system log: the journal with structured fields where its socket exists, else syslog; standard error as
// well unless it already leads to the journal. The text of a line is the same everywhere.
#pragma once

#include <string>
#include <string_view>

namespace platform {

/// Severities of syslog(3), RFC 5424.
enum class LogPriority : int { Emergency, Alert, Critical, Error, Warning, Notice, Info, Debug };

/// Where a line came from; empty members are left out.
struct LogOrigin {
    std::string_view file;
    int line = 0;
    std::string_view function;
    std::string_view queue;
    /// Who speaks (SYSLOG_IDENTIFIER in the journal; the program when empty), and the facility that it speaks
    /// for.
    std::string_view identity = {};
    std::string_view facility = {};
};

/// All operations may be called from any thread.
class SystemLog {
  public:
    virtual ~SystemLog() = default;

    static SystemLog& shared();

    /// Tests only: lines go to `log` (kept alive by the caller) until it is replaced by null.
    static void replaceShared(SystemLog* log);

    /// Names the lines' program. Called once, at start.
    virtual void open(std::string_view programName) = 0;

    /// Writes one line. Never fails towards the caller and never throws.
    virtual void write(LogPriority priority, std::string_view text, const LogOrigin& origin) = 0;
};

/// What the platform itself has to report (a store moved aside, a value damaged), at the place that is given.
void logPlatform(LogPriority priority, std::string_view text, const char* file, int line,
                 const char* function);

}  // namespace platform

#define VELTOID_PLATFORM_LOG(priority, text) \
    ::platform::logPlatform(::platform::LogPriority::priority, (text), __FILE__, __LINE__, __func__)
