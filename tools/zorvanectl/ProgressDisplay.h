// SPDX-License-Identifier: Apache-2.0
// How far a long command is, on standard error: a bar that is drawn over itself on a terminal, or a line of JSON now
// and then for programs. One thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <string>

namespace zorvanectl {

enum class ProgressForm { none, bar, json };

class ProgressDisplay {
public:
    explicit ProgressDisplay(ProgressForm form) : form_(form) {}
    /// Takes a bar that is drawn away.
    ~ProgressDisplay();
    ProgressDisplay(const ProgressDisplay&) = delete;
    ProgressDisplay& operator=(const ProgressDisplay&) = delete;

    struct State {
        const char* phase = ""; // one of a few words; a change of it is always shown
        std::uint64_t items = 0;
        std::uint64_t bytes = 0;
        double share = 0; // 0 to 1
    };
    /// Cheap, to be called often: shows no more than ten states a second.
    void show(const State& state);
    [[nodiscard]] bool isShown() const { return form_ != ProgressForm::none; }

private:
    void draw(const State& state);

    using Clock = std::chrono::steady_clock;
    const ProgressForm form_;
    std::string phase_;
    Clock::time_point next_;
    bool isDrawn_ = false;
};

} // namespace zorvanectl
