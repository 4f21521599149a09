// SPDX-License-Identifier: Apache-2.0
// What the setup of this launch did, for the status: each pass with its time and how many items it changed.
//
// Written by the thread that starts the daemon, before anything is served; read afterwards.
#pragma once

#include <chrono>
#include <cstdint>
#include <utility>
#include <vector>

namespace zor {

class SetupReport {
public:
    struct Pass {
        const char* name;
        std::uint64_t microseconds;
        std::uint64_t changed;
    };

    /// Runs `pass`, which gives the number of items that it changed, and notes it under `name` (a literal).
    template <typename Function>
    void run(const char* name, Function&& pass) {
        const auto begin = std::chrono::steady_clock::now();
        const std::uint64_t changed = std::forward<Function>(pass)();
        const auto time = std::chrono::steady_clock::now() - begin;
        passes_.push_back({.name = name,
                           .microseconds = static_cast<std::uint64_t>(
                               std::chrono::duration_cast<std::chrono::microseconds>(time).count()),
                           .changed = changed});
    }
    [[nodiscard]] const std::vector<Pass>& passes() const { return passes_; }

private:
    std::vector<Pass> passes_;
};

} // namespace zor
