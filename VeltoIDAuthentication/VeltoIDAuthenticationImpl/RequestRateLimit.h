// How often an account may ask for a certificate.
//
// Requests are spaced by the account's "CSRGenerationInterval". Beside that a guard looks at how many were
// really sent: an account that asks for more than a few certificates within an hour is in a loop. Its
// requests are then held up, which the log and the status tell.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/AccountRecord.h"

namespace veltoid {

/// So many certificates may be asked for within kRequestWindow seconds.
inline constexpr size_t kMaxRequestsInWindow = 3;
inline constexpr double kRequestWindow = 3'600;

/// When the next request may be made, by the record (seconds since 1970); none: at any time.
std::optional<double> nextRequestDate(const AccountRecord& record);

/// Until when the guard holds up requests; none: it does not.
std::optional<double> requestsHeldUntil(const AccountRecord& record);

/// Asks the guard; false, with error 99, while requests are held up. The one that would be too many starts
/// that: it is logged, and the account waits for its generation interval.
bool admitCertificateRequest(const AccountRecord& record, ErrorOut error);

/// Notes that a request is being sent.
void noteCertificateRequest(const String& accountName);

}  // namespace veltoid
