// Reads XML-RPC responses: the value in them, and whether it is a fault.
#pragma once

#include "Platform/xml/XMLReader.h"
#include "XMLRPC/XMLRPCEventBasedParserDelegate.h"

namespace veltoid {

/// Used by one thread for one `parse`.
class XMLRPCEventBasedParser : private platform::XMLEvents {
  public:
    /// The bytes must outlive the parser.
    explicit XMLRPCEventBasedParser(platform::Bytes data) : myParser(data) {}

    /// The first value of the document, whatever the elements around it are called. Absent when there is
    /// none, when the document is not well-formed (before or after that value), declares entities or is
    /// nested too deeply.
    Value parse();

    /// From inside `parse` only.
    void abortParsing() { myParser.abort(); }
    /// Why `parse` stopped; none when it did not.
    const std::optional<platform::XMLError>& parserError() const { return myParser.error(); }

    /// Whether a `fault` element came before the value.
    bool isFault() const { return myIsFault; }

  private:
    void startElement(std::string_view name) override;
    void endElement(std::string_view name) override;
    void characters(std::string_view text) override;

    platform::XMLReader myParser;
    XMLRPCEventBasedParserDelegate myParserDelegate;
    bool myIsFault = false;
};

}  // namespace veltoid
