#include "XMLRPC/XMLRPCEventBasedParser.h"

namespace veltoid {

Value XMLRPCEventBasedParser::parse() {
    if (!myParser.read(*this)) return {};
    return myParserDelegate.takeElementValue();
}

void XMLRPCEventBasedParser::startElement(std::string_view name) {
    const XMLRPCTag tag = tagNamed(name);
    if (myParserDelegate.isOpen() || (tag == XMLRPCTag::Value && !myParserDelegate.hasStarted())) {
        if (!myParserDelegate.startElement(tag)) abortParsing();
    } else if (tag == XMLRPCTag::Fault && !myParserDelegate.hasStarted()) {
        myIsFault = true;
    }
}

void XMLRPCEventBasedParser::endElement(std::string_view name) {
    if (myParserDelegate.isOpen()) myParserDelegate.endElement(tagNamed(name));
}

void XMLRPCEventBasedParser::characters(std::string_view text) {
    if (myParserDelegate.isOpen()) myParserDelegate.characters(text);
}

}  // namespace veltoid
