#include "XMLRPC/XMLRPCResponse.h"

#include "Platform/encoding/UTF8.h"
#include "XMLRPC/XMLRPCEventBasedParser.h"

namespace veltoid {

XMLRPCResponse::XMLRPCResponse(platform::SecretBytes data) : myBody(std::move(data)) {
    XMLRPCEventBasedParser parser(myBody);
    myObject = parser.parse();
    myIsFault = parser.isFault();
}

String XMLRPCResponse::body() const {
    const std::string_view text = platform::textOf(myBody);
    return platform::isUTF8(text) ? String(text) : String();
}

const Value& XMLRPCResponse::faultEntry(std::string_view key) const {
    const Dictionary* fault = myIsFault ? myObject.asDictionary() : nullptr;
    return fault == nullptr ? absentValue() : (*fault)[key];
}

}  // namespace veltoid
