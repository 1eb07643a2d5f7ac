// Property lists in their two public forms: binary, the stored form of preference values, and XML, which is
// only read.
//
// Binary is the "bplist00" layout: header, object table, offset table, 32-byte trailer; big-endian
// throughout. Equal strings share one object. Reading gives back what was written, with these exceptions: an
// unsigned integer that fits is read as a signed one, and a date is kept as seconds from 2001, so that dates
// decades away from that year lose the last fractions of a microsecond. A UUID is the layout's 16-byte UUID
// object (marker 0x0E), which few other readers know; everything else is common to all of them.
//
// XML is a "plist" element around one of dict (of key and value in turn), array, string, integer, real, true,
// false, date and data.
//
// In both forms a dictionary's keys are delivered as they come, equal ones included: the last one wins where
// values are built.
#pragma once

#include "Platform/encoding/ValueSink.h"

namespace platform {

/// Limits of writing and reading. Objects and payload (bytes of text and data) are counted each time that
/// they are delivered, so that shared ones cannot multiply.
inline constexpr int kMaxPropertyListDepth = 64;
inline constexpr size_t kMaxPropertyListObjects = 4U << 20U;
inline constexpr size_t kMaxPropertyListPayload = size_t{64} << 20U;

/// The bytes of the one value that `writer` writes; empty when it writes something that has no property-list
/// form (file descriptors, text that is not UTF-8), goes over a limit or leaves containers unbalanced. Any
/// thread.
SecretBytes writeBinaryPropertyList(const ValueWriter& writer);

// Reading delivers events while it checks: after a false answer what has reached the sink means nothing, and
// some of its containers may still be open.

/// Reads a binary property list into the sink. False when it is damaged: out-of-range
/// offsets, cycles, a depth, object count or payload over the limits, text that is not valid, dictionary keys
/// that are not strings, objects that have no event (sets, references). Any thread.
bool readBinaryPropertyList(Bytes bytes, ValueSink& sink);

/// Reads an XML property list into the sink. False when the document is not
/// well-formed, has other elements, or elements or text where none belong, has a dictionary in which keys and
/// values do not take turns, a number, date or base64 text that is none, goes over a limit, or declares
/// anything in a document type of its own (one that only names another document is passed over and never
/// loaded). Integers reach from -2^63 to 2^64 - 1, in decimal or, after 0x, in hexadecimal digits. Encodings
/// other than UTF-8 are read if the document names them: UTF-16, ISO-8859-1, US-ASCII. Any thread.
bool readXMLPropertyList(Bytes bytes, ValueSink& sink);

/// Reads a property list of either form, told apart by the first bytes. Any thread.
bool readPropertyList(Bytes bytes, ValueSink& sink);

}  // namespace platform
