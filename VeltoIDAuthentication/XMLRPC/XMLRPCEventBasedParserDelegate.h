// Assembles a value from the elements inside one XML-RPC `value` element.
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
#include "Values/Value.h"

namespace veltoid {

/// Open nodes at once; a document with more is refused, for the sake of everyone who walks the tree by
/// recursion.
inline constexpr size_t kMaxXMLRPCDepth = 256;

enum class XMLRPCElementType : uint8_t {
    Array = 0,
    Dictionary = 1,
    Member = 2,
    Name = 3,
    Integer = 4,
    Double = 5,
    Boolean = 6,
    String = 7,
    Date = 8,
    Data = 9
};

/// What an element's name means. Names of types, up to Data, have the numbers of their element types.
enum class XMLRPCTag : uint8_t {
    Array,
    Struct,
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

XMLRPCTag tagNamed(std::string_view name);

/// Used by one thread for one document.
class XMLRPCEventBasedParserDelegate {
  public:
    /// The first one, which must be a Value, opens the root. False when there are too many open nodes.
    bool startElement(XMLRPCTag tag);
    void endElement(XMLRPCTag tag);
    void characters(std::string_view text);

    bool hasStarted() const { return hasStarted_; }
    /// Between the start and the end of the root.
    bool isOpen() const { return depth_ > 0; }

    /// The root's value once it has ended; absent before.
    Value takeElementValue() { return std::move(result_); }

  private:
    struct Node {
        Node();

        XMLRPCElementType myElementType = XMLRPCElementType::String;
        platform::SecretText text;
        Array array;
        Dictionary dictionary;
        /// A Member's name and value.
        String myElementKey;
        Value memberValue;
    };

    static bool isNode(XMLRPCTag tag) {
        return tag == XMLRPCTag::Value || tag == XMLRPCTag::Member || tag == XMLRPCTag::Name;
    }
    bool push(XMLRPCElementType type);
    void setElementType(XMLRPCTag tag);
    Value elementValue(Node& node);
    void addElementValueToParent(Node& node, Node& parent);
    static void addMember(Dictionary& dictionary, const String& key, Value value);
    /// The same handle for the same name, as long as no other name took its place.
    String sharedName(std::string_view name);

    /// Records are never removed; the open ones come first.
    std::vector<Node> nodes_;
    size_t depth_ = 0;
    bool hasStarted_ = false;
    Value result_;
    const String empty_ = "";
    std::array<String, 256> names_;
};

}  // namespace veltoid
