// Builds what an XML-RPC server answers, piece by piece.
#pragma once

#include <string>

namespace veltoid {

/// A response with this `value` element.
inline std::string document(const std::string& value) {
    return "<?xml version='1.0'?><methodResponse><params><param>" + value +
           "</param></params></methodResponse>";
}

/// A response that is a fault with this `value` element.
inline std::string faultDocument(const std::string& value) {
    return "<methodResponse><fault>" + value + "</fault></methodResponse>";
}

/// A member of a struct, with its `value` element.
inline std::string member(const std::string& name, const std::string& value) {
    return "<member><name>" + name + "</name>" + value + "</member>";
}

/// The `value` elements of a struct and of an array.
inline std::string structure(const std::string& members) {
    return "<value><struct>" + members + "</struct></value>";
}
inline std::string array(const std::string& values) {
    return "<value><array><data>" + values + "</data></array></value>";
}

}  // namespace veltoid
