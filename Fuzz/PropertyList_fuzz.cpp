// Feeds arbitrary bytes to the readers of property lists of both forms. Whatever they accept must be a sound
// value: written again and read again it gives the same. The short cut for plain documents must read what the
// XML parser reads.
#include <cstdlib>
#include <string>

#include "Platform/propertylist/PropertyList.h"
#include "Platform/propertylist/PropertyListPlainXML.h"
#include "Platform/xml/XMLReader.h"

namespace {

using platform::Bytes;
using platform::SecretBytes;

using Write = SecretBytes (*)(const platform::ValueWriter&);

/// The list read and written again; empty when it is refused, or has no such form.
SecretBytes rewritten(Bytes list, Write write, bool* isAccepted = nullptr) {
    bool accepted = false;
    SecretBytes written =
        write([&](platform::ValueSink& sink) { accepted = platform::readPropertyList(list, sink); });
    if (isAccepted != nullptr) *isAccepted = accepted;
    return written;
}

void require(bool condition) {
    if (!condition) std::abort();
}

class EventText : public platform::XMLEvents {
  public:
    void documentType(bool hasDeclarations) override { text += hasDeclarations ? "!declarations" : "!"; }
    void startElement(std::string_view name) override { text.append("<").append(name).append(">"); }
    void endElement(std::string_view name) override { text.append("</").append(name).append(">"); }
    void characters(std::string_view characters) override {
        for (const char c : characters) (text += '\'') += c;
    }

    std::string text;
};

void compareXMLReaders(Bytes document) {
    EventText plain;
    if (!platform::propertylist::readPlainXML(platform::textOf(document), plain)) return;
    EventText general;
    require(platform::XMLReader(document).read(general) && general.text == plain.text);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const Bytes input(data, size);
    compareXMLReaders(input);

    bool isAccepted = false;
    const SecretBytes binary = rewritten(input, platform::writeBinaryPropertyList, &isAccepted);
    require(isAccepted != binary.empty());
    if (!isAccepted) return 0;
    // By size, since a list may hold numbers that are not equal to themselves.
    require(rewritten(binary, platform::writeBinaryPropertyList).size() == binary.size());

    const SecretBytes xml = rewritten(input, platform::writeXMLPropertyList);
    const bool isXML = !platform::textOf(input).starts_with("bplist");
    require(!xml.empty() || !isXML);
    if (xml.empty()) return 0;
    compareXMLReaders(xml);
    require(rewritten(xml, platform::writeXMLPropertyList) == xml);
    return 0;
}
