#include "veltoidctl/Files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <stdexcept>

namespace veltoidctl {
namespace {

constexpr size_t kMaxInputBytes = size_t{1} << 20U;

[[noreturn]] void fail(const std::string& what) { throw std::runtime_error(what + ": " + strerror(errno)); }

class Descriptor {
  public:
    explicit Descriptor(int number) : number_(number) {}
    ~Descriptor() { close(number_); }
    Descriptor(const Descriptor&) = delete;
    Descriptor& operator=(const Descriptor&) = delete;

  private:
    int number_;
};

platform::SecretBytes readAll(int descriptor, const std::string& what) {
    // Never moved: what is beyond the end shows that there is too much.
    platform::SecretBytes bytes(kMaxInputBytes + 1);
    size_t size = 0;
    while (size < bytes.size()) {
        const ssize_t count = read(descriptor, bytes.data() + size, bytes.size() - size);
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) fail("reading " + what);
        if (count == 0) break;
        size += static_cast<size_t>(count);
    }
    if (size > kMaxInputBytes) throw std::runtime_error(what + " is too long");
    if (size == 0) throw std::runtime_error(what + " is empty");
    bytes.resize(size);
    return bytes;
}

bool writeAll(int descriptor, platform::Bytes bytes) {
    while (!bytes.empty()) {
        const ssize_t count = write(descriptor, bytes.data(), bytes.size());
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) return false;
        bytes = bytes.subspan(static_cast<size_t>(count));
    }
    return true;
}

/// Fills the new file, which disappears when that does not succeed.
void fill(int number, const std::string& path, platform::Bytes bytes) {
    const Descriptor descriptor(number);
    if (writeAll(number, bytes) && fsync(number) == 0) return;
    const int reason = errno;
    unlink(path.c_str());
    errno = reason;
    fail("writing " + path);
}

}  // namespace

platform::SecretBytes readInput(const std::string& path) {
    if (path == kStandardStream) return readAll(STDIN_FILENO, "standard input");
    const int number = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (number < 0) fail("opening " + path);
    const Descriptor descriptor(number);
    return readAll(number, path);
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
        if (!writeAll(STDOUT_FILENO, bytes)) fail("writing to standard output");
    } else if (force_) {
        replace(bytes);
    } else {
        create(bytes);
    }
}

void PrivateOutput::create(platform::Bytes bytes) const {
    // Exclusive: neither an existing file nor a symbolic link is opened.
    const int number =
        open(path_.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, S_IRUSR | S_IWUSR);
    if (number < 0) fail("creating " + path_);
    fill(number, path_, bytes);
}

void PrivateOutput::replace(platform::Bytes bytes) const {
    std::string temporary = path_ + ".XXXXXX";
    const int number = mkostemp(temporary.data(), O_CLOEXEC);
    if (number < 0) fail("creating " + temporary);
    fill(number, temporary, bytes);
    if (rename(temporary.c_str(), path_.c_str()) == 0) return;
    const int reason = errno;
    unlink(temporary.c_str());
    errno = reason;
    fail("replacing " + path_);
}

bool standardOutputIsTerminal() { return isatty(STDOUT_FILENO) != 0; }

}  // namespace veltoidctl
