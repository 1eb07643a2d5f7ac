#include "VeltoIDAuthd/ClientRequest.h"

#include "Protocol/MessageKeys.h"

namespace veltoid {
namespace {

MessageObject readMessage(platform::IncomingMessage& message) {
    MessageValueBuilder builder;
    message.read(builder);
    return std::make_shared<MessageValue>(builder.take());
}

}  // namespace

Request::Request(platform::IncomingMessage& message) : message_(message), request_(readMessage(message)) {
    command_ = request_.copyValue(message::kCommand, Value::Kind::Number).asInt64().value_or(0);
    account_ = request_.copyAccountName(message::kAccount);
    options_ = dictionary(message::kOptions);
}

Dictionary Request::dictionary(std::string_view key) const {
    const Value given = value(key);
    const Dictionary* dictionary = given.asDictionary();
    return dictionary != nullptr ? *dictionary : Dictionary();
}

void Request::finish(bool success, const std::optional<Error>& error) {
    reply_.setValue(message::kSuccess, Value::boolean(success));
    if (!success && error) reply_.setError(*error);
    message_.reply(
        [reply = reply_.message()](platform::ValueSink& sink) { writeMessageValue(*reply, sink); });
    held_.reset();
}

}  // namespace veltoid
