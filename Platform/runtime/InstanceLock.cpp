#include "Platform/runtime/InstanceLock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/StateDirectory.h"

namespace platform::instance_lock {
namespace {

/// Locked while an agent is leaving; the kernel unlocks it when the process is gone. Never removed: the agent
/// that starts and the one that leaves have to meet at the same file.
int openLock(int flags) {
    const std::string directory = stateDirectory();
    if (directory.empty()) return -1;
    return open((directory + "/leaving.lock").c_str(), O_RDWR | O_CLOEXEC | flags, S_IRUSR | S_IWUSR);
}

void lock(int descriptor, int how) {
    while (flock(descriptor, how) != 0 && errno == EINTR) {
    }
}

/// Shared: agents of several services may leave at the same time.
class HeldLock {
  public:
    HeldLock() {
        if (descriptor_ >= 0) lock(descriptor_, LOCK_SH);
    }
    ~HeldLock() {
        if (descriptor_ >= 0) close(descriptor_);
    }
    HeldLock(const HeldLock&) = delete;
    HeldLock& operator=(const HeldLock&) = delete;

  private:
    const int descriptor_ = openLock(O_CREAT);
};

}  // namespace

void holdUpNext() { Lifetime::current().state<HeldLock>(); }

void waitForPrevious() {
    const int descriptor = openLock(0);
    if (descriptor < 0) return;
    lock(descriptor, LOCK_EX);
    close(descriptor);
}

}  // namespace platform::instance_lock
