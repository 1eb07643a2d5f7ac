// What the tests of both forms of property lists share.
#pragma once

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

}  // namespace platform
