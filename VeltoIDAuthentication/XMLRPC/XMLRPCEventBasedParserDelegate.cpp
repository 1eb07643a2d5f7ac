#include "XMLRPC/XMLRPCEventBasedParserDelegate.h"

#include "XMLRPC/XMLRPCScalarTexts.h"

namespace veltoid {
namespace {

/// More than what a string keeps inside itself, where it would not be wiped.
constexpr size_t kTextCapacity = 64;

constexpr bool holdsText(XMLRPCElementType type) {
    return type != XMLRPCElementType::Array && type != XMLRPCElementType::Dictionary &&
           type != XMLRPCElementType::Member;
}

/// FNV-1a.
uint32_t hashOf(std::string_view text) {
    uint32_t hash = 2'166'136'261U;
    for (const char c : text) hash = (hash ^ static_cast<unsigned char>(c)) * 16'777'619U;
    return hash;
}

}  // namespace

XMLRPCTag tagNamed(std::string_view name) {
    // By length first: one comparison decides.
    switch (name.size()) {
        case 2:
            return name == "i4" ? XMLRPCTag::Integer : XMLRPCTag::Other;
        case 3:
            return name == "int" ? XMLRPCTag::Integer : XMLRPCTag::Other;
        case 4:
            return name == "name" ? XMLRPCTag::Name : XMLRPCTag::Other;
        case 5:
            if (name == "value") return XMLRPCTag::Value;
            if (name == "array") return XMLRPCTag::Array;
            return name == "fault" ? XMLRPCTag::Fault : XMLRPCTag::Other;
        case 6:
            if (name == "member") return XMLRPCTag::Member;
            if (name == "string") return XMLRPCTag::String;
            if (name == "struct") return XMLRPCTag::Struct;
            if (name == "double") return XMLRPCTag::Double;
            return name == "base64" ? XMLRPCTag::Data : XMLRPCTag::Other;
        case 7:
            return name == "boolean" ? XMLRPCTag::Boolean : XMLRPCTag::Other;
        case 16:
            return name == "dateTime.iso8601" ? XMLRPCTag::Date : XMLRPCTag::Other;
        default:
            return XMLRPCTag::Other;
    }
}

XMLRPCEventBasedParserDelegate::Node::Node() { text.reserve(kTextCapacity); }

bool XMLRPCEventBasedParserDelegate::push(XMLRPCElementType type) {
    if (depth_ == kMaxXMLRPCDepth) return false;
    if (depth_ == nodes_.size()) nodes_.emplace_back();
    Node& node = nodes_[depth_++];
    node.myElementType = type;
    node.text.clear();
    node.myElementKey = nullptr;
    node.memberValue = Value();
    hasStarted_ = true;
    return true;
}

bool XMLRPCEventBasedParserDelegate::startElement(XMLRPCTag tag) {
    if (tag == XMLRPCTag::Value) return push(XMLRPCElementType::String);
    if (isNode(tag)) return push(static_cast<XMLRPCElementType>(tag));
    setElementType(tag);
    return true;
}

void XMLRPCEventBasedParserDelegate::setElementType(XMLRPCTag tag) {
    static_assert(static_cast<int>(XMLRPCTag::Data) == static_cast<int>(XMLRPCElementType::Data));
    if (tag > XMLRPCTag::Data) return;
    Node& node = nodes_[depth_ - 1];
    node.myElementType = static_cast<XMLRPCElementType>(tag);
    if (holdsText(node.myElementType)) return;
    node.text.clear();
    node.array = Array();
    node.dictionary = Dictionary();
}

void XMLRPCEventBasedParserDelegate::characters(std::string_view text) {
    Node& node = nodes_[depth_ - 1];
    if (holdsText(node.myElementType)) node.text.append(text);
}

void XMLRPCEventBasedParserDelegate::endElement(XMLRPCTag tag) {
    if (!isNode(tag)) return;
    Node& node = nodes_[--depth_];
    if (depth_ == 0) {
        result_ = elementValue(node);
    } else {
        addElementValueToParent(node, nodes_[depth_ - 1]);
    }
}

Value XMLRPCEventBasedParserDelegate::elementValue(Node& node) {
    switch (node.myElementType) {
        case XMLRPCElementType::Array:
            return std::move(node.array);
        case XMLRPCElementType::Dictionary:
            return std::move(node.dictionary);
        case XMLRPCElementType::Member:
            return node.memberValue.isAbsent() ? empty_ : std::move(node.memberValue);
        default:
            break;
    }
    const std::string_view text = xmlrpc::parseString(node.text);
    switch (node.myElementType) {
        case XMLRPCElementType::Integer:
            return Value::int32(xmlrpc::parseInteger(text));
        case XMLRPCElementType::Double:
            return Value::real(xmlrpc::parseDouble(text));
        case XMLRPCElementType::Boolean:
            return Value::boolean(xmlrpc::parseBoolean(text));
        case XMLRPCElementType::Date:
            return xmlrpc::parseDate(text);
        case XMLRPCElementType::Data:
            return xmlrpc::parseData(text);
        default:
            return text.empty() ? empty_ : String(text);
    }
}

void XMLRPCEventBasedParserDelegate::addElementValueToParent(Node& node, Node& parent) {
    switch (parent.myElementType) {
        case XMLRPCElementType::Member:
            if (node.myElementType == XMLRPCElementType::Name) {
                parent.myElementKey = sharedName(xmlrpc::parseString(node.text));
            } else {
                parent.memberValue = elementValue(node);
            }
            break;
        case XMLRPCElementType::Dictionary:
            addMember(parent.dictionary, node.myElementKey, elementValue(node));
            break;
        case XMLRPCElementType::Array:
            parent.array.append(elementValue(node));
            break;
        default:
            break;
    }
}

void XMLRPCEventBasedParserDelegate::addMember(Dictionary& dictionary, const String& key, Value value) {
    if (!key) return;
    if (value.isNull()) {
        dictionary.remove(key.view());
    } else {
        dictionary.set(key, std::move(value));
    }
}

String XMLRPCEventBasedParserDelegate::sharedName(std::string_view name) {
    String& slot = names_[hashOf(name) % names_.size()];
    if (!slot || slot.view() != name) slot = name;
    return slot;
}

}  // namespace veltoid
