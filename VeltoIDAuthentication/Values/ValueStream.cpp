#include "Values/ValueStream.h"

#include <cmath>

namespace veltoid {
namespace {

void writeNumber(const Value& value, platform::ValueSink& sink) {
    switch (*value.numberKind()) {
        case NumberKind::Float64:
            sink.real(*value.asDouble());
            break;
        case NumberKind::Float32:
            sink.singleReal(static_cast<float>(*value.asDouble()));
            break;
        case NumberKind::UInt64:
            sink.unsignedInteger(*value.asUInt64());
            break;
        default:
            sink.integer(*value.asInt64());
    }
}

void writeDictionary(const Dictionary& dictionary, platform::ValueSink& sink) {
    sink.beginDictionary();
    for (const auto& [key, element] : dictionary) {
        sink.key(key.view());
        writeValue(element, sink);
    }
    sink.endDictionary();
}

}  // namespace

void writeValue(const Value& value, platform::ValueSink& sink) {
    switch (value.kind()) {
        case Value::Kind::Boolean:
            sink.boolean(*value.asBoolean());
            break;
        case Value::Kind::Number:
            writeNumber(value, sink);
            break;
        case Value::Kind::Date:
            sink.date(*value.asDate());
            break;
        case Value::Kind::String:
            sink.string(*value.asText());
            break;
        case Value::Kind::Data:
            sink.data(value.asData().bytes());
            break;
        case Value::Kind::UUID:
            sink.uuid(*value.asUUID());
            break;
        case Value::Kind::Array:
            sink.beginArray();
            for (const Value& element : *value.asArray()) writeValue(element, sink);
            sink.endArray();
            break;
        case Value::Kind::Dictionary:
            writeDictionary(*value.asDictionary(), sink);
            break;
        default:
            sink.null();
    }
}

void ValueBuilder::add(Value value) {
    if (open_.empty()) {
        value_ = std::move(value);
    } else if (open_.back().array) {
        open_.back().array->append(std::move(value));
    } else {
        open_.back().dictionary->set(open_.back().key, std::move(value));
    }
}

void ValueBuilder::addFinite(double number, Value value) {
    if (std::isfinite(number)) add(std::move(value));
}

void ValueBuilder::endContainer(Value container) {
    open_.pop_back();
    add(std::move(container));
}

}  // namespace veltoid
