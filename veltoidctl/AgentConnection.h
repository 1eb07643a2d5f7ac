// A client's connection to the agent: one dictionary request, one dictionary reply.
#pragma once

#include <stdexcept>
#include <string>

#include "Platform/encoding/ValueSink.h"
#include "veltoidctl/Json.h"

struct sd_bus;

namespace veltoidctl {

/// The agent could not be reached or did not answer in time.
class Unreachable : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

class AgentConnection {
  public:
    /// Throws Unreachable when there is no bus.
    AgentConnection(std::string service, double timeoutSeconds);
    ~AgentConnection();
    AgentConnection(const AgentConnection&) = delete;
    AgentConnection& operator=(const AgentConnection&) = delete;

    /// Sends what `writer` writes (one dictionary) and returns the reply: dates as ISO 8601 text at UTC, data
    /// as base64 text. The request's memory is wiped. Throws Unreachable.
    Json send(const platform::ValueWriter& writer);

    /// Posts the notification to all listeners; a running agent is one of them. Throws Unreachable.
    void post(const std::string& notification);

  private:
    std::string service_;
    double timeoutSeconds_;
    sd_bus* bus_ = nullptr;
};

}  // namespace veltoidctl
