#include "XMLRPC/XMLRPCShim.h"

#include <algorithm>
#include <limits>

#include "Logging/Describe.h"
#include "Platform/runtime/SystemLog.h"
#include "Values/DictionaryAccess.h"
#include "XMLRPC/XMLRPCConnection.h"
#include "XMLRPC/XMLRPCScalarTexts.h"

namespace veltoid {
namespace {

constexpr const char* kUserAgent = "VeltoIDXMLRPC";

// Where the error of an unanswered call says that it comes from; fixed, since people search logs for it.
constexpr const char* kNoResponseFunction = "xmlInvoke";
constexpr const char* kNoResponseFile = "XMLRPCShim";
constexpr int kNoResponseLine = 90;
constexpr const char* kNoResponseReason = "NULL response from server";

constexpr int32_t kMissingFaultCode = -1;
constexpr int32_t kDefaultLogLevel = static_cast<int32_t>(platform::LogPriority::Error);

Error noResponseError(std::optional<Error> transportError) {
    Dictionary userInfo;
    if (transportError) userInfo.set(kErrorUnderlyingErrorKey, *std::move(transportError));
    return makeError(identity_error::kNoResponse, {kNoResponseReason, nullptr, nullptr}, userInfo,
                     kNoResponseFunction, kNoResponseFile, kNoResponseLine);
}

int32_t faultCodeOf(const Value& code) {
    if (code.isAbsent()) return kMissingFaultCode;
    if (const auto text = code.asText()) return xmlrpc::parseInteger(*text);
    if (const auto flag = code.asBoolean()) return *flag ? 1 : 0;
    const double number = code.asDouble().value_or(0);
    return static_cast<int32_t>(
        std::clamp<double>(number, std::numeric_limits<int32_t>::min(), std::numeric_limits<int32_t>::max()));
}

Error faultError(const XMLRPCResponse& response) {
    Error error{kXMLErrorDomain, faultCodeOf(response.faultCode()), {}};
    error.userInfo.set(kErrorDescriptionKey, response.faultString());
    return error;
}

/// What the server wants its operators to find in the client's log.
void logServerMessage(const Dictionary& answer) {
    const Value& message = answer["LogString"];
    if (!message.isString()) return;
    const int32_t level = getInt32(&answer, "LogStringLevel", kDefaultLogLevel);
    const auto priority = static_cast<platform::LogPriority>(
        std::clamp(level, static_cast<int32_t>(platform::LogPriority::Emergency),
                   static_cast<int32_t>(platform::LogPriority::Debug)));
    platform::logPlatform(priority,
                          "VeltoIDAuthentication: Message from server \"" + describeValue(message) + "\"",
                          __FILE__, __LINE__, __func__);
}

}  // namespace

bool xmlInvoke(const String& url, const String& methodName, const Value& parameter,
               std::optional<Dictionary>* result, ErrorOut error) {
    fill(result, {});
    XMLRPCRequest request(url);
    request.setMethod(methodName, parameter);
    request.setUserAgent(kUserAgent);

    std::optional<Error> transportError;
    const auto response = XMLRPCConnection::sendSynchronousXMLRPCRequest(request, &transportError);
    if (!response) return failWith(error, noResponseError(std::move(transportError)));
    if (response->isFault()) return failWith(error, faultError(*response));
    if (const Dictionary* answer = response->object().asDictionary()) {
        logServerMessage(*answer);
        fill(result, {*answer});
    }
    return true;
}

}  // namespace veltoid
