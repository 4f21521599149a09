// SPDX-License-Identifier: Apache-2.0
// Round trips of two kinds in turns, block by block, and the figure that comes of them.
#pragma once

#include "Client.h"
#include "Report.h"
#include "Statistics.h"

#include <string>
#include <vector>

namespace zor::bench {

struct RoundTripPairs {
    /// The median of each block, in microseconds.
    Pairs blocks;
    /// Every round trip.
    std::vector<double> measured;
    std::vector<double> floor;

    /// The median of the blocks, with the 99th percentiles beside it.
    [[nodiscard]] Figure figure(const char* name, const char* what, double goal, const Frame& request,
                                const Frame& reply) const;
};

/// Each function gives the times of one block in microseconds. One block more, first, warms up.
template <typename Measured, typename Floor>
RoundTripPairs roundTripsInTurns(int blocks, Measured&& measured, Floor&& floor) {
    RoundTripPairs pairs;
    for (int block = -1; block < blocks; ++block) {
        const std::vector<double> some = measured();
        const std::vector<double> bare = floor();
        if (block < 0)
            continue;
        pairs.blocks.measured.push_back(median(some));
        pairs.blocks.floor.push_back(median(bare));
        pairs.measured.insert(pairs.measured.end(), some.begin(), some.end());
        pairs.floor.insert(pairs.floor.end(), bare.begin(), bare.end());
    }
    return pairs;
}

} // namespace zor::bench
