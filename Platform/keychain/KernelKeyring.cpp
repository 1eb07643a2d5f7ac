#include "Platform/keychain/KernelKeyring.h"

#include <linux/keyctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Platform/runtime/SystemLog.h"

namespace platform::kernel_keyring {
namespace {

constexpr const char* kKeyType = "user";

/// Secrets that are longer are not ours.
constexpr size_t kMaxSecretBytes = 1'024;

bool refused(const char* what) {
    VELTOID_PLATFORM_LOG(Error, std::string("kernel keyring: ") + what + ": " + std::strerror(errno));
    return false;
}

/// The key's serial number; negative when there is none.
long serialOf(const std::string& name) {
    return syscall(SYS_keyctl, KEYCTL_SEARCH, KEY_SPEC_USER_KEYRING, kKeyType, name.c_str(), 0);
}

/// Everything for who possesses the key; viewing, reading and finding it for every process of the user. The
/// bits are those of keyctl_setperm(3).
constexpr unsigned kPermissions = 0x3f0b0000;

}  // namespace

bool store(const std::string& name, Bytes secret) {
    // Only who possesses a key may say who else may read it, and services possess nothing of their user's.
    (void)syscall(SYS_keyctl, KEYCTL_LINK, KEY_SPEC_USER_KEYRING, KEY_SPEC_PROCESS_KEYRING);
    const long serial =
        syscall(SYS_add_key, kKeyType, name.c_str(), secret.data(), secret.size(), KEY_SPEC_USER_KEYRING);
    if (serial < 0) return refused("storing a key");
    return syscall(SYS_keyctl, KEYCTL_SETPERM, serial, kPermissions) >= 0 || refused("sharing a key");
}

std::optional<SecretBytes> find(const std::string& name) {
    const long serial = serialOf(name);
    if (serial < 0) return std::nullopt;
    SecretBytes secret(kMaxSecretBytes);
    const long size = syscall(SYS_keyctl, KEYCTL_READ, serial, secret.data(), secret.size());
    if (size < 0) (void)refused("reading a key");
    if (size < 0 || static_cast<size_t>(size) > secret.size()) return std::nullopt;
    secret.resize(static_cast<size_t>(size));
    return secret;
}

bool remove(const std::string& name) {
    const long serial = serialOf(name);
    return serial < 0 || syscall(SYS_keyctl, KEYCTL_UNLINK, serial, KEY_SPEC_USER_KEYRING) >= 0 ||
           refused("removing a key");
}

}  // namespace platform::kernel_keyring
