// The whole agent, started and ended again and again on the same files in one process: a real bus, real
// storage, and a client in each life. What one life has stored the next one has, and no life leaves anything
// else behind.
#include <gtest/gtest.h>
#include <malloc.h>
#include <pthread.h>
#include <spawn.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <filesystem>
#include <memory>
#include <thread>

#include "Platform/bus/BusMessage.h"
#include "Platform/runtime/SystemLog.h"
#include "Protocol/Commands.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/OptionKeys.h"
#include "TestSupport/TemporaryStateDirectory.h"
#include "TestSupport/TestLifetime.h"
#include "Values/ValueStream.h"
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

class Bus {
  public:
    Bus() {
        int ends[2];
        if (pipe(ends) != 0) throw std::runtime_error("no pipe");
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, ends[1], STDOUT_FILENO);
        posix_spawn_file_actions_addclose(&actions, ends[0]);
        const char* arguments[] = {"dbus-daemon", "--session",       "--nofork",
                                   "--nopidfile", "--print-address", nullptr};
        const int error = posix_spawnp(&process_, arguments[0], &actions, nullptr,
                                       const_cast<char* const*>(arguments), environ);
        posix_spawn_file_actions_destroy(&actions);
        close(ends[1]);
        std::string address;
        for (char c = 0; error == 0 && read(ends[0], &c, 1) == 1 && c != '\n';) address += c;
        close(ends[0]);
        if (address.empty()) throw std::runtime_error("no dbus-daemon");
        setenv("DBUS_SESSION_BUS_ADDRESS", address.c_str(), 1);
    }
    ~Bus() {
        kill(process_, SIGTERM);
        waitpid(process_, nullptr, 0);
    }
    Bus(const Bus&) = delete;
    Bus& operator=(const Bus&) = delete;

  private:
    pid_t process_ = -1;
};

/// A client of the agent, on a thread of its own in each life.
class Client {
  public:
    Client() {
        EXPECT_GE(sd_bus_open_user(&bus_), 0);
        EXPECT_GE(sd_bus_match_signal(bus_, nullptr, kDaemon, kDaemonPath, kDaemon, "NameOwnerChanged",
                                      nullptr, nullptr),
                  0);
    }
    ~Client() { sd_bus_flush_close_unref(bus_); }
    Client(const Client&) = delete;
    Client& operator=(const Client&) = delete;

    void waitForAgent() {
        while (!agentIsThere()) {
            sd_bus_wait(bus_, UINT64_MAX);
            while (sd_bus_process(bus_, nullptr) > 0) {
            }
        }
    }

    /// Empty when there is no reply.
    Dictionary call(int64_t command, Dictionary request = {}) {
        request.set(message::kCommand, Value::int64(command));
        sd_bus_message* call = nullptr;
        sd_bus_message* reply = nullptr;
        EXPECT_GE(sd_bus_message_new_method_call(bus_, &call, kVeltoIDAuthenticationServiceName,
                                                 kVeltoIDObjectPath, kVeltoIDMessageInterface, "Send"),
                  0);
        EXPECT_GE(platform::bus::appendDictionary(
                      call, [&](platform::ValueSink& sink) { writeValue(Value(request), sink); }),
                  0);
        ValueBuilder builder;
        if (sd_bus_call(bus_, call, 0, nullptr, &reply) >= 0) platform::bus::readDictionary(reply, builder);
        sd_bus_message_unref(reply);
        sd_bus_message_unref(call);
        const Dictionary* answer = reply != nullptr ? builder.value().asDictionary() : nullptr;
        return answer != nullptr ? *answer : Dictionary();
    }

  private:
    static constexpr const char* kDaemon = "org.freedesktop.DBus";
    static constexpr const char* kDaemonPath = "/org/freedesktop/DBus";

    bool agentIsThere() {
        sd_bus_message* reply = nullptr;
        int isThere = 0;
        EXPECT_GE(sd_bus_call_method(bus_, kDaemon, kDaemonPath, kDaemon, "NameHasOwner", nullptr, &reply,
                                     "s", kVeltoIDAuthenticationServiceName),
                  0);
        EXPECT_GE(sd_bus_message_read(reply, "b", &isThere), 0);
        sd_bus_message_unref(reply);
        return isThere != 0;
    }

    sd_bus* bus_ = nullptr;
};

class SilentLog : public platform::SystemLog {
  public:
    SilentLog() { replaceShared(this); }
    ~SilentLog() override { replaceShared(nullptr); }
    SilentLog(const SilentLog&) = delete;
    SilentLog& operator=(const SilentLog&) = delete;
    void open(std::string_view) override {}
    void write(platform::LogPriority, std::string_view, const platform::LogOrigin&) override {}
};

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
    const Bus bus_;
    SilentLog log_;
    Client client_;
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
