// Collects log lines for a test and puts the real log back at the end.
#pragma once

#include <algorithm>
#include <mutex>
#include <string>
#include <vector>

#include "Platform/runtime/SystemLog.h"

namespace platform {

class FakeSystemLog : public SystemLog {
  public:
    struct Line {
        LogPriority priority;
        std::string text;
        std::string function;
        std::string queue;
    };

    FakeSystemLog() { replaceShared(this); }
    ~FakeSystemLog() override { replaceShared(nullptr); }
    FakeSystemLog(const FakeSystemLog&) = delete;
    FakeSystemLog& operator=(const FakeSystemLog&) = delete;

    void open(std::string_view) override {}

    void write(LogPriority priority, std::string_view text, const LogOrigin& origin) override {
        const std::lock_guard lock(mutex_);
        lines_.push_back(
            {priority, std::string(text), std::string(origin.function), std::string(origin.queue)});
    }

    std::vector<Line> lines() const {
        const std::lock_guard lock(mutex_);
        return lines_;
    }

    bool contains(std::string_view part) const { return count(part) > 0; }

    long count(std::string_view part) const {
        const std::lock_guard lock(mutex_);
        return std::count_if(lines_.begin(), lines_.end(),
                             [&](const Line& line) { return line.text.find(part) != std::string::npos; });
    }

  private:
    mutable std::mutex mutex_;
    std::vector<Line> lines_;
};

/// Drops what is logged.
class SilentLog : public SystemLog {
  public:
    SilentLog() { replaceShared(this); }
    ~SilentLog() override { replaceShared(nullptr); }
    SilentLog(const SilentLog&) = delete;
    SilentLog& operator=(const SilentLog&) = delete;
    void open(std::string_view) override {}
    void write(LogPriority, std::string_view, const LogOrigin&) override {}
};

}  // namespace platform
