#include "Platform/runtime/Transactions.h"

#include <gtest/gtest.h>

#include <vector>

#include "TestSupport/SimulatedClock.h"

namespace platform::transactions {
namespace {

TEST(TransactionsTest, IdleTimeCountsFromTheEndOfTheLastOne) {
    struct Step {
        double at;
        /// How many begin (or end) then.
        int change;
    };
    const struct {
        const char* what;
        std::vector<Step> steps;
        /// When the process is found idle for ten seconds; 0 for not within a hundred.
        double expected;
    } cases[] = {
        {"nothing was open yet", {}, 0},
        {"one", {{1, 1}, {3, -1}}, 13},
        {"again before the time is over", {{0, 1}, {1, -1}, {9, 1}, {9.5, -1}}, 19.5},
        {"again and again", {{0, 1}, {1, -1}, {5, 1}, {5, -1}, {14, 1}, {14, -1}, {23, 1}, {23, -1}}, 33},
        {"open when the time would be over", {{0, 1}, {1, -1}, {2, 1}, {50, -1}}, 60},
        {"never closed", {{0, 1}, {1, -1}, {2, 1}}, 0},
        {"two at a time", {{0, 2}, {1, -1}, {20, -1}}, 30},
    };
    for (const auto& [what, steps, expected] : cases) {
        SimulatedClock clock;
        const double start = clock.now();
        double idleAt = 0;
        int calls = 0;
        whenNoneWasOpenFor(10, [&] {
            idleAt = clock.now() - start;
            ++calls;
        });
        for (const Step& step : steps) {
            clock.advanceBy(step.at - (clock.now() - start));
            for (int i = 0; i < step.change; ++i) began();
            for (int i = 0; i > step.change; --i) ended();
        }
        clock.advanceBy(100 - (clock.now() - start));
        EXPECT_DOUBLE_EQ(idleAt, expected) << what;
        EXPECT_EQ(calls, expected > 0 ? 1 : 0) << what;
        while (openCount() > 0) ended();
        clock.advanceBy(20);
    }
}

TEST(TransactionsTest, AClockThatIsSetBackDoesNotKeepTheProcess) {
    SimulatedClock clock;
    bool idle = false;
    whenNoneWasOpenFor(10, [&] { idle = true; });
    began();
    ended();
    clock.jumpTo(clock.now() - 86'400);
    clock.advanceBy(20);
    EXPECT_TRUE(idle);
}

}  // namespace
}  // namespace platform::transactions
