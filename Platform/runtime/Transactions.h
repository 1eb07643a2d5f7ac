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

/// Calls `function` on the main queue, once, when none has been open for `seconds`, counted from the end of
/// one that ends after this call. One timer at most is armed for it, and none while one is open longer than
/// that. Replaces an earlier call that has not come to its function.
void whenNoneWasOpenFor(double seconds, std::function<void()> function);

}  // namespace platform::transactions
