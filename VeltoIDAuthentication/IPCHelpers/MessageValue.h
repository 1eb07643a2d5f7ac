// The values that messages carry, their conversion to and from the agent's own, and their description.
#pragma once

#include <array>
#include <cmath>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "Platform/encoding/ValueSink.h"
#include "Values/Value.h"

namespace veltoid {

struct MessageValue;

using MessageArray = std::vector<MessageValue>;

/// Entries in the order of the message; keys are unique.
struct MessageDictionary {
    std::vector<std::pair<String, MessageValue>> entries;

    const MessageValue* find(std::string_view key) const;
    void set(const String& key, MessageValue value);
};

struct MessageNull {};
struct MessageDate {
    /// Seconds since 1970-01-01 00:00:00 UTC.
    double seconds = 0;
};
struct MessageUUID {
    std::array<uint8_t, 16> bytes{};
};
/// A connection-level error instead of a message.
struct MessageError {
    String description;
};
struct MessageConnection {};
struct MessageFileDescriptor {};
struct MessageSharedMemory {};
/// A kind that the agent does not know, with the service's own description of it.
struct MessageOther {
    std::string description;
};

/// One value of a message; the empty first alternative is no value at all.
struct MessageValue {
    std::variant<std::monostate, MessageNull, bool, int64_t, uint64_t, double, String, Data, MessageDate,
                 MessageArray, MessageDictionary, MessageError, MessageConnection, MessageUUID,
                 MessageFileDescriptor, MessageSharedMemory, MessageOther>
        content;
};

/// The agent's value of the same kind; absent for kinds that it has none for. Entries and elements without a
/// form are left out.
Value valueFromMessage(const MessageValue& value);

/// The message value of the same kind; none for what messages do not carry.
MessageValue messageFromValue(const Value& value);

/// A text of the value for logs: containers in brackets, strings in quotes but not escaped, data as
/// hexadecimal, dates as UTC calendar time.
std::string describe(const MessageValue& value);

/// Writes the value in the platform's event form; what that does not carry becomes null.
void writeMessageValue(const MessageValue& value, platform::ValueSink& sink);

/// Builds one message value from events.
class MessageValueBuilder : public platform::ValueSink {
  public:
    void null() override { add({MessageNull()}); }
    void boolean(bool value) override { add({value}); }
    void integer(int64_t value) override { add({value}); }
    void unsignedInteger(uint64_t value) override { add({value}); }
    void real(double value) override {
        isFinite_ = isFinite_ && std::isfinite(value);
        add({value});
    }
    void string(std::string_view utf8) override { add({String(utf8)}); }
    void data(platform::Bytes bytes) override { add({Data(bytes)}); }
    void date(double seconds) override {
        isFinite_ = isFinite_ && std::isfinite(seconds);
        add({MessageDate{seconds}});
    }
    void uuid(std::span<const uint8_t, 16> bytes) override;
    void fileDescriptor(int) override {
        hasDescriptor_ = true;
        add({MessageFileDescriptor()});
    }
    void beginArray() override { open_.push_back({{MessageArray()}, {}}); }
    void endArray() override { endContainer(); }
    void beginDictionary() override { open_.push_back({{MessageDictionary()}, {}}); }
    void key(std::string_view utf8) override { open_.back().key = String(utf8); }
    void endDictionary() override { endContainer(); }

    /// The value once it is complete; empty when the events ended early.
    MessageValue take() { return std::move(value_); }

    /// Whether all dates and numbers so far, at any depth, are finite.
    bool isFinite() const { return isFinite_; }
    /// Whether there was a file descriptor at any depth.
    bool hasDescriptor() const { return hasDescriptor_; }

  private:
    struct Level {
        MessageValue container;
        String key;
    };
    void add(MessageValue value);
    void endContainer();

    std::vector<Level> open_;
    MessageValue value_;
    bool isFinite_ = true;
    bool hasDescriptor_ = false;
};

}  // namespace veltoid
