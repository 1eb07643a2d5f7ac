#include "veltoidctl/AgentConnection.h"

#include <systemd/sd-bus.h>

#include <memory>

#include "Platform/bus/BusMessage.h"
#include "Protocol/Names.h"
#include "veltoidctl/JsonBuilder.h"

namespace veltoidctl {
namespace {

constexpr double kMicrosecondsPerSecond = 1e6;

using Message = std::unique_ptr<sd_bus_message, decltype(&sd_bus_message_unref)>;

/// What sd-bus has to say is for programmers; these are the cases that people meet.
std::string explain(const sd_bus_error& error, int result) {
    const std::string name = error.name != nullptr ? error.name : "";
    if (name == SD_BUS_ERROR_SERVICE_UNKNOWN || name == SD_BUS_ERROR_NAME_HAS_NO_OWNER)
        return "the agent is not installed on this bus, or cannot be started";
    if (name == SD_BUS_ERROR_NO_REPLY || name == SD_BUS_ERROR_TIMEOUT || result == -ETIMEDOUT)
        return "the agent did not answer in time, or ended before it could";
    if (name == SD_BUS_ERROR_ACCESS_DENIED) return "the agent serves another user";
    return error.message != nullptr ? error.message : std::string("the bus failed: ") + strerror(-result);
}

}  // namespace

AgentConnection::AgentConnection(std::string service, double timeoutSeconds)
    : service_(std::move(service)), timeoutSeconds_(timeoutSeconds) {
    const int result = sd_bus_open_user(&bus_);
    if (result < 0) throw Unreachable(std::string("there is no message bus: ") + strerror(-result));
}

AgentConnection::~AgentConnection() { sd_bus_flush_close_unref(bus_); }

Json AgentConnection::send(const platform::ValueWriter& writer) {
    sd_bus_message* call = nullptr;
    int result = sd_bus_message_new_method_call(bus_, &call, service_.c_str(), veltoid::kVeltoIDObjectPath,
                                                veltoid::kVeltoIDMessageInterface, "Send");
    const Message request(call, sd_bus_message_unref);
    if (result >= 0) result = sd_bus_message_sensitive(call);
    if (result >= 0) result = platform::bus::appendDictionary(call, writer);
    if (result < 0) throw Unreachable(std::string("the request cannot be sent: ") + strerror(-result));

    sd_bus_error error{};
    sd_bus_message* answer = nullptr;
    result = sd_bus_call(bus_, call, static_cast<uint64_t>(timeoutSeconds_ * kMicrosecondsPerSecond), &error,
                         &answer);
    const Message reply(answer, sd_bus_message_unref);
    if (result < 0) {
        const std::string text = explain(error, result);
        sd_bus_error_free(&error);
        throw Unreachable(text);
    }
    JsonBuilder builder;
    platform::bus::readDictionary(answer, builder);
    return builder.take();
}

void AgentConnection::post(const std::string& notification) {
    const int result =
        sd_bus_emit_signal(bus_, veltoid::kVeltoIDObjectPath, veltoid::kVeltoIDNotificationInterface,
                           "Posted", "s", notification.c_str());
    if (result < 0) throw Unreachable(std::string("the bus failed: ") + strerror(-result));
}

}  // namespace veltoidctl
