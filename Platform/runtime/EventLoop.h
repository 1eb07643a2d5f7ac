// The event loop (sd-event) on the main thread: it runs the main queue, the signals and whatever is added to
// it.
#pragma once

#include <functional>

struct sd_event;

namespace platform::event_loop {

/// Makes the calling thread the main thread: the main queue's tasks wait for `run` from now on. Called before
/// the lifetime has any other thread, since it blocks the signals that `onSignal` serves in every thread;
/// they stay blocked.
void prepare();

/// Runs `handler` on the main thread whenever the signal (SIGINT or SIGTERM) arrives.
void onSignal(int signal, std::function<void()> handler);

/// Serves the main queue until `stop`, and returns what that was given.
int run();

/// Has `run` return after the current task. Main queue.
void stop(int status);

/// The loop, for what is to be watched; null before `prepare`.
sd_event* handle();

}  // namespace platform::event_loop
