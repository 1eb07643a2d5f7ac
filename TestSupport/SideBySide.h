// Threads for tests that let many do the same at once.
#pragma once

#include <thread>
#include <vector>

namespace platform {

/// Calls `work` with 0 to `count` - 1, each on a thread of its own, and waits for all.
template <typename Work>
void sideBySide(int count, Work work) {
    std::vector<std::thread> threads;
    for (int i = 0; i < count; ++i) threads.emplace_back([&work, i] { work(i); });
    for (std::thread& thread : threads) thread.join();
}

}  // namespace platform
