// The HTTP POST that carries an XML-RPC method call.
#pragma once

#include <memory>

#include "Platform/net/HTTPSession.h"
#include "XMLRPC/XMLRPCDefaultEncoder.h"

namespace veltoid {

/// Built per call and dropped after it; one object belongs to one thread at a time.
class XMLRPCRequest {
  public:
    /// A request without cookies; its URL is empty when none (null) is given.
    explicit XMLRPCRequest(const String& url, std::shared_ptr<XMLRPCDefaultEncoder> encoder =
                                                  std::make_shared<XMLRPCDefaultEncoder>());

    void setURL(const String& url) { myRequest.url = url.text(); }
    String URL() const { return myRequest.url; }

    /// The "User-Agent" header field; null when it is not set.
    void setUserAgent(const String& userAgent) { setValue(userAgent, "User-Agent"); }
    String userAgent() const;

    /// Takes another encoder, which goes on with the method and parameters of the one before.
    void setEncoder(std::shared_ptr<XMLRPCDefaultEncoder> encoder);

    /// A call without parameters.
    void setMethod(const String& method) { myXMLEncoder->setMethod(method, std::nullopt); }
    /// A call with one parameter, or without any when the value is absent.
    void setMethod(const String& method, const Value& parameter);
    void setMethod(const String& method, const Array& parameters) {
        myXMLEncoder->setMethod(method, parameters);
    }

    const String& method() const { return myXMLEncoder->method(); }
    const std::optional<Array>& parameters() const { return myXMLEncoder->parameters(); }

    /// The document.
    platform::SecretText body() const { return myXMLEncoder->encode(); }

    /// The finished POST: XML content and its length in bytes, and the "User-Agent" of the agent's
    /// preferences when none was set.
    platform::HTTPRequest request() const;

    /// Replaces an earlier value of that field.
    void setValue(const String& value, std::string_view forHTTPHeaderField);

  private:
    platform::HTTPRequest myRequest;
    std::shared_ptr<XMLRPCDefaultEncoder> myXMLEncoder;
};

}  // namespace veltoid
