// What the tests of both forms of property lists share.
#pragma once

#include <array>
#include <limits>
#include <string>

#include "Platform/propertylist/PropertyList.h"
#include "TestSupport/RecordingSink.h"

namespace platform {

using ListReadFunction = bool (*)(Bytes, ValueSink&);

/// The events that the writer writes, as text.
inline std::string written(const ValueWriter& writer) {
    RecordingSink sink;
    writer(sink);
    return sink.text();
}

/// What reading gives: the events as text, or "refused".
inline std::string readBack(Bytes list, ListReadFunction read) {
    RecordingSink sink;
    return read(list, sink) ? sink.text() : "refused";
}

/// Containers within each other around one value.
inline ValueWriter nested(int depth) {
    return [depth](ValueSink& sink) {
        for (int i = 0; i < depth; ++i)
            i % 2 == 0 ? sink.beginArray() : (sink.beginDictionary(), sink.key("k"));
        sink.boolean(true);
        for (int i = depth; i-- > 0;) i % 2 == 0 ? sink.endArray() : sink.endDictionary();
    };
}

/// Every kind of value that both forms have.
inline void writeSample(ValueSink& sink) {
    const std::array<uint8_t, 5> data = {0, 127, 128, 254, 255};
    sink.beginDictionary();
    sink.key("booleans"), sink.beginArray(), sink.boolean(true), sink.boolean(false), sink.endArray();
    sink.key("integers"), sink.beginArray();
    for (const int64_t value : {int64_t{0}, int64_t{-1}, INT64_MAX, INT64_MIN}) sink.integer(value);
    sink.unsignedInteger(UINT64_MAX), sink.unsignedInteger(uint64_t{1} << 63U), sink.endArray();
    sink.key("reals"), sink.beginArray();
    for (const double value :
         {0.1, -0.0, 1e300, 5e-324, std::numeric_limits<double>::max(),
          std::numeric_limits<double>::infinity(), -std::numeric_limits<double>::infinity(),
          std::numeric_limits<double>::quiet_NaN()}) {
        sink.real(value);
    }
    sink.endArray();
    sink.key("dates"), sink.beginArray();
    for (const double seconds : {0.0, 1394039040.0, -1.0, -62135596800.0, 253402300799.0}) sink.date(seconds);
    sink.endArray();
    sink.key("data"), sink.beginArray();
    for (size_t size = 0; size <= data.size(); ++size) sink.data(Bytes(data).first(size));
    sink.endArray();
    sink.key("texts"), sink.beginArray();
    for (const std::string_view text : {"", " a\tb\n", "\r\n\r", "<&>\"']]>", "\x7F\u0080\u07FF\u0800\uFFFD",
                                        "Zoë \U00010000\U0010FFFF", "&amp;"}) {
        sink.string(text);
    }
    sink.endArray();
    sink.key("Schlüssel <1>"), sink.beginDictionary(), sink.endDictionary();
    sink.key(""), sink.beginArray(), sink.endArray();
    sink.endDictionary();
}

}  // namespace platform
