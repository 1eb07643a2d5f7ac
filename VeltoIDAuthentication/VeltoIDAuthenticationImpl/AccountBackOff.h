// How far the account check puts off an account that it could not help.
//
// An account that a pass leaves in need is looked at again later and later, whatever is due for it:
// "NextAccountCheckDate" in its record says when, "AccountCheckBackOff" how far that was put off (seconds).
// Both are stored before the pass asks the server anything, so that neither an idle exit nor a crash begins
// anew. News from outside the check ends it: an account that is added again, a value that a client sets. What
// the check itself has changed is no news to it.
#pragma once

#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {

// Seconds. The first wait is longer than the first minute with an account, in which a server is asked often
// enough; an account without a valid certificate is what its user waits for.
inline constexpr double kFirstBackOff = 90;
inline constexpr double kMaxBackOffInNeed = 3'600;
/// Until a pass that has brought an account a step forward is followed by the next one, once.
inline constexpr double kFollowUpDelay = 5;

/// Ends what was put off for the account. Caller's queue.
void noteNews(const String& accountName);

/// One pass of the account check over an account. Account-check queue.
class AccountPass {
  public:
    /// Takes the mark of a change from the record, and puts the account off in case the pass does not end.
    explicit AccountPass(const AccountRecord& record);

    /// Stores what follows from the pass, unless there was news meanwhile.
    void end() const;

  private:
    const String accountName_;
    const double backOff_;
    const double begun_;
    const Array stateBefore_;
    const int stepBefore_;
};

}  // namespace veltoid
