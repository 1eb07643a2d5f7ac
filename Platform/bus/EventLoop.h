// The process's event loop (sd-event) on the main thread: it runs the main queue, the bus and the signals.
#pragma once

#include <functional>

struct sd_event;

namespace platform::event_loop {

/// Makes the calling thread the main thread: the main queue's tasks wait for `run` from now on. Called first
/// in main, before any other thread exists, since it blocks the signals that `onSignal` serves in every
/// thread.
void prepare();

/// Runs `handler` on the main thread whenever the signal (SIGINT or SIGTERM) arrives.
void onSignal(int signal, std::function<void()> handler);

/// Serves the main queue for the rest of the process.
[[noreturn]] void run();

/// The loop, for the bus connection; null before `prepare`.
sd_event* handle();

/// Ends the process once the main queue has done what it was asked for so far, replies and relaunch included.
/// From any thread: it does not return, except to a task of the main queue, which has to come to its end.
void exitAfterPendingWork(int status);

/// Ends the process at once from any thread: standard output is flushed, no destructor or exit handler runs,
/// so that other threads may go on until the end.
[[noreturn]] void exitProcess(int status);

}  // namespace platform::event_loop
