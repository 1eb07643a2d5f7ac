#include "VeltoIDAuthd/AgentCommandLine.h"

#include <getopt.h>

#include <string_view>

#include "Platform/encoding/UTF8.h"

namespace veltoid {

std::optional<CommandLine> parseCommandLine(int argc, char* const* argv, CommandLineError& error) {
    static const option kOptions[] = {
        {"checkpassword", no_argument, nullptr, 'c'},
        {"authentication", no_argument, nullptr, 'a'},
        {"authServiceName", required_argument, nullptr, 's'},
        {"leaks", no_argument, nullptr, 'l'},
        {"prefsFile", required_argument, nullptr, 'f'},
        {"noprefsfile", no_argument, nullptr, 'F'},
        {nullptr, 0, nullptr, 0},
    };
    CommandLine line;
    optind = 0;
    for (int option = 0; (option = getopt_long(argc, argv, "acs:lf:F", kOptions, nullptr)) != -1;) {
        switch (option) {
            case 'c':
                line.checkPassword = true;
                break;
            case 'a':
                line.authentication = true;
                break;
            case 's':
                line.authenticationServiceName = optarg;
                break;
            case 'l':
                line.leaks = true;
                break;
            case 'f':
                line.preferencesDomainName = optarg;
                break;
            case 'F':
                line.usePreferences = false;
                break;
            default:
                error = {option, optind};
                return std::nullopt;
        }
    }
    line.argumentsAfterOptions = argc - optind;
    for (int i = optind; i < argc; ++i) {
        const std::string_view argument(argv[i]);
        const size_t equals = argument.find('=');
        if (equals != std::string_view::npos && platform::isUTF8(argument))
            line.metaInfoValues.emplace_back(argument.substr(0, equals), argument.substr(equals + 1));
    }
    return line;
}

}  // namespace veltoid
