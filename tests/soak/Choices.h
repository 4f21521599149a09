// SPDX-License-Identifier: Apache-2.0
// What is drawn by lot. The same seed makes the same choices, whatever the standard library: no distribution of its own
// is used.
#pragma once

#include <cstdint>
#include <random>

namespace zor::soak {

class Choices {
public:
    Choices(std::uint64_t seed, std::uint64_t stream) : random_(seed * 1'000'003 + stream) {}
    /// 0 to count - 1.
    std::uint64_t upTo(std::uint64_t count) { return random_() % count; }
    bool oneIn(std::uint64_t count) { return upTo(count) == 0; }

private:
    std::mt19937_64 random_;
};

} // namespace zor::soak
