#include "XMLRPC/XMLRPCRequest.h"

#include "Platform/storage/Preferences.h"
#include "Values/ValueStream.h"

namespace veltoid {
namespace {

constexpr const char* kSettingsDomain = "com.velto.harbwell.veltoidauthagent";
constexpr const char* kUserAgentSetting = "UserAgent";

String userAgentOfSettings() {
    ValueBuilder setting;
    (void)platform::Preferences(kSettingsDomain).read(kUserAgentSetting, setting);
    return setting.value().asString();
}

}  // namespace

XMLRPCRequest::XMLRPCRequest(const String& url, std::shared_ptr<XMLRPCDefaultEncoder> encoder)
    : myXMLEncoder(std::move(encoder)) {
    myRequest.url = url.text();
    myRequest.handlesCookies = false;
}

String XMLRPCRequest::userAgent() const {
    const std::string* field = myRequest.headerField("User-Agent");
    return field == nullptr ? String() : String(*field);
}

void XMLRPCRequest::setEncoder(std::shared_ptr<XMLRPCDefaultEncoder> encoder) {
    encoder->setMethod(method(), parameters());
    myXMLEncoder = std::move(encoder);
}

void XMLRPCRequest::setMethod(const String& method, const Value& parameter) {
    myXMLEncoder->setMethod(method, parameter.isAbsent() ? std::nullopt : std::optional(Array{parameter}));
}

platform::HTTPRequest XMLRPCRequest::request() const {
    platform::HTTPRequest request = myRequest;
    request.body = body();
    request.method = "POST";
    request.setHeaderField("Content-Type", "text/xml");
    request.setHeaderField("Content-Length", std::to_string(request.body.size()));
    request.setHeaderField("Accept", "text/xml");
    if (request.headerField("User-Agent") == nullptr) {
        if (const String userAgent = userAgentOfSettings())
            request.setHeaderField("User-Agent", userAgent.view());
    }
    return request;
}

void XMLRPCRequest::setValue(const String& value, std::string_view forHTTPHeaderField) {
    myRequest.setHeaderField(forHTTPHeaderField, value.view());
}

}  // namespace veltoid
