#include "Platform/runtime/InstanceLock.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <mutex>
#include <string>
#include <utility>

#include "Platform/runtime/FileDescriptor.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/StateDirectory.h"
#include "Platform/runtime/SystemLog.h"

namespace platform::instance_lock {
namespace {

constexpr int kPauseMilliseconds = 20;
constexpr int kMillisecondsPerSecond = 1'000;
constexpr size_t kHolderBytes = 16;

enum class Outcome { Held, HeldByOther, NoFile };

/// Holds the process id of whoever has it. Never removed: all agents have to meet at the same file.
FileDescriptor openFile() {
    const std::string directory = stateDirectory();
    if (directory.empty()) return {};
    return FileDescriptor(open((directory + "/agent.lock").c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC,
                               S_IRUSR | S_IWUSR));
}

/// Always of the same size: cutting the file would cost a tenth of a start.
void writeHolder(int file) {
    std::string text = std::to_string(getpid());
    text.resize(kHolderBytes, '\n');
    (void)!pwrite(file, text.data(), text.size(), 0);
}

std::string holder() {
    std::array<uint8_t, kHolderBytes> bytes{};
    const size_t size = readFully(openFile().number(), bytes).value_or(0);
    const std::string text(bytes.begin(), bytes.begin() + static_cast<std::ptrdiff_t>(size));
    return text.substr(0, text.find('\n'));
}

struct Lock {
    std::mutex mutex;
    bool isWanted = false;
    FileDescriptor file;

    Outcome tryToTake() {
        const std::lock_guard guard(mutex);
        isWanted = true;
        if (file.isOpen()) return Outcome::Held;
        FileDescriptor opened = openFile();
        if (!opened.isOpen()) return Outcome::NoFile;
        if (flock(opened.number(), LOCK_EX | LOCK_NB) != 0 && errno == EWOULDBLOCK)
            return Outcome::HeldByOther;
        writeHolder(opened.number());
        file = std::move(opened);
        return Outcome::Held;
    }
};

Lock& lock() { return Lifetime::current().state<Lock>(); }

}  // namespace

bool take() {
    constexpr int kTries = static_cast<int>(kMaxWait) * kMillisecondsPerSecond / kPauseMilliseconds;
    for (int i = 0; i < kTries; ++i) {
        if (lock().tryToTake() != Outcome::HeldByOther) return true;
        // Not a wait of the clock, which would have a thread before the signals are blocked.
        (void)poll(nullptr, 0, kPauseMilliseconds);
    }
    VELTOID_PLATFORM_LOG(Error, "Another agent works on this user's accounts already: process " + holder() +
                                    ". This one ends.");
    return false;
}

bool mayRead() {
    Lock& own = lock();
    std::unique_lock guard(own.mutex);
    if (!own.isWanted || own.file.isOpen()) return true;
    guard.unlock();
    return own.tryToTake() == Outcome::Held;
}

}  // namespace platform::instance_lock
