// A short cut for documents in the plain form that programs write. Internal to the PropertyList sources.
#pragma once

#include <string_view>

#include "Platform/xml/XMLReader.h"

namespace platform::propertylist {

/// Reads a document in UTF-8 of elements without attributes (the version of "plist" apart), text, the
/// references that writers need and at most a document type that names another document: several times faster
/// than an XML parser that has to expect everything. False when there is anything else; the events until then
/// mean nothing, and whether the document is XML is for the XMLReader to say, which delivers the same events
/// for all that is read here. Text may come in other pieces. Any thread.
bool readPlainXML(std::string_view document, XMLEvents& events);

}  // namespace platform::propertylist
