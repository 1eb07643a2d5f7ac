// Open files of the kernel: their end, and reading and writing that a signal does not cut short.
#pragma once

#include <optional>
#include <span>
#include <utility>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

/// Owns a descriptor, or none (negative). Its end leaves errno as it was.
class FileDescriptor {
  public:
    FileDescriptor() = default;
    explicit FileDescriptor(int number) : number_(number) {}
    FileDescriptor(FileDescriptor&& other) noexcept : number_(std::exchange(other.number_, -1)) {}
    FileDescriptor& operator=(FileDescriptor&& other) noexcept {
        std::swap(number_, other.number_);
        return *this;
    }
    ~FileDescriptor();

    bool isOpen() const { return number_ >= 0; }
    int number() const { return number_; }

  private:
    int number_ = -1;
};

/// Reads until the span is full or the file ends; how much that was, none on an error (errno).
std::optional<size_t> readFully(int descriptor, std::span<uint8_t> bytes);

/// False with errno set.
bool writeFully(int descriptor, Bytes bytes);

/// Waits for the advisory lock (flock(2)) on an open file. Where the file system has none, and for a
/// descriptor that is not open, the caller goes on without.
void lockFile(const FileDescriptor& file, int how);

}  // namespace platform
