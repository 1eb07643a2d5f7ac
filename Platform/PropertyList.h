// Property lists in binary form: the stored form of preference values.
//
// The layout is the public "bplist00" one: header, object table, offset table, 32-byte trailer; big-endian
// throughout. Equal strings share one object. Reading gives back what was written, with these exceptions: an
// unsigned integer that fits is read as a signed one, and a date is kept as seconds from 2001, so that dates
// decades away from that year lose the last fractions of a microsecond. A UUID is the layout's 16-byte UUID
// object (marker 0x0E), which few other readers know; everything else is common to all of them.
#pragma once

#include "Platform/ValueSink.h"

namespace platform {

/// Limits of writing and reading: lists beyond them are refused before anything reaches the sink. Objects and
/// payload (bytes of text and data) are counted each time that they are delivered, so that shared ones cannot
/// multiply.
inline constexpr int kMaxPropertyListDepth = 64;
inline constexpr size_t kMaxPropertyListObjects = 4U << 20U;
inline constexpr size_t kMaxPropertyListPayload = size_t{64} << 20U;

/// The bytes of the one value that `writer` writes; empty when it writes something that has no property-list
/// form (file descriptors, text that is not UTF-8), goes over a limit or leaves containers unbalanced. Any
/// thread.
SecretBytes writeBinaryPropertyList(const ValueWriter& writer);

/// Reads a binary property list into the sink. False, with nothing written, when it is damaged: out-of-range
/// offsets, cycles, a depth, object count or payload over the limits, text that is not valid, dictionary keys
/// that are not strings, objects that have no event (sets, references). Any thread.
bool readBinaryPropertyList(Bytes bytes, ValueSink& sink);

}  // namespace platform
