#include "VeltoIDAuthenticationImpl/RequestRateLimit.h"

#include <algorithm>
#include <cmath>

#include "Logging/Log.h"
#include "Logging/LogText.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {
namespace {

// Seconds.
constexpr double kGenerationInterval = 86'400;
constexpr double kMaxGenerationInterval = 1'209'600;

double generationInterval(const AccountRecord& record) {
    const auto stored = record.requestGenerationInterval();
    return stored && !std::isnan(*stored) ? std::clamp(*stored, 0.0, kMaxGenerationInterval)
                                          : kGenerationInterval;
}

/// The dates of the requests within the window.
Array recentRequests(const AccountRecord& record) {
    Array recent;
    for (const Value& date : record.requestDates()) {
        const auto seconds = date.asDate();
        if (seconds && *seconds <= platform::now() && platform::now() < *seconds + kRequestWindow)
            recent.append(date);
    }
    return recent;
}

/// An account that the guard has just refused goes on with one request in the window.
size_t maxRequests(const AccountRecord& record) {
    const auto held = record.requestsHeldUntil();
    const double now = platform::now();
    return held && *held <= now && now < *held + 2 * kRequestWindow ? 1 : kMaxRequestsInWindow;
}

}  // namespace

std::optional<double> requestsHeldUntil(const AccountRecord& record) {
    const auto date = record.requestsHeldUntil();
    // No refusal lasts longer than the longest interval: a later date was stored while the clock was wrong.
    if (!date || *date <= platform::now() || *date > platform::now() + kMaxGenerationInterval)
        return std::nullopt;
    return date;
}

std::optional<double> nextRequestDate(const AccountRecord& record) {
    std::optional<double> next = requestsHeldUntil(record);
    const auto generated = record.requestGeneration();
    // As above.
    if (!generated || *generated > platform::now() + kMaxGenerationInterval) return next;
    return std::max(*generated + generationInterval(record), next.value_or(*generated));
}

bool admitCertificateRequest(const AccountRecord& record, ErrorOut error) {
    auto heldUntil = requestsHeldUntil(record);
    if (!heldUntil) {
        if (recentRequests(record).size() < maxRequests(record)) return true;
        heldUntil = platform::now() + kRequestHold;
        __VeltoIDDBSetAccountValue(record.accountName(), kVeltoIDAccountCertificateRequestsHeldUntilKey,
                                   Value::date(*heldUntil), Notify::No);
        VELTOID_LOG(kError, "Velto ID ", describeAccountForLog(record.accountName()), " has asked for ",
                    recentRequests(record).size(),
                    " certificates within an hour and wants another one; its requests are held up until ",
                    Value::date(*heldUntil), ".");
    }
    const Dictionary information = {
        {kVeltoIDAccountCertificateRequestsHeldUntilKey, Value::date(*heldUntil)}};
    return failWith(error,
                    makeError(identity_error::kNotYet,
                              {"This account has asked for too many certificates within an hour.", {}, {}},
                              information, __func__, __FILE_NAME__, __LINE__));
}

void noteCertificateRequest(const String& accountName) {
    Array requests = recentRequests(accountRecordOf(accountName));
    requests.append(Value::date(platform::now()));
    __VeltoIDDBSetAccountValue(accountName, kVeltoIDAccountCertificateRequestDatesKey, requests, Notify::No);
}

}  // namespace veltoid
