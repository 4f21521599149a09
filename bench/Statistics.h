// SPDX-License-Identifier: Apache-2.0
// The parts of a figure: percentiles of single samples, and ratios of blocks that were measured in turn.
//
// A machine is never quiet for long. So what is measured and its floor take turns in short blocks (A B A B …), each
// pair of neighbours gives one ratio, and the median of these ratios is the figure: a disturbance spoils a pair, not
// the figure.
#pragma once

#include <chrono>
#include <vector>

namespace zor::bench {

using Clock = std::chrono::steady_clock;

[[nodiscard]] inline double secondsSince(Clock::time_point begin) {
    return std::chrono::duration<double>(Clock::now() - begin).count();
}

/// The sample below which `fraction` of them lie; 0 without samples.
[[nodiscard]] double percentile(std::vector<double> samples, double fraction);
[[nodiscard]] double median(std::vector<double> samples);

/// Blocks measured in turn, value i of one next to value i of the other.
struct Pairs {
    std::vector<double> measured;
    std::vector<double> floor;

    [[nodiscard]] double ratio() const;
    [[nodiscard]] double measuredMedian() const { return median(measured); }
    [[nodiscard]] double floorMedian() const { return median(floor); }
};

} // namespace zor::bench
