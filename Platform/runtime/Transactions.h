// Open transactions: while there is at least one, the agent is not ended for being idle.
#pragma once

#include <functional>

namespace platform::transactions {

/// Any thread. Each began is balanced by one ended.
void began();
void ended();

/// How many are open now.
long openCount();

/// Calls `function` on the main queue as soon as none is open, once; at once (queued) when none is.
void whenNoneIsOpen(std::function<void()> function);

/// Calls `function` once on the main queue when no transaction was open for `seconds`, counted from the end
/// of one that ends after this call. Replaces an earlier function that was not called yet. At most one timer
/// is armed.
void whenNoneWasOpenFor(double seconds, std::function<void()> function);

}  // namespace platform::transactions
