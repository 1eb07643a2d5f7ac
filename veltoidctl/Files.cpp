#include "veltoidctl/Files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <stdexcept>

#include "Platform/runtime/FileDescriptor.h"

namespace veltoidctl {
namespace {

constexpr size_t kMaxInputBytes = size_t{1} << 20U;

[[noreturn]] void fail(const std::string& what) { throw std::runtime_error(what + ": " + strerror(errno)); }

platform::SecretBytes readAll(int descriptor, const std::string& what) {
    // Never moved: what is beyond the end shows that there is too much.
    platform::SecretBytes bytes(kMaxInputBytes + 1);
    const auto size = platform::readFully(descriptor, bytes);
    if (!size) fail("reading " + what);
    if (*size > kMaxInputBytes) throw std::runtime_error(what + " is too long");
    if (*size == 0) throw std::runtime_error(what + " is empty");
    bytes.resize(*size);
    return bytes;
}

/// Fills the new file, which disappears when that does not succeed.
void fill(const platform::FileDescriptor& file, const std::string& path, platform::Bytes bytes) {
    if (platform::writeFully(file.number(), bytes) && fsync(file.number()) == 0) return;
    const int reason = errno;
    unlink(path.c_str());
    errno = reason;
    fail("writing " + path);
}

}  // namespace

platform::SecretBytes readInput(const std::string& path) {
    if (path == kStandardStream) return readAll(STDIN_FILENO, "standard input");
    const platform::FileDescriptor file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!file.isOpen()) fail("opening " + path);
    return readAll(file.number(), path);
}

PrivateOutput::PrivateOutput(std::string path, bool force) : path_(std::move(path)), force_(force) {
    if (path_ == kStandardStream) {
        if (standardOutputIsTerminal() && !force_)
            throw std::runtime_error("this is not for a terminal: name a file, or use --force");
        return;
    }
    struct stat status {};
    if (lstat(path_.c_str(), &status) != 0) return;
    if (!S_ISREG(status.st_mode)) throw std::runtime_error(path_ + " is in the way: it is no regular file");
    if (!force_) throw std::runtime_error(path_ + " exists already: use --force to replace it");
}

void PrivateOutput::write(platform::Bytes bytes) const {
    if (path_ == kStandardStream) {
        if (!platform::writeFully(STDOUT_FILENO, bytes)) fail("writing to standard output");
    } else if (force_) {
        replace(bytes);
    } else {
        create(bytes);
    }
}

void PrivateOutput::create(platform::Bytes bytes) const {
    // Exclusive: neither an existing file nor a symbolic link is opened.
    const platform::FileDescriptor file(
        open(path_.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, S_IRUSR | S_IWUSR));
    if (!file.isOpen()) fail("creating " + path_);
    fill(file, path_, bytes);
}

void PrivateOutput::replace(platform::Bytes bytes) const {
    std::string temporary = path_ + ".XXXXXX";
    const platform::FileDescriptor file(mkostemp(temporary.data(), O_CLOEXEC));
    if (!file.isOpen()) fail("creating " + temporary);
    fill(file, temporary, bytes);
    if (rename(temporary.c_str(), path_.c_str()) == 0) return;
    const int reason = errno;
    unlink(temporary.c_str());
    errno = reason;
    fail("replacing " + path_);
}

bool standardOutputIsTerminal() { return isatty(STDOUT_FILENO) != 0; }

}  // namespace veltoidctl
