// Values of a reply as JSON.
#pragma once

#include <string>
#include <vector>

#include "Platform/encoding/ValueSink.h"
#include "Values/Value.h"
#include "veltoidctl/Json.h"

namespace veltoidctl {

/// The bytes behind a key of a reply; null without them.
veltoid::Data dataIn(const Json& dictionary, std::string_view key);

/// Dates become ISO 8601 text at UTC, data and UUIDs base64 text; file descriptors null.
class JsonBuilder : public platform::ValueSink {
  public:
    void null() override { add(nullptr); }
    void boolean(bool value) override { add(value); }
    void integer(int64_t value) override { add(value); }
    void unsignedInteger(uint64_t value) override { add(value); }
    void real(double value) override { add(value); }
    void string(std::string_view utf8) override { add(std::string(utf8)); }
    void data(platform::Bytes bytes) override;
    void date(double seconds) override;
    void uuid(std::span<const uint8_t, 16> bytes) override { data(bytes); }
    void fileDescriptor(int) override { null(); }
    void beginArray() override { open_.push_back({Json::array(), {}}); }
    void endArray() override { endContainer(); }
    void beginDictionary() override { open_.push_back({Json::object(), {}}); }
    void key(std::string_view utf8) override { open_.back().key = std::string(utf8); }
    void endDictionary() override { endContainer(); }

    /// The value; an empty object when the events ended early.
    Json take() { return complete_ ? std::move(value_) : Json::object(); }

  private:
    struct Level {
        Json container;
        std::string key;
    };
    void add(Json value);
    void endContainer();

    std::vector<Level> open_;
    Json value_;
    bool complete_ = false;
};

}  // namespace veltoidctl
