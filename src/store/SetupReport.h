// SPDX-License-Identifier: Apache-2.0
// The work of this launch's setup: each pass inside its own exception boundary, with its time and how many items it
// changed, for the status; and between items, a word to whoever waits for the daemon, and a look whether it is to end.
//
// Used by the thread that starts the daemon, before anything is served; passes() is read afterwards.
#pragma once

#include "base/ZORException.h"

#include <chrono>
#include <cstdint>
#include <functional>
#include <utility>
#include <vector>

namespace zor {

class SetupReport {
public:
    struct Pass {
        const char* name;
        std::uint64_t microseconds;
        std::uint64_t changed;
        bool failed;
    };
    /// Both may be absent.
    struct Surroundings {
        /// Told that the setup goes on, at most once in each progressPeriod.
        std::function<void()> progress;
        std::function<bool()> stopWanted;
    };
    static constexpr std::chrono::seconds progressPeriod{5};

    explicit SetupReport(ExceptionBoundary& boundary) : boundary_(boundary) {}

    void setSurroundings(Surroundings surroundings) { surroundings_ = std::move(surroundings); }

    /// Between two items: false when the rest is to be left for the next launch. Once the surroundings have been taken
    /// away, from any thread.
    bool goOn() {
        if (!surroundings_.progress && !surroundings_.stopWanted)
            return !stopped_;
        const auto now = std::chrono::steady_clock::now();
        if (surroundings_.progress && now - progressSaid_ >= progressPeriod) {
            progressSaid_ = now;
            surroundings_.progress();
        }
        stopped_ = stopped_ || (surroundings_.stopWanted && surroundings_.stopWanted());
        return !stopped_;
    }
    [[nodiscard]] bool stopped() const { return stopped_; }
    /// The same, for work that takes a function.
    [[nodiscard]] std::function<bool()> check() {
        return [this] { return goOn(); };
    }

    /// Runs `pass`, which gives the number of items that it changed, and notes it under `name` (a literal). Not when
    /// the setup is to stop. An exception ends this pass alone.
    template <typename Function>
    void run(const char* name, Function&& pass) {
        if (!goOn())
            return;
        const auto begin = std::chrono::steady_clock::now();
        const auto changed =
            boundary_.run({name, __LINE__}, [&]() -> Result<std::uint64_t> { return std::forward<Function>(pass)(); });
        const auto time = std::chrono::steady_clock::now() - begin;
        passes_.push_back({.name = name,
                           .microseconds = static_cast<std::uint64_t>(
                               std::chrono::duration_cast<std::chrono::microseconds>(time).count()),
                           .changed = changed.value_or(0),
                           .failed = !changed});
    }
    [[nodiscard]] const std::vector<Pass>& passes() const { return passes_; }

private:
    ExceptionBoundary& boundary_;
    Surroundings surroundings_;
    std::chrono::steady_clock::time_point progressSaid_{};
    bool stopped_ = false;
    std::vector<Pass> passes_;
};

} // namespace zor
