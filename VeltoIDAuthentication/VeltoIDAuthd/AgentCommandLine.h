// The agent's command line.
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace veltoid {

struct CommandLine {
    bool checkPassword = false;
    bool authentication = false;
    bool leaks = false;
    bool usePreferences = true;
    std::optional<std::string> authenticationServiceName;
    std::optional<std::string> preferencesDomainName;
    /// key=value arguments, split at the first "="; those that are not UTF-8 are skipped.
    std::vector<std::pair<std::string, std::string>> metaInfoValues;
    /// How many arguments follow the options, whatever their form.
    int argumentsAfterOptions = 0;

    /// The authentication service runs when asked for, and when nothing is asked for.
    bool runsAuthentication() const {
        return authentication || (!checkPassword && argumentsAfterOptions <= 1);
    }
};

/// An option that does not exist, or lacks its argument.
struct CommandLineError {
    int option = 0;
    int index = 0;
};

/// Parses with getopt_long; none, with the error filled, for an unknown option. Main thread, once.
std::optional<CommandLine> parseCommandLine(int argc, char* const* argv, CommandLineError& error);

}  // namespace veltoid
