// What is due for an account, and when: one table of reasons, each with the date at which it becomes due. The
// account's examination asks it what is due now, and the date of the next action is the earliest of the same
// dates.
#pragma once

#include <optional>

#include "Values/Value.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"

namespace veltoid {

/// Servers of this version and later give out validation records.
inline constexpr int32_t kVeltoIDFirstVersionWithValidationRecords = 101;

/// A validation record is looked at again so long after the server's last answer at the latest (seconds),
/// whatever its date.
inline constexpr double kMaxRecordCheckInterval = 2'592'000;

/// The longest that the account check puts an account off (seconds).
inline constexpr double kMaxBackOff = 14'400;

/// The date (seconds since 1970) before which the account check leaves the account alone (AccountBackOff.h);
/// none when it does not.
std::optional<double> putOffUntil(const AccountRecord& record);

enum class DueReason {
    /// The encDsId is to be learnt.
    SignIn,
    /// The account's information is to be validated: forced, planned, or old.
    Validation,
    /// The pending certificate may be asked for.
    PendingFetch,
    /// A certificate may be requested (RequestRateLimit.h).
    Request,
    /// The certificate has expired or is invalid.
    Expiry,
    /// The planned renewal.
    Renewal,
    /// The last part of the certificate's life: a renewal is due, whatever was planned.
    PreExpiry,
    /// The certificate is to be evaluated.
    CertificateValidation,
    ValidationRecord,
};

/// The table for one account at the moment of construction. Keeps references: short-lived. Any queue but the
/// database's and the keychain's.
class AccountSchedule {
  public:
    /// `entry` is that of the record's encDsId, or does not exist; the options may hold
    /// "PreExpirationInterval".
    AccountSchedule(const AccountRecord& record, const CertificateEntry& entry, const Dictionary& options);

    /// Whether it is time for that, leaving aside what has to be done before.
    bool isDue(DueReason reason) const;

    /// The earliest date (seconds since 1970) of all reasons that the examination gets to, but not before
    /// what the account check has put the account off to; none: no action is foreseen.
    std::optional<double> nextAction() const;

    /// The same for what is due whether the record was changed or not, and whatever was put off.
    std::optional<double> nextReason() const;

    /// Whether the server wants to be left alone by this account.
    bool isEmbargoed() const { return record_.embargoEnd(now_).has_value(); }
    /// Whether the account's information was validated not long ago.
    bool isInformationFresh() const;
    /// Whether the certificate's evaluation is due, but was tried not long ago.
    bool isCertificateValidationPutOff() const;

  private:
    struct Due {
        double date = 0;
        /// Not at the date itself, but from then on.
        bool isOnlyAfter = false;
    };
    using Date = std::optional<Due>;

    static Date at(std::optional<double> date);
    static Date after(std::optional<double> date, double offset = 0);
    Date rightNow() const { return Due{now_, false}; }
    /// Whether a date lies further ahead than any that is stored here: the clock was wrong then.
    bool isFar(double date) const { return date > now_ + kMaxRecordCheckInterval; }

    Date due(DueReason reason) const;
    Date signIn() const;
    Date validation() const;
    Date pendingFetch() const;
    Date expiry() const;
    Date preExpiry() const;
    Date certificateValidation() const;
    Date validationRecord() const;
    double validationInterval(std::string_view key) const;
    double certificateLifetime() const;
    std::optional<double> endOfEmbargo() const;

    const AccountRecord& record_;
    const CertificateEntry& entry_;
    const Dictionary& options_;
    const double now_;
};

/// When the account next needs attention (seconds since 1970); none: no action is foreseen, as for an account
/// without password reference. Caller's queue.
std::optional<double> copyNextActionDateForAccount(const String& accountName);

}  // namespace veltoid
