// SPDX-License-Identifier: Apache-2.0
#include "Statistics.h"

#include <algorithm>
#include <cstddef>

namespace zor::bench {

double percentile(std::vector<double> samples, double fraction) {
    if (samples.empty())
        return 0;
    const auto rank = static_cast<std::size_t>(fraction * static_cast<double>(samples.size() - 1) + 0.5);
    std::nth_element(samples.begin(), samples.begin() + static_cast<std::ptrdiff_t>(rank), samples.end());
    return samples[rank];
}

double median(std::vector<double> samples) {
    return percentile(std::move(samples), 0.5);
}

double Pairs::ratio() const {
    std::vector<double> ratios;
    for (std::size_t i = 0; i < std::min(measured.size(), floor.size()); ++i)
        ratios.push_back(measured[i] / floor[i]);
    return median(std::move(ratios));
}

} // namespace zor::bench
