#include "Platform/runtime/Clock.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <chrono>
#include <mutex>

#include "Platform/runtime/WorkQueue.h"
#include "TestSupport/SideBySide.h"

namespace platform {
namespace {

/// Far beyond what anything here takes: a wait that reaches it has failed.
constexpr double kBound = 60;

double steadyTime() {
    return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

class ClockTest : public testing::Test {
  protected:
    /// A timer that records its name and time when it fires.
    Clock::TimerID start(double seconds, char name) {
        const double due = steadyTime() + seconds;
        return clock_.callAfter(seconds, Clock::Use::Task, [this, due, name] {
            const std::lock_guard lock(mutex_);
            fired_ += name;
            earliest_ = std::min(earliest_, steadyTime() - due);
            oneFired_.signal();
        });
    }

    /// The names of all that have fired, once there are `count`.
    std::string waitFor(int count) {
        for (int i = 0; i < count; ++i)
            if (!oneFired_.wait(kBound)) ADD_FAILURE() << "a timer did not fire";
        const std::lock_guard lock(mutex_);
        EXPECT_GE(earliest_, -0.001) << "a timer fired before its time";
        return fired_;
    }

    Clock& clock_ = Clock::shared();
    std::mutex mutex_;
    std::string fired_;
    double earliest_ = kForever;
    const Semaphore oneFired_;
};

TEST_F(ClockTest, TimersFireOnceInTheOrderOfTheirDeadlines) {
    start(0.06, 'd');
    start(0.02, 'b');
    start(1e300, 'x');
    start(kForever, 'y');
    start(0.04, 'c');
    start(0.0, 'a');
    EXPECT_EQ(waitFor(4), "abcd");
    start(-1.0, 'e');
    // Whatever was left over from the others would have come before this one.
    start(0.02, 'f');
    EXPECT_EQ(waitFor(2), "abcdef");
}

TEST_F(ClockTest, ACancelledTimerNeverFires) {
    const auto fired = start(0.01, 'a');
    const auto first = start(0.02, 'x');
    const auto last = start(100, 'y');
    start(0.03, 'b');
    EXPECT_TRUE(clock_.cancel(first));
    EXPECT_FALSE(clock_.cancel(first));
    EXPECT_TRUE(clock_.cancel(last));
    EXPECT_EQ(waitFor(2), "ab");
    EXPECT_FALSE(clock_.cancel(fired));
    EXPECT_FALSE(clock_.cancel(Clock::TimerID{1} << 60U));
}

TEST_F(ClockTest, EveryTimerEitherFiresOrIsCancelled) {
    constexpr int kThreads = 4;
    constexpr size_t kTimers = 500;
    std::array<std::atomic<int>, kThreads * kTimers> ends{};
    std::atomic<size_t> ended = 0;
    const Semaphore allEnded;
    const auto end = [&](size_t index) {
        ++ends[index];
        if (++ended == ends.size()) allEnded.signal();
    };
    sideBySide(kThreads, [&](int thread) {
        const size_t first = static_cast<size_t>(thread) * kTimers;
        std::vector<Clock::TimerID> timers;
        for (size_t i = 0; i < kTimers; ++i) {
            timers.push_back(clock_.callAfter(static_cast<double>(i % 10) * 0.001,
                                              i % 2 == 0 ? Clock::Use::WaitForDate : Clock::Use::Task,
                                              [&end, index = first + i] { end(index); }));
            if (i % 3 == 0 && clock_.cancel(timers[i / 2])) end(first + i / 2);
        }
    });
    ASSERT_TRUE(allEnded.wait(kBound));
    for (const auto& count : ends) ASSERT_EQ(count, 1);
}

}  // namespace
}  // namespace platform
