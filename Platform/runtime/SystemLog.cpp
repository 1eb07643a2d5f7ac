#include "Platform/runtime/SystemLog.h"

#include <sys/stat.h>
#include <sys/uio.h>
#include <syslog.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cstdlib>

#include "Platform/runtime/WorkQueue.h"

namespace platform {
namespace {

constexpr const char* kJournalSocket = "/run/systemd/journal/socket";

/// JOURNAL_STREAM names the device and inode of a stream that leads to the journal.
bool standardErrorLeadsToJournal() {
    const char* stream = std::getenv("JOURNAL_STREAM");
    struct stat status {};
    if (stream == nullptr || fstat(STDERR_FILENO, &status) != 0) return false;
    return std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino) == stream;
}

/// A line stays one line, whatever a peer put into a name.
std::string singleLine(std::string_view text) {
    std::string line(text);
    std::ranges::replace_if(
        line, [](unsigned char c) { return c < ' ' || c == '\x7f'; }, '?');
    return line;
}

/// The members are set by open, before other threads log.
class RealSystemLog : public SystemLog {
  public:
    void open(std::string_view programName) override {
        programName_ = programName;
        writesToJournal_ = access(kJournalSocket, F_OK) == 0;
        echoes_ = writesToJournal_ && !standardErrorLeadsToJournal();
        openlog(programName_.c_str(), LOG_PID | LOG_PERROR, 0);
    }

    void write(LogPriority priority, std::string_view text, const LogOrigin& origin) override {
        const std::string line = singleLine(text);
        if (writesToJournal_ && writeToJournal(priority, line, origin)) {
            if (echoes_) echo(line);
        } else {
            syslog(static_cast<int>(priority), "%s", line.c_str());
        }
    }

  private:
    bool writeToJournal(LogPriority priority, const std::string& line, const LogOrigin& origin) const {
        const std::array<std::string, 8> fields = {
            "MESSAGE=" + line,
            "PRIORITY=" + std::to_string(static_cast<int>(priority)),
            "SYSLOG_IDENTIFIER=" + (origin.identity.empty() ? programName_ : std::string(origin.identity)),
            "SUBSYSTEM=" + std::string(origin.facility),
            "CODE_FILE=" + std::string(origin.file),
            "CODE_LINE=" + std::to_string(origin.line),
            "CODE_FUNC=" + std::string(origin.function),
            "QUEUE=" + std::string(origin.queue),
        };
        std::array<iovec, fields.size()> vectors{};
        for (size_t i = 0; i < fields.size(); ++i)
            vectors[i] = {const_cast<char*>(fields[i].data()), fields[i].size()};
        return sd_journal_sendv(vectors.data(), static_cast<int>(vectors.size())) == 0;
    }

    void echo(const std::string& line) const {
        const std::string whole = programName_ + "[" + std::to_string(getpid()) + "]: " + line + "\n";
        // One write, so that lines of several threads do not mix. A failure cannot be reported anywhere.
        [[maybe_unused]] const ssize_t written = ::write(STDERR_FILENO, whole.data(), whole.size());
    }

    std::string programName_ = "-";
    bool writesToJournal_ = false;
    bool echoes_ = false;
};

std::atomic<SystemLog*> replacement{nullptr};

}  // namespace

SystemLog& SystemLog::shared() {
    if (SystemLog* log = replacement.load(std::memory_order_acquire)) return *log;
    static auto* real = new RealSystemLog;
    return *real;
}

void SystemLog::replaceShared(SystemLog* log) { replacement.store(log, std::memory_order_release); }

void logPlatform(LogPriority priority, std::string_view text, const char* file, int line,
                 const char* function) {
    const std::string* queue = WorkQueue::currentLabel();
    std::string_view name(file);
    name.remove_prefix(std::min(name.size(), name.rfind('/') + 1));
    SystemLog::shared().write(priority, text, {name, line, function, queue != nullptr ? *queue : "-"});
}

}  // namespace platform
