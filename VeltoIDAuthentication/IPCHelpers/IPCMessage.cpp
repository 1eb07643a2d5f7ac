#include "IPCHelpers/IPCMessage.h"

#include <algorithm>

#include "Logging/Log.h"
#include "Protocol/MessageKeys.h"
#include "Values/LowerCase.h"

namespace veltoid {
namespace {

MessageDictionary* dictionaryOf(const MessageObject& message) {
    return message ? std::get_if<MessageDictionary>(&message->content) : nullptr;
}

}  // namespace

IPCMessage::IPCMessage() : message_(std::make_shared<MessageValue>(MessageValue{MessageDictionary()})) {}

IPCMessage::IPCMessage(MessageObject message) : message_(std::move(message)) {
    if (!message_) VELTOID_LOG_FROM("IPCMessage", kAlert, "IPCMessage() passed a NULL message.");
}

IPCMessage::IPCMessage(std::span<const String> keys, std::span<const MessageValue> values) : IPCMessage() {
    auto& dictionary = std::get<MessageDictionary>(message_->content);
    for (size_t i = 0; i < std::min(keys.size(), values.size()); ++i) dictionary.set(keys[i], values[i]);
}

void IPCMessage::setValue(const String& key, const Value& value) {
    MessageDictionary* dictionary = dictionaryOf(message_);
    if (dictionary == nullptr || !key || value.isAbsent()) return;
    MessageValue converted = messageFromValue(value);
    if (!std::holds_alternative<std::monostate>(converted.content))
        dictionary->set(key, std::move(converted));
}

Value IPCMessage::copyValue(std::string_view key, std::optional<Value::Kind> expectedKind) const {
    const MessageDictionary* dictionary = dictionaryOf(message_);
    const MessageValue* entry = dictionary != nullptr ? dictionary->find(key) : nullptr;
    if (entry == nullptr) return {};
    Value value = valueFromMessage(*entry);
    if (expectedKind && value.kind() != *expectedKind) return {};
    return value;
}

String IPCMessage::copyAccountName(std::string_view key) const {
    return lowerCased(copyValue(key, Value::Kind::String).asString());
}

void IPCMessage::setError(const Error& error) { setValue(message::kError, errorToDictionary(error)); }

Error IPCMessage::copyError() const {
    if (auto error = dictionaryToError(copyValue(message::kError))) return *error;
    Error communication{kIdentityErrorDomain, identity_error::kAgentCommunicationFailure, {}};
    if (isError()) {
        const String& description = std::get<MessageError>(message_->content).description;
        communication.userInfo.set(
            kErrorDescriptionKey, String(describe(description ? MessageValue{description} : MessageValue{})));
    }
    return communication;
}

bool IPCMessage::isError() const {
    return message_ && std::holds_alternative<MessageError>(message_->content);
}

}  // namespace veltoid
