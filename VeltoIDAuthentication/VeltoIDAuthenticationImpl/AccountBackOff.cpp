#include "VeltoIDAuthenticationImpl/AccountBackOff.h"

#include <algorithm>

#include "Platform/runtime/Clock.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationImpl/AccountSchedule.h"

namespace veltoid {
namespace {

constexpr double kGrowth = 1.5;

/// What a pass may change for the better.
Array stateOf(const AccountRecord& record) {
    const CertificateEntry entry = certificateEntryOf(record.encDsId());
    return {record.encDsId(),
            record.certificateToken(),
            record.passwordReference(),
            entry.reference(),
            entry.serialNumber(),
            Value::boolean(entry.isInvalid()),
            record.validationRecordIdentifier()};
}

/// How far the account has come on its way to a certificate.
int stepOf(const AccountRecord& record) {
    if (hasValidCertificateEntry(record.encDsId())) return 3;
    if (record.certificateToken()) return 2;
    return record.encDsId() ? 1 : 0;
}

Dictionary putOff(double until, double backOff) {
    return {{kVeltoIDAccountNextCheckDateKey, Value::date(until)},
            {kVeltoIDAccountCheckBackOffKey, Value::real(backOff)}};
}

Dictionary putOffFrom(double from, double backOff) { return putOff(from + backOff, backOff); }

double grown(double backOff, const AccountRecord& record) {
    const double most = hasValidCertificateEntry(record.encDsId()) ? kMaxBackOff : kMaxBackOffInNeed;
    return std::clamp(backOff * kGrowth, kFirstBackOff, most);
}

bool isStillPutOffAsExamined(const AccountRecord& stored, const AccountRecord& examined) {
    return stored.nextCheck() == examined.nextCheck();
}

}  // namespace

void noteNews(const String& accountName) {
    __VeltoIDDBSetAccountValues(accountName, {{kVeltoIDAccountNextCheckDateKey, Value::null()},
                                              {kVeltoIDAccountCheckBackOffKey, Value::null()}});
}

AccountPass::AccountPass(const AccountRecord& record)
    : accountName_(record.accountName()),
      backOff_(putOffUntil(record) ? record.checkBackOff().value_or(0) : 0),
      begun_(platform::now()),
      stateBefore_(stateOf(record)),
      stepBefore_(stepOf(record)) {
    Dictionary values = putOffFrom(begun_, grown(backOff_, record));
    values.set(kVeltoIDDirtyKey, Value::null());
    __VeltoIDDBSetAccountValues(accountName_, values, Notify::No);
}

void AccountPass::end() const {
    const AccountRecord record = accountRecordOf(accountName_);
    const double now = platform::now();
    const auto next = AccountSchedule(record, certificateEntryOf(record.encDsId()), {}).nextReason();
    const bool isInNeed = !record.encDsId() || (next && *next <= now);
    const bool isOneStepOn =
        stepOf(record) > stepBefore_ || (backOff_ == 0 && stateOf(record) != stateBefore_);
    Dictionary values = {{kVeltoIDAccountNextCheckDateKey, Value::null()},
                         {kVeltoIDAccountCheckBackOffKey, Value::null()}};
    // The back-off stays as it is: who goes one step on and one back again and again is put off.
    if (isInNeed)
        values = isOneStepOn ? putOff(now + kFollowUpDelay, std::max(backOff_, kFollowUpDelay))
                             : putOffFrom(now, grown(backOff_, record));
    values.set(kVeltoIDDirtyKey, Value::null());
    const AccountRecord begun(accountName_, putOffFrom(begun_, grown(backOff_, record)));
    setAccountValuesIf(isStillPutOffAsExamined, begun, values, Notify::No);
}

}  // namespace veltoid
