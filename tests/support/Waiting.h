// SPDX-License-Identifier: Apache-2.0
// Waiting for what other threads bring about, and threads to do it.
#pragma once

#include <chrono>
#include <functional>
#include <thread>
#include <vector>

namespace zor::support {

/// Until the condition holds; false when it does not within ten seconds.
inline bool eventually(const std::function<bool()>& condition) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!condition()) {
        if (std::chrono::steady_clock::now() > end)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
}

/// Does the job in so many threads at once, each of which gets its number, and waits for them.
inline void inThreads(unsigned count, const std::function<void(unsigned)>& job) {
    std::vector<std::jthread> threads;
    for (unsigned i = 0; i < count; ++i)
        threads.emplace_back(job, i);
}

} // namespace zor::support
