#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"

#include <algorithm>
#include <cmath>

#include "Logging/Describe.h"
#include "Logging/Log.h"
#include "Logging/LogText.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {
namespace {

// Seconds.
constexpr double kGenerationInterval = 86'400;
constexpr double kLongestGenerationInterval = 1'209'600;

double now() { return platform::Clock::shared().now(); }

double generationInterval(const Dictionary& record) {
    const auto stored = record.number(kVeltoIDAccountCSRGenerationIntervalKey);
    return stored && !std::isnan(*stored) ? std::clamp(*stored, 0.0, kLongestGenerationInterval)
                                          : kGenerationInterval;
}

/// The dates of the requests that still count.
Array recentRequests(const Dictionary& record) {
    Array recent;
    const Array* stored = record.array(kVeltoIDAccountCertificateRequestDatesKey);
    if (stored == nullptr) return recent;
    for (const Value& date : *stored) {
        const auto seconds = date.asDate();
        if (seconds && *seconds <= now() && now() < *seconds + kVeltoIDRequestWindow) recent.append(date);
    }
    return recent;
}

}  // namespace

std::optional<double> requestsHeldUntil(const Dictionary& record) {
    const auto date = record.date(kVeltoIDAccountCertificateRequestsHeldUntilKey);
    // One that lies further ahead than it can was noted by a clock that was wrong.
    if (!date || *date <= now() || *date > now() + kLongestGenerationInterval) return std::nullopt;
    return date;
}

std::optional<double> nextRequestDate(const Dictionary& record) {
    std::optional<double> next = requestsHeldUntil(record);
    const auto generated = record.date(kVeltoIDAccountCSRGenerationDateKey);
    if (!generated) return next;
    return std::max(*generated + generationInterval(record), next.value_or(*generated));
}

bool admitCertificateRequest(const String& accountName, const Dictionary& record, ErrorOut error) {
    auto heldUntil = requestsHeldUntil(record);
    if (!heldUntil) {
        if (recentRequests(record).size() < kVeltoIDMostRequestsInWindow) return true;
        heldUntil = now() + generationInterval(record);
        __VeltoIDDBSetAccountValue(accountName, kVeltoIDAccountCertificateRequestsHeldUntilKey,
                                   Value::date(*heldUntil), false);
        VELTOID_LOG(
            kError,
            "Velto ID " << describeAccountForLog(accountName) << " has asked for "
                        << kVeltoIDMostRequestsInWindow
                        << " certificates within an hour and wants another one; its requests are held "
                           "up until "
                        << describeValue(Value::date(*heldUntil)) << ".");
    }
    const Dictionary information = {
        {kVeltoIDAccountCertificateRequestsHeldUntilKey, Value::date(*heldUntil)}};
    fillError(error, makeError(identity_error::kNotYet,
                               {"This account has asked for too many certificates within an hour.", {}, {}},
                               information, __func__, __FILE_NAME__, __LINE__));
    return false;
}

void noteCertificateRequest(const String& accountName) {
    Dictionary record;
    if (!__VeltoIDDBCopyVeltoIDAccount(accountName, &record)) return;
    Array requests = recentRequests(record);
    requests.append(Value::date(now()));
    __VeltoIDDBSetAccountValues(accountName,
                                {{kVeltoIDAccountCertificateRequestDatesKey, requests},
                                 {kVeltoIDAccountCertificateRequestsHeldUntilKey, Value::null()}},
                                false);
}

}  // namespace veltoid
