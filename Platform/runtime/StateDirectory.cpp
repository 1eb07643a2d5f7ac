#include "Platform/runtime/StateDirectory.h"

#include <fcntl.h>
#include <pwd.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <vector>

#include "Platform/runtime/Lifetime.h"

namespace platform {

namespace {

std::string homeDirectory() {
    const char* const home = std::getenv("HOME");
    if (home != nullptr && *home == '/') return home;
    constexpr size_t kMaxEntryBytes = 16384;
    std::vector<char> buffer(kMaxEntryBytes);
    passwd entry{};
    passwd* found = nullptr;
    if (getpwuid_r(geteuid(), &entry, buffer.data(), buffer.size(), &found) != 0 || found == nullptr)
        return {};
    return found->pw_dir;
}

std::string baseDirectory() {
    const char* const state = std::getenv("XDG_STATE_HOME");
    if (state != nullptr && *state == '/') return state;
    const std::string home = homeDirectory();
    return home.empty() ? home : home + "/.local/state";
}

/// The name under which this machine is known to its user; a home directory may be shared between machines.
std::string machineName() {
    constexpr size_t kDigits = 32;
    std::array<char, kDigits> digits{};
    const int descriptor = open("/etc/machine-id", O_RDONLY | O_CLOEXEC);
    const ssize_t got = descriptor < 0 ? -1 : ::read(descriptor, digits.data(), digits.size());
    if (descriptor >= 0) close(descriptor);
    const bool valid =
        got == static_cast<ssize_t>(kDigits) &&
        std::ranges::all_of(digits, [](unsigned char digit) { return std::isxdigit(digit) != 0; });
    return valid ? std::string(digits.begin(), digits.end()) : "no-machine-id";
}

bool isDirectory(const std::string& path, struct stat& information) {
    if (stat(path.c_str(), &information) != 0) return false;
    errno = ENOTDIR;
    return S_ISDIR(information.st_mode);
}

/// Creates every missing component with mode 0700; false with errno set.
bool createDirectories(const std::string& path) {
    struct stat information {};
    if (isDirectory(path, information)) return true;
    for (size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
        const std::string component = path.substr(0, end);
        if (!isDirectory(component, information)) {
            if (mkdir(component.c_str(), S_IRWXU) != 0 && errno != EEXIST) return false;
            if (!isDirectory(component, information)) return false;
            (void)syncDirectory(component + "/..");
        }
        if (end == std::string::npos) return true;
    }
}

/// The directory may be older than this program: it is ours alone from now on.
bool makePrivate(const std::string& path) {
    struct stat information {};
    if (!isDirectory(path, information)) return false;
    return (information.st_mode & (S_IRWXG | S_IRWXO)) == 0 || chmod(path.c_str(), S_IRWXU) == 0;
}

}  // namespace

std::string stateDirectory() {
    const std::string base = baseDirectory();
    if (base.empty()) {
        errno = ENOENT;
        return {};
    }
    const std::string ours = base + '/' + Lifetime::current().product().folder;
    std::string directory = ours + '/' + machineName();
    return createDirectories(directory) && makePrivate(ours) && makePrivate(directory) ? directory
                                                                                       : std::string();
}

bool syncDirectory(const std::string& directory) {
    const int descriptor = ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (descriptor < 0) return false;
    const bool done = fsync(descriptor) == 0;
    const int reason = errno;
    ::close(descriptor);
    errno = reason;
    return done;
}

DirectoryLock::DirectoryLock(const std::string& directory)
    : descriptor_(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)) {
    while (descriptor_ >= 0 && flock(descriptor_, LOCK_EX) != 0 && errno == EINTR) {
    }
}

DirectoryLock::~DirectoryLock() {
    if (descriptor_ >= 0) ::close(descriptor_);
}

}  // namespace platform
