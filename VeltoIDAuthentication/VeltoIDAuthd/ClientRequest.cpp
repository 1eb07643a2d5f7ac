#include "VeltoIDAuthd/ClientRequest.h"

#include "Protocol/MessageKeys.h"

namespace veltoid {
namespace {

MessageValueBuilder readMessage(platform::IncomingMessage& message) {
    MessageValueBuilder builder;
    message.read(builder);
    return builder;
}

}  // namespace

Request::Request(platform::IncomingMessage& message) : Request(message, readMessage(message)) {}

Request::Request(platform::IncomingMessage& message, MessageValueBuilder read)
    : message_(message),
      isFinite_(read.isFinite()),
      hasDescriptor_(read.hasDescriptor()),
      request_(std::make_shared<MessageValue>(read.take())) {
    command_ = request_.copyValue(message::kCommand, Value::Kind::Number).asInt64().value_or(0);
    account_ = request_.copyAccountName(message::kAccount);
    options_ = dictionary(message::kOptions);
}

bool Request::isSound(ErrorOut error) const {
    return isFinite_ ||
           failWith(error, makeError(identity_error::kInvalidParameters,
                                     {"The request holds a date or a number that is not finite.", {}, {}}, {},
                                     __func__, __FILE_NAME__, __LINE__));
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
