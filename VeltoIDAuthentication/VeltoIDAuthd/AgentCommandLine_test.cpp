#include "VeltoIDAuthd/AgentCommandLine.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace veltoid {
namespace {

struct Arguments {
    std::vector<std::string> texts;
    std::vector<char*> pointers;

    explicit Arguments(const std::vector<std::string>& given) : texts(given) {
        texts.insert(texts.begin(), "veltoidauthd");
        for (std::string& text : texts) pointers.push_back(text.data());
        pointers.push_back(nullptr);
    }
    int count() const { return static_cast<int>(texts.size()); }
};

std::string join(const std::vector<std::string>& texts) {
    std::string joined;
    for (const std::string& text : texts) joined += text + " ";
    return joined;
}

/// Everything that was understood, as one text.
std::string summary(const CommandLine& line) {
    std::string text;
    if (line.runsAuthentication()) text += "authentication ";
    if (line.checkPassword) text += "checkpassword ";
    if (line.leaks) text += "leaks ";
    if (!line.usePreferences) text += "memory ";
    if (line.authenticationServiceName) text += "name:" + *line.authenticationServiceName + " ";
    if (line.preferencesDomainName) text += "domain:" + *line.preferencesDomainName + " ";
    for (const auto& [key, value] : line.metaInfoValues) text += "[" + key + "|" + value + "] ";
    return text;
}

TEST(CommandLineTest, IsUnderstood) {
    const std::pair<std::vector<std::string>, const char*> cases[] = {
        {{}, "authentication "},
        {{"-a"}, "authentication "},
        {{"-c"}, "checkpassword "},
        {{"-a", "-c"}, "authentication checkpassword "},
        {{"-ac"}, "authentication checkpassword "},
        {{"--checkpassword", "--authentication"}, "authentication checkpassword "},
        {{"-l"}, "authentication leaks "},
        {{"--leaks", "-c"}, "checkpassword leaks "},
        {{"-F"}, "authentication memory "},
        {{"--noprefsfile", "-c"}, "checkpassword memory "},
        {{"-s", "com.example.name"}, "authentication name:com.example.name "},
        {{"--authServiceName=x", "-f", "d"}, "authentication name:x domain:d "},
        {{"--prefsFile", "-a"}, "authentication domain:-a "},
        {{"-f", "first", "-f", "second"}, "authentication domain:second "},
        {{"a=1"}, "authentication [a|1] "},
        {{"a=1", "b=2"}, "[a|1] [b|2] "},
        {{"a=1", "b=2", "-a"}, "authentication [a|1] [b|2] "},
        {{"a=b=c", "=x", "empty=", "ignored", "-c"}, "checkpassword [a|b=c] [|x] [empty|] "},
        {{"ignored", "too"}, ""},
        {{"-a", "--", "-c=1"}, "authentication [-c|1] "},
    };
    for (const auto& [given, understood] : cases) {
        Arguments arguments(given);
        CommandLineError error;
        const auto line = parseCommandLine(arguments.count(), arguments.pointers.data(), error);
        ASSERT_TRUE(line) << join(given);
        EXPECT_EQ(summary(*line), understood) << join(given);
    }
}

TEST(CommandLineTest, IsRefused) {
    const std::vector<std::string> cases[] = {{"-x"},           {"--unknown"}, {"-a", "-x", "-c"},
                                              {"-s"},           {"-f"},        {"--prefsFile"},
                                              {"--leaks=much"}, {"a=1", "-x"}, {"--authServiceName"}};
    for (const auto& given : cases) {
        Arguments arguments(given);
        CommandLineError error;
        testing::internal::CaptureStderr();
        const auto line = parseCommandLine(arguments.count(), arguments.pointers.data(), error);
        EXPECT_NE(testing::internal::GetCapturedStderr(), "") << join(given);
        EXPECT_FALSE(line) << join(given);
        EXPECT_EQ(error.option, '?') << join(given);
        EXPECT_GT(error.index, 0) << join(given);
    }
}

}  // namespace
}  // namespace veltoid
