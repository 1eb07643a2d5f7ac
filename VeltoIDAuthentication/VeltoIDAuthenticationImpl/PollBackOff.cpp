#include "VeltoIDAuthenticationImpl/PollBackOff.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <optional>

#include "Platform/crypto/Crypto.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDXMLServerCommunications/Invoke.h"

namespace veltoid {
namespace {

constexpr double kBackOffFactor = 1.5;
constexpr double kDefaultPollDelay = 60;

std::optional<double> finite(std::optional<double> number) {
    return number && std::isfinite(*number) ? number : std::nullopt;
}

}  // namespace

double randomPollingDelay() {
    constexpr uint32_t kMaxStoredDelay = 0x7FFF'FFFF;
    uint8_t bytes[sizeof(uint32_t)];
    platform::fillRandom(bytes);
    uint32_t number = 0;
    std::memcpy(&number, bytes, sizeof number);
    return kMaxPollingDelay + kMaxPollingDelay * (number & kMaxStoredDelay) / kMaxStoredDelay;
}

double pendingDelay(const Value& delay, const AccountRecord& record) {
    const auto given = finite(delay.asDouble());
    if (given && *given > 0) return std::clamp(*given, kMinPollDelay, kMaxFetchDelay);
    return std::clamp(finite(record.nextCertificateFetchDelta()).value_or(kDefaultPollDelay), kMinPollDelay,
                      kMaxOwnPollDelay);
}

double tokenDelay(const Value& delay) {
    const auto given = delay.asDouble();
    if (!given || *given == 0) return kDefaultPollDelay;
    return *given > 0 && *given <= kMaxPollingDelay ? std::max(*given, kMinPollDelay) : kMinPollDelay;
}

bool putOffFetch(const String& accountName, double delay) {
    const double nextFetch = platform::now() + delay;
    const double after =
        delay < kMaxOwnPollDelay ? std::min(delay * kBackOffFactor, kMaxOwnPollDelay) : delay;
    const bool stored = __VeltoIDDBSetAccountValues(
        accountName, {{kVeltoIDAccountCertificateNextCertificateFetchDateKey, Value::date(nextFetch)},
                      {kVeltoIDAccountCertificateNextCertificateFetchNextDeltaKey, Value::real(after)}});
    requestRelaunch(nextFetch);
    return stored;
}

}  // namespace veltoid
