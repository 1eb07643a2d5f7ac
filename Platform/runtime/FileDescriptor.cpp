#include "Platform/runtime/FileDescriptor.h"

#include <sys/file.h>
#include <unistd.h>

#include <cerrno>

namespace platform {

FileDescriptor::~FileDescriptor() {
    const int reason = errno;
    if (isOpen()) close(number_);
    errno = reason;
}

std::optional<size_t> readFully(int descriptor, std::span<uint8_t> bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        const ssize_t got = read(descriptor, bytes.data() + done, bytes.size() - done);
        if (got < 0 && errno == EINTR) continue;
        if (got < 0) return std::nullopt;
        if (got == 0) break;
        done += static_cast<size_t>(got);
    }
    return done;
}

bool writeFully(int descriptor, Bytes bytes) {
    while (!bytes.empty()) {
        const ssize_t put = write(descriptor, bytes.data(), bytes.size());
        if (put < 0 && errno == EINTR) continue;
        if (put < 0) return false;
        bytes = bytes.subspan(static_cast<size_t>(put));
    }
    return true;
}

void lockFile(const FileDescriptor& file, int how) {
    while (file.isOpen() && flock(file.number(), how) != 0 && errno == EINTR) {
    }
}

}  // namespace platform
