// Reads XML-RPC responses: the value in them, and whether it is a fault.
//
// The rules, which servers rely on: a `value`, `member` or `name` element is a node; the elements inside it
// that name a type only set the node's type; a value without a type is a String; unknown elements (`data` and
// `nil` among them) do nothing, so that a nil is an empty String; every text is trimmed. Open nodes are
// records on a stack that keep their text buffers for the next node at that depth, so that an element costs
// no allocation.
#pragma once

#include <array>
#include <vector>

#include "Platform/runtime/SecureMemory.h"
#include "Platform/xml/XMLReader.h"
#include "Values/Value.h"

namespace veltoid {

/// Open nodes at once; a document with more is refused, since trees of values are walked by recursion.
inline constexpr size_t kMaxXMLRPCDepth = 256;

/// What an element's name means; those up to Data are also what a node can be.
enum class XMLRPCElementType : uint8_t {
    Array,
    Dictionary,
    Member,
    Name,
    Integer,
    Double,
    Boolean,
    String,
    Date,
    Data,
    Value,
    Fault,
    Other
};

/// A node: an element that is open, and what it has been given so far.
struct XMLRPCEventBasedParserDelegate {
    XMLRPCEventBasedParserDelegate();

    XMLRPCElementType myElementType = XMLRPCElementType::String;
    platform::SecretText text;
    Array array;
    Dictionary dictionary;
    /// A Member's name and value.
    String myElementKey;
    Value myMemberValue;
};

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
    using Node = XMLRPCEventBasedParserDelegate;

    void startElement(std::string_view name) override;
    void endElement(std::string_view name) override;
    void characters(std::string_view text) override;

    /// Between the start and the end of the root.
    bool isOpen() const { return depth_ > 0; }
    void push(XMLRPCElementType type);
    void setType(XMLRPCElementType type);
    Value elementValue(Node& node);
    void addElementValueToParent(Node& node, Node& parent);
    /// The same handle for the same name, as long as no other name took its place.
    String sharedName(std::string_view name);

    platform::XMLReader myParser;
    bool myIsFault = false;
    /// Records are never removed; the open ones come first.
    std::vector<Node> nodes_;
    size_t depth_ = 0;
    bool hasStarted_ = false;
    Value result_;
    const String empty_ = "";
    std::array<String, 256> names_;
};

}  // namespace veltoid
