#include "VeltoIDAuthenticationImpl/PollBackOff.h"

#include <algorithm>
#include <cmath>
#include <cstring>

#include "Platform/crypto/Crypto.h"

namespace veltoid {
namespace {

constexpr double kBackOffFactor = 1.5;
constexpr double kDefaultTokenDelay = 30;
constexpr double kDefaultPendingDelay = 60;

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
    return delay < kMaxOwnPollDelay ? std::min(delay * kBackOffFactor, kMaxOwnPollDelay) : delay;
}

double delayAfterFailedSignIn(double delay) { return delayAfterPending(delay); }

std::optional<double> storedFetchDelta(const AccountRecord& record) {
    return finite(record.nextCertificateFetchDelta());
}

double pendingDelay(const Value& delay, const AccountRecord& record) {
    const auto given = finite(delay.asDouble());
    if (given && *given > 0) return std::clamp(*given, kMinPollDelay, kMaxFetchDelay);
    return std::clamp(storedFetchDelta(record).value_or(kDefaultPendingDelay), kMinPollDelay,
                      kMaxOwnPollDelay);
}

std::optional<double> tokenDelay(const Value& delay) {
    const auto given = delay.asDouble();
    if (!given || *given == 0) return kDefaultTokenDelay;
    return *given > 0 && *given <= kMaxPollingDelay ? std::max(*given, kMinPollDelay) : kMinPollDelay;
}

}  // namespace veltoid
