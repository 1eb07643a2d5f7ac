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
#include <mutex>
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

constexpr const char* kNoMachineID = "no-machine-id";

/// The name under which this machine is known to its user; a home directory may be shared between machines.
/// Empty with errno set when it cannot be read now: under another name everything stored would seem to be
/// gone.
std::string readMachineName() {
    constexpr size_t kDigits = 32;
    std::array<uint8_t, kDigits> digits{};
    const FileDescriptor file(open("/etc/machine-id", O_RDONLY | O_CLOEXEC));
    if (!file.isOpen()) return errno == ENOENT ? kNoMachineID : "";
    const auto size = readFully(file.number(), digits);
    if (!size) return {};
    const bool valid = size == kDigits && std::ranges::all_of(digits, [](unsigned char digit) {
                           return std::isxdigit(digit) != 0;
                       });
    return valid ? std::string(digits.begin(), digits.end()) : kNoMachineID;
}

/// Found once: it stays the same until the end.
struct MachineName {
    std::mutex mutex;
    std::string name;
};

std::string machineName() {
    auto& [mutex, name] = Lifetime::current().state<MachineName>();
    const std::lock_guard lock(mutex);
    if (name.empty()) name = readMachineName();
    return name;
}

FileDescriptor openDirectory(const std::string& path) {
    return FileDescriptor(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
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
    const std::string machine = machineName();
    if (machine.empty()) return {};
    const std::string ours = base + '/' + Lifetime::current().product().folder;
    std::string directory = ours + '/' + machine;
    return createDirectories(directory) && makePrivate(ours) && makePrivate(directory) ? directory
                                                                                       : std::string();
}

bool syncDirectory(const std::string& directory) {
    const FileDescriptor opened = openDirectory(directory);
    return opened.isOpen() && fsync(opened.number()) == 0;
}

FileDescriptor lockDirectory(const std::string& directory) {
    FileDescriptor opened = openDirectory(directory);
    lockFile(opened, LOCK_EX);
    return opened;
}

}  // namespace platform
