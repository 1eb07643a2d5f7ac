// The one way to the identity server: a method name and a parameter go out, a Dictionary or an Error comes
// back.
#pragma once

#include "Values/Error.h"

namespace veltoid {

/// Calls the method over XML-RPC with one parameter (none when it is absent). True when the server answered
/// with anything but a fault; `result` is then its Dictionary, or none when it answered with something else.
/// False otherwise, with an Error of kXMLErrorDomain whose code is the fault's, or, when there was no answer,
/// of kIdentityErrorDomain with identity_error::kNoResponse and, when known, the transport's error as the
/// underlying one. A message that the server put into its answer goes to the system log.
///
/// Blocks for at most kSynchronousTimeoutSeconds; never to be called on the main queue.
bool xmlInvoke(const String& url, const String& methodName, const Value& parameter,
               std::optional<Dictionary>* result, ErrorOut error);

}  // namespace veltoid
