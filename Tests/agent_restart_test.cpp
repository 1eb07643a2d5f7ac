// The whole agent, started and ended again and again on the same files in one process: a real bus, real
// storage, and a client in each life. What one life has stored the next one has, and no life leaves anything
// else behind.
#include <gtest/gtest.h>
#include <malloc.h>
#include <pthread.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "Protocol/Commands.h"
#include "Protocol/OptionKeys.h"
#include "TestSupport/FakeSystemLog.h"
#include "TestSupport/PrivateBus.h"
#include "TestSupport/TemporaryStateDirectory.h"
#include "TestSupport/TestLifetime.h"
#include "VeltoIDAuthd/Agent.h"

#ifdef VELTOID_SANITIZED
extern "C" size_t __sanitizer_get_current_allocated_bytes();
#endif

namespace veltoid {
namespace {

#ifdef __SANITIZE_THREAD__
constexpr int kLives = 100;
/// The sanitizer has one of its own.
constexpr size_t kThreads = 2;
#else
constexpr int kLives = 1'000;
constexpr size_t kThreads = 1;
#endif
/// What is loaded or set up once for the process has been by then.
constexpr int kFirstLives = 40;
/// For what the allocator keeps, however many lives there were.
constexpr size_t kMaxGrowth = 100'000;

constexpr const char* kAccount = "jane@velto.example";
/// Refuses connections.
constexpr const char* kNoServer = "https://127.0.0.1:1/";

size_t entriesOf(const char* directory) {
    return static_cast<size_t>(std::distance(std::filesystem::directory_iterator(directory), {}));
}

size_t threads() { return entriesOf("/proc/self/task"); }
size_t descriptors() { return entriesOf("/proc/self/fd"); }

/// In use, of the heap.
size_t memory() {
#ifdef VELTOID_SANITIZED
    return __sanitizer_get_current_allocated_bytes();
#else
    const auto heap = mallinfo2();
    return heap.uordblks + heap.hblkhd;
#endif
}

class AgentRestartTest : public testing::Test {
  protected:
    void SetUp() override { platform::TestLifetime::end(); }
    void TearDown() override { platform::TestLifetime::begin(); }

    /// One life of the agent, with the client's part of it.
    template <typename Part>
    void live(Part part) {
        CommandLine line;
        line.metaInfoValues = {{"ServerURL", kNoServer}};
        std::thread client;
        {
            Agent agent({.line = line, .firstCheckDelay = 0});
            client = std::thread([&] {
                client_.waitForAgent();
                part();
            });
            EXPECT_EQ(agent.run(), EXIT_SUCCESS);
        }
        // Its last call may get no reply before the agent is gone.
        client.join();
    }

    /// What a client asks for in the life of that number, and how it finds what the one before has stored.
    void ask(int life) {
        EXPECT_EQ(client_.call(command::kPing)["success"], Value::boolean(true));
        const Dictionary contents = *client_.call(command::kDatabase).dictionary(message::kResult);
        if (life > 0) {
            EXPECT_EQ((*contents.dictionary(message::kMetaInfoSection))["life"], Value::int64(life - 1));
            EXPECT_EQ(client_.call(command::kList)[message::kResult], Value(Array{kAccount}));
        }
        client_.call(command::kSetValue, {{message::kSection, "MetaInfo"},
                                          {message::kKey, "life"},
                                          {message::kValue, Value::int64(life)}});
        if (life % 10 != 0) return;
        const Dictionary options = {{option::kDoNotCheckPassword, Value::boolean(true)},
                                    {option::kDoNotFetchInformation, Value::boolean(true)}};
        EXPECT_EQ(client_.call(command::kAdd, {{message::kAccount, kAccount},
                                               {message::kHashedPassword, "hash"},
                                               {message::kOptions, options}})["success"],
                  Value::boolean(true));
    }

    void end(int life) {
        const Dictionary terminate = {{option::kTerminateServer, Value::boolean(true)}};
        if (life % 50 == 1)
            client_.call(command::kStatus, {{message::kOptions, terminate}});
        else if (life % 2 == 0)
            client_.call(command::kTerminate);
        else
            pthread_kill(main_, SIGTERM);
    }

    const platform::TemporaryStateDirectory directory_;
    const PrivateBus bus_;
    platform::SilentLog log_;
    BusClient client_;
    const pthread_t main_ = pthread_self();
};

TEST_F(AgentRestartTest, ManyLivesOnTheSameFilesLeaveNothingBehind) {
    size_t descriptorsBefore = 0;
    size_t memoryBefore = 0;
    for (int life = 0; life < kLives && !HasFailure(); ++life) {
        live([&] {
            ask(life);
            end(life);
        });
        // The kernel may list a thread for a moment after it was joined.
        const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        while (threads() > kThreads && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
        EXPECT_EQ(threads(), kThreads) << "after life " << life;
        if (life == kFirstLives) {
            descriptorsBefore = descriptors();
            memoryBefore = memory();
        }
        EXPECT_EQ(descriptors(), life > kFirstLives ? descriptorsBefore : descriptors())
            << "after life " << life;
    }
    EXPECT_LT(memory(), memoryBefore + kMaxGrowth) << "from " << memoryBefore << " bytes";
}

}  // namespace
}  // namespace veltoid
