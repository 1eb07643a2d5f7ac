// Event-driven XML reading (expat). No external entity is ever loaded and a document that declares entities
// of its own is refused.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

/// Receives the events of one read, on the reading thread. Names are plain (no namespace processing),
/// attributes are not delivered, character data comes freed of entities and possibly in pieces. Views live
/// only for the call.
class XMLEvents {
  public:
    virtual ~XMLEvents() = default;
    /// The document type, if there is one, before the first element; `hasDeclarations` tells whether it has a
    /// part inside the document.
    virtual void documentType(bool /*hasDeclarations*/) {}
    virtual void startElement(std::string_view name) = 0;
    virtual void endElement(std::string_view name) = 0;
    virtual void characters(std::string_view text) = 0;
};

struct XMLError {
    std::string description;
    size_t line = 0;
    size_t byteOffset = 0;
};

/// Reads one document held in memory. Used by one thread.
class XMLReader {
  public:
    /// The bytes must outlive the reader.
    explicit XMLReader(Bytes document) : document_(document) {}

    /// Reads everything; false when the document is not well-formed or the reading was aborted. Nothing
    /// escapes from the events: what they throw aborts the reading.
    bool read(XMLEvents& events);

    /// Ends the reading from inside an event.
    void abort();

    /// Set after read returned false.
    const std::optional<XMLError>& error() const { return error_; }

  private:
    Bytes document_;
    std::optional<XMLError> error_;
    void* parser_ = nullptr;
};

}  // namespace platform
