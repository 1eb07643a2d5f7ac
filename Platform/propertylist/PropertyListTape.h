// The events of a list that is still being read, kept until all of it has proved good. Internal to the
// PropertyList sources.
#pragma once

#include <algorithm>
#include <cstring>
#include <type_traits>
#include <utility>

#include "Platform/encoding/ValueSink.h"

namespace platform::propertylist {

/// Takes the events that the XML form has. Used by one thread.
class Tape {
  public:
    explicit Tape(size_t expectedBytes) : bytes_(expectedBytes) {}

    void boolean(bool value) { add(value ? kTrue : kFalse); }
    void integer(int64_t value) { addFixed(kInteger, value); }
    void unsignedInteger(uint64_t value) { addFixed(kUnsignedInteger, value); }
    void real(double value) { addFixed(kReal, value); }
    void date(double seconds) { addFixed(kDate, seconds); }
    void string(std::string_view utf8) { addBytes(kString, bytesOf(utf8)); }
    void data(Bytes bytes) { addBytes(kData, bytes); }
    void key(std::string_view utf8) { addBytes(kKey, bytesOf(utf8)); }
    void beginArray() { add(kBeginArray); }
    void endArray() { add(kEndArray); }
    void beginDictionary() { add(kBeginDictionary); }
    void endDictionary() { add(kEndDictionary); }

    /// Delivers everything in the order in which it came.
    void replay(ValueSink& sink) const {
        for (Bytes rest = Bytes(bytes_).first(used_); !rest.empty();) replayOne(rest, sink);
    }

  private:
    enum Event : uint8_t {
        kFalse,
        kTrue,
        kInteger,
        kUnsignedInteger,
        kReal,
        kDate,
        kString,
        kData,
        kKey,
        kBeginArray,
        kEndArray,
        kBeginDictionary,
        kEndDictionary,
    };

    /// Room for so many bytes at the end.
    uint8_t* extend(size_t size) {
        if (size > bytes_.size() - used_) bytes_.resize(std::max(2 * bytes_.size(), used_ + size));
        return bytes_.data() + std::exchange(used_, used_ + size);
    }

    void add(Event event) { *extend(1) = event; }

    template <typename T>
    void addFixed(Event event, T value) {
        static_assert(std::is_trivially_copyable_v<T>);
        uint8_t* room = extend(1 + sizeof value);
        *room = event;
        std::memcpy(room + 1, &value, sizeof value);
    }

    void addBytes(Event event, Bytes bytes) {
        addFixed(event, bytes.size());
        std::copy(bytes.begin(), bytes.end(), extend(bytes.size()));
    }

    template <typename T>
    static T take(Bytes& rest) {
        T value;
        std::memcpy(&value, rest.data(), sizeof value);
        rest = rest.subspan(sizeof value);
        return value;
    }

    static Bytes takeBytes(Bytes& rest) {
        const auto size = take<size_t>(rest);
        const Bytes taken = rest.first(size);
        rest = rest.subspan(size);
        return taken;
    }

    static void replayOne(Bytes& rest, ValueSink& sink) {
        switch (const auto event = take<uint8_t>(rest); event) {
            case kFalse:
            case kTrue:
                return sink.boolean(event == kTrue);
            case kInteger:
                return sink.integer(take<int64_t>(rest));
            case kUnsignedInteger:
                return sink.unsignedInteger(take<uint64_t>(rest));
            case kReal:
                return sink.real(take<double>(rest));
            case kDate:
                return sink.date(take<double>(rest));
            case kString:
                return sink.string(textOf(takeBytes(rest)));
            case kData:
                return sink.data(takeBytes(rest));
            case kKey:
                return sink.key(textOf(takeBytes(rest)));
            case kBeginArray:
                return sink.beginArray();
            case kEndArray:
                return sink.endArray();
            case kBeginDictionary:
                return sink.beginDictionary();
            default:
                return sink.endDictionary();
        }
    }

    SecretBytes bytes_;
    size_t used_ = 0;
};

}  // namespace platform::propertylist
