// SPDX-License-Identifier: Apache-2.0
#include "ProgressDisplay.h"

#include "Output.h"

#include <algorithm>
#include <cstdio>

namespace zorvanectl {

namespace {

constexpr std::chrono::milliseconds interval(100);
constexpr int barWidth = 32;

} // namespace

ProgressDisplay::~ProgressDisplay() {
    if (isDrawn_)
        std::fputs("\r\x1b[K", stderr);
}

void ProgressDisplay::show(const State& state) {
    if (!isShown())
        return;
    const auto now = Clock::now();
    if (now < next_ && phase_ == state.phase)
        return;
    next_ = now + interval;
    phase_ = state.phase;
    draw(state);
}

void ProgressDisplay::draw(const State& state) {
    const double share = std::clamp(state.share, 0.0, 1.0);
    if (form_ == ProgressForm::json) {
        std::fprintf(stderr, "{\"progress\": {\"phase\": \"%s\", \"items\": %llu, \"bytes\": %llu, \"share\": %.4f}}\n",
                     state.phase, static_cast<unsigned long long>(state.items),
                     static_cast<unsigned long long>(state.bytes), share);
        return;
    }
    const int filled = static_cast<int>(share * barWidth);
    const std::string bar = std::string(static_cast<std::size_t>(filled), '#') +
                            std::string(static_cast<std::size_t>(barWidth - filled), '.');
    std::fprintf(stderr, "\r[%s] %3d%%  %s, %llu items, %s\x1b[K", bar.c_str(), static_cast<int>(share * 100),
                 shownBytes(state.bytes).c_str(), static_cast<unsigned long long>(state.items), state.phase);
    std::fflush(stderr);
    isDrawn_ = true;
}

} // namespace zorvanectl
