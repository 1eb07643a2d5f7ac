#include "Platform/runtime/SystemVersion.h"

#include <fstream>
#include <map>
#include <sstream>

namespace platform {
namespace {

/// Values may stand in quotes, with backslash escapes inside double ones.
std::string unquoted(const std::string& value) {
    if (value.size() < 2 || (value.front() != '"' && value.front() != '\'') || value.back() != value.front())
        return value;
    std::string plain;
    for (size_t i = 1; i + 1 < value.size(); ++i) {
        if (value.front() == '"' && value[i] == '\\' && i + 2 < value.size()) ++i;
        plain += value[i];
    }
    return plain;
}

std::optional<std::string> valueOf(const std::map<std::string, std::string>& values, const char* key) {
    const auto found = values.find(key);
    if (found == values.end() || found->second.empty()) return std::nullopt;
    return found->second;
}

std::string contentOf(const char* path) {
    std::ifstream file(path);
    std::ostringstream content;
    if (file) content << file.rdbuf();
    return content.str();
}

}  // namespace

SystemVersion parseOSRelease(const std::string& text) {
    std::map<std::string, std::string> values;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        const size_t equals = line.find('=');
        if (equals != std::string::npos && line.front() != '#')
            values[line.substr(0, equals)] = unquoted(line.substr(equals + 1));
    }
    SystemVersion version{valueOf(values, "NAME"), valueOf(values, "BUILD_ID")};
    if (!version.buildVersion) version.buildVersion = valueOf(values, "VERSION_ID");
    return version;
}

const SystemVersion& systemVersion() {
    static const auto* version = [] {
        std::string text = contentOf("/etc/os-release");
        if (text.empty()) text = contentOf("/usr/lib/os-release");
        return new SystemVersion(parseOSRelease(text));
    }();
    return *version;
}

}  // namespace platform
