#include "Platform/runtime/WorkQueue.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <cmath>
#include <memory>

#include "TestSupport/Journal.h"
#include "TestSupport/SideBySide.h"
#include "TestSupport/SimulatedClock.h"

namespace platform {
namespace {

constexpr double kDay = 86'400;
/// Far beyond what anything here takes: a wait that reaches it has failed.
constexpr double kBound = 60;

TEST(WorkQueueTest, RunsTasksOneByOneInTheOrderInWhichTheyCame) {
    const WorkQueue queue("one");
    const Gate gate(queue);
    std::vector<int> order;
    for (int i = 0; i < 1000; ++i) queue.async([&order, i] { order.push_back(i); });
    gate.open();
    EXPECT_EQ(queue.sync([&] { return order.size(); }), 1000U);
    for (int i = 0; i < 1000; ++i) ASSERT_EQ(order[static_cast<size_t>(i)], i);
}

TEST(WorkQueueTest, SyncOnAnIdleQueueRunsOnTheCallersThread) {
    const WorkQueue outer("outer");
    const WorkQueue inner("inner");
    const WorkQueue sameAsInner = inner;
    const WorkQueue namesake("inner");
    EXPECT_EQ(WorkQueue::currentLabel(), nullptr);
    const auto result = outer.sync([&] {
        EXPECT_TRUE(outer.isCurrent());
        EXPECT_FALSE(inner.isCurrent());
        const auto thread = inner.sync([&] {
            EXPECT_EQ(*WorkQueue::currentLabel(), "inner");
            EXPECT_TRUE(outer.isCurrent() && sameAsInner.isCurrent());
            EXPECT_FALSE(namesake.isCurrent());
            return std::this_thread::get_id();
        });
        EXPECT_EQ(thread, std::this_thread::get_id());
        EXPECT_EQ(*WorkQueue::currentLabel(), "outer");
        return std::make_unique<std::thread::id>(thread);
    });
    EXPECT_EQ(*result, std::this_thread::get_id());
    EXPECT_EQ(WorkQueue::currentLabel(), nullptr);
    EXPECT_FALSE(outer.isCurrent());
    EXPECT_TRUE(inner == sameAsInner);
    EXPECT_FALSE(inner == namesake);
    EXPECT_EQ(WorkQueue::main().label(), "main");
}

TEST(WorkQueueTest, SyncOnABusyQueueWaitsItsTurn) {
    SimulatedClock clock;
    const WorkQueue queue("busy");
    Journal journal;
    const Gate gate(queue);
    const std::array<WorkQueue, 2> callers = {WorkQueue("first"), WorkQueue("second")};
    queue.async([&] { journal.add("before"); });
    for (const WorkQueue& caller : callers) {
        caller.async([&] {
            const auto thread = std::this_thread::get_id();
            queue.sync([&] {
                journal.add(caller.label());
                EXPECT_EQ(std::this_thread::get_id(), thread);
                EXPECT_EQ(*WorkQueue::currentLabel(), "busy");
            });
            EXPECT_EQ(*WorkQueue::currentLabel(), caller.label());
        });
        clock.settle();
        queue.async([&] { journal.add("between"); });
    }
    EXPECT_EQ(journal.take(), "");
    gate.open();
    clock.settle();
    EXPECT_EQ(journal.take(), "before first between second between");
}

TEST(WorkQueueTest, TryRunNowTakesAnIdleQueueOnly) {
    SimulatedClock clock;
    const WorkQueue queue("tried");
    Journal journal;
    const auto thread = std::this_thread::get_id();
    EXPECT_TRUE(queue.tryRunNow([&] {
        EXPECT_EQ(std::this_thread::get_id(), thread);
        EXPECT_TRUE(queue.isCurrent());
        queue.async([&] { journal.add("queued"); });
        EXPECT_FALSE(queue.tryRunNow([&] { journal.add("inside"); }));
        journal.add("ran");
    }));
    clock.settle();
    EXPECT_EQ(journal.take(), "ran queued");
    const Gate gate(queue);
    EXPECT_FALSE(queue.tryRunNow([&] { journal.add("while busy"); }));
    gate.open();
    clock.settle();
    EXPECT_EQ(journal.take(), "");
    EXPECT_TRUE(queue.tryRunNow([&] { journal.add("idle again"); }));
    EXPECT_EQ(journal.take(), "idle again");
}

TEST(WorkQueueDeathTest, SyncOntoAQueueThatTheCallerIsOnAborts) {
    const WorkQueue outer("outer");
    const WorkQueue inner("inner");
    EXPECT_DEATH(outer.sync([&] { outer.sync([] {}); }), "sync onto queue \"outer\" from queue \"outer\"");
    EXPECT_DEATH(outer.sync([&] { inner.sync([&] { outer.sync([] {}); }); }),
                 "sync onto queue \"outer\" from queue \"inner\"");
    EXPECT_DEATH(outer.tryRunNow([&] { outer.sync([] {}); }),
                 "sync onto queue \"outer\" from queue \"outer\"");
}

TEST(WorkQueueTest, DelayedTasksRunAtTheirTimes) {
    SimulatedClock clock(1000);
    const WorkQueue queue("delayed");
    Journal journal;
    for (const auto& [seconds, name] : {std::pair(30 * kDay, "month"),
                                        {3, "late"},
                                        {2, "tie1"},
                                        {2, "tie2"},
                                        {0, "zero"},
                                        {-5, "negative"},
                                        {std::nan(""), "nan"}})
        queue.asyncAfter(seconds, [&clock, &journal, name = std::string(name)] {
            journal.add(name + "@" + std::to_string(std::lround(clock.now() - 1000)));
        });
    clock.settle();
    EXPECT_EQ(journal.take(), "zero@0 negative@0 nan@0");
    clock.advanceBy(1.999);
    EXPECT_EQ(journal.take(), "");
    clock.advanceBy(1.001);
    EXPECT_EQ(journal.take(), "tie1@2 tie2@2 late@3");
    clock.jumpTo(1e9);
    EXPECT_EQ(journal.take(), "") << "setting the date lets no time pass";
    clock.jumpTo(1003);
    clock.advanceBy(365 * kDay);
    EXPECT_EQ(journal.take(), "month@2592000");
}

TEST(WorkQueueTest, TheMainQueueWaitsForTheLoopThatHasAdoptedIt) {
    std::thread([] {
        Journal journal;
        Semaphore woken;
        const WorkQueue main = WorkQueue::main();
        main_queue::adopt([woken] { woken.signal(); });
        EXPECT_TRUE(main.isCurrent());
        main.async([&] {
            journal.add("first");
            main.async([&] { journal.add("queued by first"); });
        });
        EXPECT_FALSE(main.tryRunNow([&] { journal.add("never"); }));
        EXPECT_TRUE(woken.wait(kBound));
        EXPECT_EQ(journal.take(), "");
        main_queue::runPending();
        EXPECT_EQ(journal.take(), "first") << "a task that queues itself again must not hold up the loop";
        main_queue::runPending();
        EXPECT_EQ(journal.take(), "queued by first");
        EXPECT_TRUE(woken.wait(kBound));

        const auto loopThread = std::this_thread::get_id();
        std::thread caller([&] {
            EXPECT_EQ(main.sync([] { return std::this_thread::get_id(); }), loopThread);
            journal.add("answered");
        });
        EXPECT_TRUE(woken.wait(kBound));
        main_queue::runPending();
        caller.join();
        EXPECT_EQ(journal.take(), "answered");
    }).join();
}

TEST(WorkQueueTest, ManyThreadsHammerManyQueues) {
    constexpr size_t kQueues = 12;
    constexpr int kThreads = 8;
    constexpr unsigned kRounds = 2000;
    struct Counted {
        WorkQueue queue{"hammered"};
        /// Not atomic: the queue is what guards it.
        uint64_t count = 0;
    };
    std::array<Counted, kQueues> all;
    std::atomic<uint64_t> done = 0;
    const auto add = [&](Counted& counted) {
        ++counted.count;
        done.fetch_add(1);
    };
    sideBySide(kThreads, [&](int seed) {
        unsigned random = 2 * static_cast<unsigned>(seed) + 1;
        for (unsigned round = 0; round < kRounds; ++round) {
            random = random * 1'664'525U + 1'013'904'223U;
            // Always from a lower queue onto a higher one, so that no two of them wait for each other.
            const size_t low = (random >> 8U) % (kQueues - 1);
            const size_t high = low + 1 + (random >> 16U) % (kQueues - 1 - low);
            Counted& a = all[low];
            Counted& b = all[high];
            const unsigned way = (random >> 24U) % 4;
            if (way == 0 || (way == 3 && !a.queue.tryRunNow([&] { add(a); })))
                a.queue.async([&a, add] { add(a); });
            else if (way == 1)
                a.queue.async([&b, add] { b.queue.sync([&] { add(b); }); });
            else if (way == 2)
                a.queue.sync([&] { b.queue.sync([&] { add(b); }); });
        }
    });
    uint64_t sum = 0;
    // From the lowest upwards: what is queued on one may still reach the ones above.
    for (Counted& counted : all) counted.queue.sync([] {});
    for (Counted& counted : all) sum += counted.queue.sync([&] { return counted.count; });
    EXPECT_EQ(sum, kThreads * kRounds);
    EXPECT_EQ(done, sum);
}

TEST(SemaphoreTest, CountsSignals) {
    for (const auto& [initial, signals] : {std::pair(0, 0), {2, 0}, {0, 3}, {1, 1}}) {
        const Semaphore semaphore(initial);
        const Semaphore same = semaphore;
        for (int i = 0; i < signals; ++i) same.signal();
        for (int i = 0; i < initial + signals; ++i)
            EXPECT_TRUE(semaphore.wait(0)) << initial << "+" << signals;
        for (const double seconds : {0.0, -1.0, std::nan("")}) EXPECT_FALSE(semaphore.wait(seconds));
    }
}

TEST(SemaphoreTest, WaitsForASignalItsTimeOrAJumpOfTheClock) {
    SimulatedClock clock(0);
    const WorkQueue waiter("waiter");
    const Semaphore semaphore;
    Journal journal;
    const auto startWaiting = [&](double seconds) {
        waiter.async([&, seconds] {
            const bool took = semaphore.wait(seconds);
            journal.add((took ? "signal@" : "none@") + std::to_string(std::lround(clock.now())));
        });
        clock.settle();
    };
    startWaiting(10);
    clock.advanceBy(9);
    EXPECT_EQ(journal.take(), "");
    clock.advanceBy(1);
    EXPECT_EQ(journal.take(), "none@10");
    semaphore.signal();
    EXPECT_TRUE(semaphore.wait(0)) << "a signal after the time was up is for the next one";

    startWaiting(10);
    clock.advanceBy(5);
    semaphore.signal();
    clock.settle();
    EXPECT_EQ(journal.take(), "signal@15");
    clock.advanceBy(100);
    EXPECT_EQ(journal.take(), "") << "the timer of a wait that was answered";

    startWaiting(1e6);
    clock.jumpTo(5000);
    EXPECT_EQ(journal.take(), "none@5000");
    startWaiting(kForever);
    clock.jumpTo(0);
    clock.advanceBy(100 * 365 * kDay);
    EXPECT_EQ(journal.take(), "") << "whoever waits for a signal alone does not look at dates";
    semaphore.signal();
    clock.settle();
    EXPECT_EQ(journal.take(), "signal@3153600000");
}

TEST(SimulatedClockTest, IsNotSettledWhileAThreadThatWasReleasedHasYetToRun) {
    SimulatedClock clock;
    const std::array<WorkQueue, 4> chain = {WorkQueue("0"), WorkQueue("1"), WorkQueue("2"), WorkQueue("3")};
    for (int round = 0; round < 2000; ++round) {
        const Semaphore start;
        std::atomic<int> ran = 0;
        chain[0].async([&start, &ran] {
            start.wait();
            ++ran;
        });
        clock.settle();
        for (size_t i = 1; i < chain.size(); ++i) {
            chain[i].async([&chain, &ran, i] { chain[i - 1].sync([&ran] { ++ran; }); });
            clock.settle();
        }
        start.signal();
        clock.settle();
        ASSERT_EQ(ran, 4) << "round " << round;
    }
}

}  // namespace
}  // namespace platform
