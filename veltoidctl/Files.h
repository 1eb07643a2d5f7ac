// Files that the client reads and writes. What is in them may be secret.
#pragma once

#include <string>

#include "Platform/runtime/SecureMemory.h"

namespace veltoidctl {

/// In place of a file's name: standard input or output.
inline constexpr const char* kStandardStream = "-";

/// All of a file or of standard input. Throws std::runtime_error, also when it is longer than a mebibyte or
/// empty.
platform::SecretBytes readInput(const std::string& path);

/// Standard output, or a file that is created with mode 0600, so that no other user can ever read it.
class PrivateOutput {
  public:
    /// An existing file is refused, and so is a terminal, unless `force` is set; anything in the file's place
    /// but a regular file is refused always. Throws std::runtime_error. Nothing is created yet.
    PrivateOutput(std::string path, bool force);

    /// Creates the file, or replaces it at once with all that was in it; a file that cannot be written whole
    /// is not left behind. Once. Throws std::runtime_error.
    void write(platform::Bytes bytes) const;

  private:
    void create(platform::Bytes bytes) const;
    void replace(platform::Bytes bytes) const;

    std::string path_;
    bool force_;
};

bool standardOutputIsTerminal();

}  // namespace veltoidctl
