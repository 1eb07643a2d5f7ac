#include "VeltoIDAuthenticationImpl/PollBackOff.h"

#include <algorithm>
#include <cmath>
#include <cstring>

#include "Platform/crypto/Crypto.h"

namespace veltoid {
namespace {

constexpr double kBackOffFactor = 1.5;
constexpr double kDefaultPendingDelay = 60;
constexpr double kDelayForUnbelievableOnes = 15;

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

double delayAfterPending(double delay) {
    return delay < kMaxPollingDelay ? delay * kBackOffFactor : randomPollingDelay();
}

double delayAfterFailure(double delay) { return std::min(delay * kBackOffFactor, randomPollingDelay()); }

std::optional<double> storedFetchDelta(const AccountRecord& record) {
    return finite(record.nextCertificateFetchDelta());
}

double pendingDelay(const Value& delay, const AccountRecord& record) {
    const auto given = finite(delay.asDouble());
    const double seconds = given ? *given : storedFetchDelta(record).value_or(kDefaultPendingDelay);
    return std::min(seconds, kMaxFetchDelay);
}

std::optional<double> tokenDelay(const Value& delay) {
    const auto seconds = delay.asDouble();
    if (!seconds) return std::nullopt;
    return *seconds >= 0 && *seconds <= kMaxPollingDelay ? *seconds : kDelayForUnbelievableOnes;
}

}  // namespace veltoid
