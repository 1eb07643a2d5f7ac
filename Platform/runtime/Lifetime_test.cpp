#include "Platform/runtime/Lifetime.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <thread>

#include "Platform/runtime/Clock.h"
#include "TestSupport/Journal.h"
#include "TestSupport/TestLifetime.h"

namespace platform {
namespace {

/// What the states of a test have done.
Journal& journal() {
    static Journal events;
    return events;
}

template <char Name>
struct Recorded {
    Recorded() { journal().add(std::string("+") + Name); }
    ~Recorded() { journal().add(std::string("-") + Name); }
    Recorded(const Recorded&) = delete;
    Recorded& operator=(const Recorded&) = delete;
    void lifetimeEnds() {
        EXPECT_TRUE(Lifetime::current().isEnding());
        journal().add(std::string("!") + Name);
    }
};

template <char Name>
Recorded<Name>& state() {
    return Lifetime::current().state<Recorded<Name>>();
}

/// Stands on another state.
struct Upper : Recorded<'u'> {
    Upper() { state<'l'>(); }
};

/// The listener of the tests begins a lifetime before and ends one after each.
class LifetimeTest : public testing::Test {
  protected:
    LifetimeTest() { TestLifetime::end(); }
    ~LifetimeTest() override { TestLifetime::begin(); }
    void TearDown() override { journal().take(); }
};

using LifetimeDeathTest = LifetimeTest;

TEST_F(LifetimeTest, StatesAreMadeOnceAndEndInReverseOrder) {
    for (int life = 0; life < 2; ++life) {
        {
            const Lifetime lifetime({});
            EXPECT_EQ(journal().take(), "");
            EXPECT_EQ(&state<'a'>(), &state<'a'>());
            Lifetime::current().state<Upper>();
            EXPECT_EQ(journal().take(), "+a +u +l");
        }
        EXPECT_EQ(journal().take(), "!u !l !a -u -l -a");
    }
}

TEST_F(LifetimeTest, APartThatWasGivenIsTheCallers) {
    struct Interface {
        virtual ~Interface() = default;
        virtual char name() const { return 'g'; }
    };
    struct Real : Interface {
        char name() const override { return 'r'; }
    };
    Interface given;
    const auto nameIn = [](const Lifetime::Parts& parts) {
        Lifetime lifetime({}, parts);
        return lifetime.part<Interface, Real>().name();
    };
    Lifetime::Parts parts;
    EXPECT_EQ(nameIn(parts), 'r');
    EXPECT_EQ(nameIn(parts.with(given)), 'g');
    parts.without<Interface>();
    EXPECT_FALSE(parts.has<Interface>());
    EXPECT_EQ(nameIn(parts), 'r');
}

TEST_F(LifetimeTest, TheEndRunsWhatIsQueuedDropsWhatIsDelayedAndCutsWaits) {
    const auto entries = [](const char* directory) {
        return std::distance(std::filesystem::directory_iterator(directory), {});
    };
    const auto descriptors = entries("/proc/self/fd");
    int ran = 0;
    bool delayed = false;
    bool signalled = true;
    bool waitedInVain = true;
    // They outlive the lifetime, as what its tasks use has to.
    const WorkQueue queue("queue");
    const WorkQueue other("other");
    const Semaphore started;
    const Semaphore nothing;
    {
        const Lifetime lifetime({});
        queue.async([&] {
            started.signal();
            signalled = nothing.wait(1e6);
            // What comes of it is part of it.
            other.async([&] { queue.async([&] { ran += 10; }); });
            waitedInVain = nothing.wait(1e6);
            queue.asyncAfter(1, [&] { delayed = true; });
            ++ran;
        });
        queue.asyncAfter(1e6, [&] { delayed = true; });
        EXPECT_TRUE(started.wait(60));
    }
    EXPECT_EQ(ran, 11);
    EXPECT_FALSE(signalled || waitedInVain);
    EXPECT_FALSE(delayed);
    EXPECT_EQ(entries("/proc/self/fd"), descriptors);
}

TEST_F(LifetimeTest, TheMainQueueRunsDryOnTheThreadThatEnds) {
    const auto thread = std::this_thread::get_id();
    std::string order;
    {
        const Lifetime lifetime({});
        main_queue::adopt([] {});
        WorkQueue("queue").async([&] {
            WorkQueue::main().sync([&] {
                EXPECT_EQ(std::this_thread::get_id(), thread);
                order += "main ";
            });
            order += "queue ";
        });
    }
    EXPECT_EQ(order, "main queue ");
    EXPECT_EQ(WorkQueue::currentLabel(), nullptr);
}

TEST_F(LifetimeDeathTest, NothingIsUsedOutsideALifetime) {
    struct Late {
        ~Late() { state<'n'>(); }
    };
    EXPECT_DEATH(Lifetime::current(), "during a lifetime only");
    EXPECT_DEATH(
        {
            const Lifetime lifetime({});
            lifetime.current().state<Late>();
        },
        "used after its end");
    const Lifetime lifetime({});
    EXPECT_DEATH(Lifetime({}), "before the one before has ended");
}

}  // namespace
}  // namespace platform
