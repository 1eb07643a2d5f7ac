// A real bus, and a client on it that speaks to the agent.
#pragma once

#include <gtest/gtest.h>
#include <spawn.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <stdexcept>
#include <string>

#include "Platform/bus/BusMessage.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/Names.h"
#include "Values/ValueStream.h"

namespace veltoid {

/// A bus of the test's own, which every bus connection of the process uses while it lives.
class PrivateBus {
  public:
    PrivateBus() {
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
    ~PrivateBus() {
        kill(process_, SIGTERM);
        waitpid(process_, nullptr, 0);
    }
    PrivateBus(const PrivateBus&) = delete;
    PrivateBus& operator=(const PrivateBus&) = delete;

  private:
    pid_t process_ = -1;
};

/// A client of the agent. One thread at a time.
class BusClient {
  public:
    BusClient() {
        EXPECT_GE(sd_bus_open_user(&bus_), 0);
        EXPECT_GE(sd_bus_match_signal(bus_, nullptr, kDaemon, kDaemonPath, kDaemon, "NameOwnerChanged",
                                      nullptr, nullptr),
                  0);
    }
    ~BusClient() { sd_bus_flush_close_unref(bus_); }
    BusClient(const BusClient&) = delete;
    BusClient& operator=(const BusClient&) = delete;

    void waitForAgent() {
        takeSignals();
        while (!agentIsThere()) {
            sd_bus_wait(bus_, UINT64_MAX);
            takeSignals();
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
    void takeSignals() {
        while (sd_bus_process(bus_, nullptr) > 0) {
        }
    }

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

}  // namespace veltoid
