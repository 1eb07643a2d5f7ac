#include "IPCHelpers/MessageValue.h"

#include <algorithm>

#include "Logging/Log.h"
#include "Platform/encoding/CalendarText.h"
#include "Platform/encoding/HexText.h"

namespace veltoid {

const MessageValue* MessageDictionary::find(std::string_view key) const {
    const auto entry =
        std::find_if(entries.begin(), entries.end(), [&](const auto& e) { return e.first.view() == key; });
    return entry != entries.end() ? &entry->second : nullptr;
}

void MessageDictionary::set(const String& key, MessageValue value) {
    const auto entry =
        std::find_if(entries.begin(), entries.end(), [&](const auto& e) { return e.first == key; });
    if (entry != entries.end()) {
        entry->second = std::move(value);
    } else {
        entries.emplace_back(key, std::move(value));
    }
}

namespace {

/// Overloads of one visitor.
template <typename... Cases>
struct Visitor : Cases... {
    using Cases::operator()...;
};
template <typename... Cases>
Visitor(Cases...) -> Visitor<Cases...>;

Value arrayFromMessage(const MessageArray& message) {
    Array array;
    for (const MessageValue& element : message) array.append(valueFromMessage(element));
    return array;
}

Value dictionaryFromMessage(const MessageDictionary& message) {
    Dictionary dictionary;
    for (const auto& [key, element] : message.entries) dictionary.set(key, valueFromMessage(element));
    return dictionary;
}

MessageValue numberToMessage(const Value& number) {
    if (number.isFloating()) return {*number.asDouble()};
    if (number.numberKind() == NumberKind::UInt64) return {*number.asUInt64()};
    return {*number.asInt64()};
}

bool hasContent(const MessageValue& value) { return !std::holds_alternative<std::monostate>(value.content); }

MessageValue arrayToMessage(const Array& array) {
    MessageArray message;
    message.reserve(array.size());
    for (const Value& element : array)
        if (MessageValue converted = messageFromValue(element); hasContent(converted))
            message.push_back(std::move(converted));
    return {std::move(message)};
}

MessageValue dictionaryToMessage(const Dictionary& dictionary) {
    MessageDictionary message;
    message.entries.reserve(dictionary.size());
    for (const auto& [key, element] : dictionary)
        if (MessageValue converted = messageFromValue(element); hasContent(converted))
            message.entries.emplace_back(key, std::move(converted));
    return {std::move(message)};
}

std::string describeDate(double seconds) {
    return seconds > 0 ? platform::calendarText(seconds, "%Y/%m/%d %H:%M:%S ").value_or("") : std::string();
}

std::string describeDictionary(const MessageDictionary& dictionary) {
    std::string text = "{" + std::to_string(dictionary.entries.size()) + " ";
    for (const auto& [key, element] : dictionary.entries) text += key.text() + "=" + describe(element) + ", ";
    return text + "}";
}

std::string describeArray(const MessageArray& array) {
    std::string text = "[";
    for (const MessageValue& element : array) text += describe(element);
    return text + "]";
}

}  // namespace

Value valueFromMessage(const MessageValue& value) {
    return std::visit(
        Visitor{
            [](MessageNull) { return Value::null(); },
            [](bool boolean) { return Value::boolean(boolean); },
            [](int64_t integer) { return Value::int64(integer); },
            [](uint64_t integer) { return Value::uint64(integer); },
            [](double real) { return Value::real(real); },
            [](const String& text) { return Value(text); },
            [](const Data& data) { return Value(data); },
            [](MessageDate date) { return Value::date(date.seconds); },
            [](const MessageUUID& uuid) { return Value::uuid(uuid.bytes); },
            [](const MessageArray& array) { return arrayFromMessage(array); },
            [](const MessageDictionary& dictionary) { return dictionaryFromMessage(dictionary); },
            [](const auto&) { return Value(); },
        },
        value.content);
}

MessageValue messageFromValue(const Value& value) {
    switch (value.kind()) {
        case Value::Kind::Null:
            return {MessageNull()};
        case Value::Kind::Boolean:
            return {*value.asBoolean()};
        case Value::Kind::Number:
            return numberToMessage(value);
        case Value::Kind::Date:
            return {MessageDate{*value.asDate()}};
        case Value::Kind::String:
            return {value.asString()};
        case Value::Kind::Data:
            return {value.asData()};
        case Value::Kind::Array:
            return arrayToMessage(*value.asArray());
        case Value::Kind::Dictionary:
            return dictionaryToMessage(*value.asDictionary());
        case Value::Kind::UUID:
            return {MessageUUID{*value.asUUID()}};
        default:
            return {};
    }
}

std::string describe(const MessageValue& value) {
    return std::visit(
        Visitor{
            [](std::monostate) -> std::string { return "(NULL element)"; },
            [](MessageNull) -> std::string { return "null"; },
            [](bool boolean) -> std::string { return boolean ? "true" : "false"; },
            [](int64_t integer) { return std::to_string(integer); },
            [](uint64_t integer) { return std::to_string(integer) + "U"; },
            [](double real) { return logText("ipc object:", real, " "); },
            [](const String& text) { return "\"" + text.text() + "\""; },
            [](const Data& data) { return platform::hexText(data.bytes()); },
            [](MessageDate date) { return describeDate(date.seconds); },
            [](const MessageArray& array) { return describeArray(array); },
            [](const MessageDictionary& dictionary) { return describeDictionary(dictionary); },
            [](const MessageError& error) { return "(Error " + describe({error.description}) + ")"; },
            [](MessageConnection) -> std::string { return "(Connection)"; },
            [](const MessageUUID&) -> std::string { return "UUID:"; },
            [](MessageFileDescriptor) -> std::string { return "FD:"; },
            [](MessageSharedMemory) -> std::string { return "SharedMemory:"; },
            [](const MessageOther& other) { return "ipc object:" + other.description + " "; },
        },
        value.content);
}

void writeMessageValue(const MessageValue& value, platform::ValueSink& sink) {
    std::visit(Visitor{
                   [&](bool boolean) { sink.boolean(boolean); },
                   [&](int64_t integer) { sink.integer(integer); },
                   [&](uint64_t integer) { sink.unsignedInteger(integer); },
                   [&](double real) { sink.real(real); },
                   [&](const String& text) { sink.string(text.view()); },
                   [&](const Data& data) { sink.data(data.bytes()); },
                   [&](MessageDate date) { sink.date(date.seconds); },
                   [&](const MessageUUID& uuid) { sink.uuid(uuid.bytes); },
                   [&](const MessageArray& array) {
                       sink.beginArray();
                       for (const MessageValue& element : array) writeMessageValue(element, sink);
                       sink.endArray();
                   },
                   [&](const MessageDictionary& dictionary) {
                       sink.beginDictionary();
                       for (const auto& [key, element] : dictionary.entries) {
                           sink.key(key.view());
                           writeMessageValue(element, sink);
                       }
                       sink.endDictionary();
                   },
                   [&](const auto&) { sink.null(); },
               },
               value.content);
}

void MessageValueBuilder::uuid(std::span<const uint8_t, 16> bytes) {
    MessageUUID uuid;
    std::copy(bytes.begin(), bytes.end(), uuid.bytes.begin());
    add({uuid});
}

void MessageValueBuilder::add(MessageValue value) {
    if (open_.empty()) {
        value_ = std::move(value);
    } else if (auto* array = std::get_if<MessageArray>(&open_.back().container.content)) {
        array->push_back(std::move(value));
    } else {
        // Senders do not repeat keys; if one does, the first is found.
        std::get<MessageDictionary>(open_.back().container.content)
            .entries.emplace_back(open_.back().key, std::move(value));
    }
}

void MessageValueBuilder::endContainer() {
    MessageValue container = std::move(open_.back().container);
    open_.pop_back();
    add(std::move(container));
}

}  // namespace veltoid
