// SPDX-License-Identifier: Apache-2.0
#include "RoundTripPairs.h"

namespace zor::bench {

Figure RoundTripPairs::figure(const char* name, const char* what, double goal, const Frame& request,
                              const Frame& reply) const {
    const double p99 = percentile(measured, 0.99);
    const double floorP99 = percentile(floor, 0.99);
    return {.name = name,
            .what = what,
            .measured = text("%.2f us", blocks.measuredMedian()),
            .floor = text("%.2f us", blocks.floorMedian()),
            .value = blocks.ratio(),
            .unit = "x",
            .goal = goal,
            .remark = text("p99 %.2f us, of the floor %.2f us; request %zu bytes, reply %zu", p99, floorP99,
                           request.size(), reply.size()),
            .numbers = {{"p50us", blocks.measuredMedian()},
                        {"p99us", p99},
                        {"floorP50us", blocks.floorMedian()},
                        {"floorP99us", floorP99}}};
}

} // namespace zor::bench
