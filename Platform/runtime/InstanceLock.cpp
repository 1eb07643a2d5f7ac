#include "Platform/runtime/InstanceLock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <string>

#include "Platform/runtime/FileDescriptor.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/StateDirectory.h"

namespace platform::instance_lock {
namespace {

/// Locked while an agent is leaving; the kernel unlocks it when the process is gone. Never removed: the agent
/// that starts and the one that leaves have to meet at the same file.
FileDescriptor openLocked(int flags, int how) {
    const std::string directory = stateDirectory();
    if (directory.empty()) return {};
    FileDescriptor file(
        open((directory + "/leaving.lock").c_str(), O_RDWR | O_CLOEXEC | flags, S_IRUSR | S_IWUSR));
    lockFile(file, how);
    return file;
}

/// Shared: agents of several services may leave at the same time.
struct HeldLock {
    FileDescriptor file = openLocked(O_CREAT, LOCK_SH);
};

}  // namespace

void holdUpNext() { Lifetime::current().state<HeldLock>(); }

void waitForPrevious() { (void)openLocked(0, LOCK_EX); }

}  // namespace platform::instance_lock
