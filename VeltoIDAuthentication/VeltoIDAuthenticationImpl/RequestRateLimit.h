// How often an account may ask for a certificate.
//
// Requests are spaced by the account's "CSRGenerationInterval". A guard also counts the requests that were
// sent: an account that sends more than kMaxRequestsInWindow within kRequestWindow is in a loop. It is then
// refused for kRequestHold, so that it goes on with one request in that time; the log and the account's
// status show that.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {

/// The number of requests that an account may send within kRequestWindow (seconds).
inline constexpr size_t kMaxRequestsInWindow = 3;
inline constexpr double kRequestWindow = 3'600;
/// How long the guard refuses, each time (seconds): who waits for a certificate does so for no longer.
inline constexpr double kRequestHold = 3'600;

/// The earliest date of the next request (seconds since 1970); none when it may be sent at any time.
std::optional<double> nextRequestDate(const AccountRecord& record);

/// The date until which the guard refuses requests (seconds since 1970); none when it does not.
std::optional<double> requestsHeldUntil(const AccountRecord& record);

/// Asks the guard; false, with identity_error::kNotYet, while it refuses requests. The first request over the
/// limit starts that: it is logged, and the date until which requests are refused is stored.
bool admitCertificateRequest(const AccountRecord& record, ErrorOut error);

/// Counts a request that is being sent.
void noteCertificateRequest(const String& accountName);

}  // namespace veltoid
