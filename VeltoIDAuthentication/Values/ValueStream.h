// Values to and from the platform's event form.
#pragma once

#include <vector>

#include "Platform/encoding/ValueSink.h"
#include "Values/Value.h"

namespace veltoid {

/// Writes the value; what the event form does not carry (absent, URL, Error, objects) becomes null.
void writeValue(const Value& value, platform::ValueSink& sink);

/// Builds one Value from events. File descriptors have no Value form and are left out; so are dates and
/// numbers that are not finite, with which nobody can reckon: stored ones and the server's count as absent.
class ValueBuilder : public platform::ValueSink {
  public:
    void null() override { add(Value::null()); }
    void boolean(bool value) override { add(Value::boolean(value)); }
    void integer(int64_t value) override { add(Value::int64(value)); }
    void unsignedInteger(uint64_t value) override { add(Value::uint64(value)); }
    void real(double value) override { addFinite(value, Value::real(value)); }
    void singleReal(float value) override { addFinite(static_cast<double>(value), Value::singleReal(value)); }
    void string(std::string_view utf8) override { add(String(utf8)); }
    void data(platform::Bytes bytes) override { add(Data(bytes)); }
    void date(double seconds) override { addFinite(seconds, Value::date(seconds)); }
    void uuid(std::span<const uint8_t, 16> bytes) override { add(Value::uuid(bytes)); }
    void fileDescriptor(int) override {}
    void beginArray() override { open_.push_back({Array(), {}, {}}); }
    void endArray() override { endContainer(std::move(*open_.back().array)); }
    void beginDictionary() override { open_.push_back({{}, Dictionary(), {}}); }
    void key(std::string_view utf8) override { open_.back().key = String(utf8); }
    void endDictionary() override { endContainer(std::move(*open_.back().dictionary)); }

    /// The value, once it is complete; absent before.
    const Value& value() const { return value_; }

  private:
    struct Level {
        std::optional<Array> array;
        std::optional<Dictionary> dictionary;
        String key;
    };
    void add(Value value);
    void addFinite(double number, Value value);
    void endContainer(Value container);

    std::vector<Level> open_;
    Value value_;
};

}  // namespace veltoid
