// The operating system's name and build, from os-release(5).
#pragma once

#include <optional>
#include <string>

namespace platform {

struct SystemVersion {
    std::optional<std::string> productName;
    std::optional<std::string> buildVersion;
};

/// NAME and BUILD_ID (else VERSION_ID) of /etc/os-release or /usr/lib/os-release; read once per process. Any
/// thread.
const SystemVersion& systemVersion();

/// The same from the text of such a file.
SystemVersion parseOSRelease(const std::string& text);

}  // namespace platform
