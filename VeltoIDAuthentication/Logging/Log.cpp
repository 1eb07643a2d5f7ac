#include "Logging/Log.h"

#include <unistd.h>

#include <cstring>
#include <mutex>

#include "Platform/runtime/SystemLog.h"
#include "Platform/runtime/Transactions.h"
#include "Platform/runtime/WorkQueue.h"

namespace veltoid {
namespace {

constexpr const char* kIdentity = "VeltoIDAuthAgent";
constexpr const char* kFacility = "com.velto.harbwell.veltoidauth";
constexpr const char* kPrefix = "SERVER ";
constexpr unsigned kLevelMask = 0x3F;

void write(int level, const std::string& text, platform::LogOrigin origin) {
    origin.identity = kIdentity;
    origin.facility = kFacility;
    platform::SystemLog::shared().write(static_cast<platform::LogPriority>(level), text, origin);
}

/// Writes the start banner, which passes by the level filter: a log without the moment of its start is hard
/// to read.
void openOnce() {
    static std::once_flag opened;
    std::call_once(opened, [] {
        write(log_level::kInfo,
              logText(kPrefix, "Starting logging for veltoidauthentication ", std::string(46, '*'), " euid=",
                      geteuid(), " uid=", getuid(), " BUILT approximately ", __DATE__, " ", __TIME__),
              {});
    });
}

const char* fileNameOf(const char* path) {
    if (path == nullptr) return "";
    const char* slash = std::strrchr(path, '/');
    return slash != nullptr ? slash + 1 : path;
}

}  // namespace

bool logLevelEnabled(int level) {
    openOnce();
    return level >= 0 && level <= 7 && ((kLevelMask >> static_cast<unsigned>(level)) & 1U) != 0;
}

void logLine(int level, const char* sourcePath, const char* functionName, int lineNumber,
             const char* message) {
    openOnce();
    platform::transactions::began();
    const std::string* label = platform::WorkQueue::currentLabel();
    const char* queue = label != nullptr && !label->empty() ? label->c_str() : "-";
    const char* function = functionName != nullptr ? functionName : "";
    const char* file = fileNameOf(sourcePath);

    std::string text(kPrefix);
    text.append(message != nullptr ? message : "-").append(" (").append(function).append("()/").append(file);
    text.append(" #").append(std::to_string(lineNumber)).append(") ").append(queue);
    write(level, text, {file, lineNumber, function, queue});
    platform::transactions::ended();
}

}  // namespace veltoid
