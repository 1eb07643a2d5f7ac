#include "Logging/Log.h"

#include <gtest/gtest.h>

#include "Logging/LogText.h"
#include "Platform/runtime/WorkQueue.h"
#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/SimulatedClock.h"

namespace veltoid {
namespace {

TEST(Log, LinesCarryFunctionFileLineAndQueue) {
    platform::FakeSystemLog log;
    logLine(3, "/a/b/File.cpp", "work", 12, "text");
    logLine(5, nullptr, nullptr, 0, nullptr);
    platform::WorkQueue("client 42").sync([] { logLine(4, "plain", "f", 1, "x"); });
    platform::WorkQueue::main().sync([] { logLine(4, "plain", "f", 1, "y"); });
    const auto lines = log.lines();
    ASSERT_EQ(lines.size(), 5U);
    EXPECT_TRUE(lines[0].text.starts_with("SERVER Starting logging for veltoidauthentication " +
                                          std::string(46, '*') + " euid="));
    EXPECT_EQ(lines[0].priority, platform::LogPriority::Info);
    EXPECT_EQ(lines[1].text, "SERVER text (work()/File.cpp #12) -");
    EXPECT_EQ(lines[2].text, "SERVER - (()/ #0) -");
    EXPECT_EQ(lines[3].text, "SERVER x (f()/plain #1) client 42");
    EXPECT_EQ(lines[4].text, "SERVER y (f()/plain #1) main");
}

TEST(Log, FilteredLevelsComposeNothing) {
    platform::FakeSystemLog log;
    int composed = 0;
    for (int level = -1; level <= 8; ++level)
        EXPECT_EQ(logLevelEnabled(level), level >= 0 && level <= 5) << level;
    VELTOID_LOG(kInfo, "not ", ++composed);
    VELTOID_LOG(kNotice, "once ", ++composed);
    EXPECT_EQ(composed, 1);
    EXPECT_EQ(log.count("once 1 (TestBody()/Log_test.cpp #"), 1);
}

TEST(LogText, AccountNamesAreMasked) {
    const std::pair<const char*, const char*> cases[] = {
        {"velthuman@example.com", "\"ve...an@???????.???\""},
        {"abcde@x.y", "\"ab...de@?.?\""},
        {"abcd@x.y", "\"????@?.?\""},
        {"a@x", "\"?@?\""},
        {"@example.com", "\"@?...??\""},
        {"abcd", "\"???\""},
        {"abcdef", "\"ab...ef\""},
        {"", "\"???\""},
        {"zoëäöü@x", "\"zo...öü@?\""},
    };
    for (const auto& [name, expected] : cases) EXPECT_EQ(describeAccountForLog(name), expected) << name;
    EXPECT_EQ(describeAccountForLog(nullptr), "NULL");
    EXPECT_EQ(describeAccountListForLog({"abcdef", Value::int32(1)}), "(\"ab...ef\", NULL)");
}

TEST(LogText, DurationsLoseDetailAsTheyGrow) {
    const std::pair<double, const char*> cases[] = {
        {0, "1 second "},
        {1.9, "1 second "},
        {59, "59 seconds "},
        {61, " 1 minute 1 second "},
        {3'599, "59 minutes 59 seconds "},
        {3'600, " 1 hour "},
        {3'661, " 1 hour  1 minute "},
        {43'200 + 61, "12 hours "},
        {90'000, " 1 days  1 hour "},
        {172'800 + 7'200, "2 days 2 hours "},
        {259'200 + 7'200, "3 days "},
        {604'800, " 1 week "},
        {1'209'600, "2 weeks "},
    };
    for (const auto& [seconds, expected] : cases) EXPECT_EQ(describeDuration(seconds), expected) << seconds;
}

TEST(LogText, QueuesAndMomentsHaveWords) {
    const platform::SimulatedClock clock;
    EXPECT_EQ(describeDispatchTime(std::nullopt), "forever");
    EXPECT_EQ(describeDispatchTime(clock.now() + 2.5), "2.5s");
    EXPECT_EQ(describeDispatchTime(clock.now() - 1), "now");
    const platform::WorkQueue queue("somewhere");
    EXPECT_EQ(describeQueueForLog(nullptr), "NULL");
    EXPECT_EQ(describeQueueForLog(&queue), "somewhere");
    EXPECT_EQ(queue.sync([&] { return describeQueueForLog(&queue); }), "(current)");
}

}  // namespace
}  // namespace veltoid
