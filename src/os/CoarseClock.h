// SPDX-License-Identifier: Apache-2.0
// The monotonic clock as the kernel's ticks move it on, a few milliseconds at a time: for who asks at every message
// whether something is due. Costs no system call. Any thread.
#pragma once

#include <cstdint>
#include <ctime>

namespace zor::platform {

[[nodiscard]] inline std::int64_t coarseMilliseconds() {
    timespec now{};
    ::clock_gettime(CLOCK_MONOTONIC_COARSE, &now);
    return std::int64_t{now.tv_sec} * 1000 + now.tv_nsec / 1'000'000;
}

} // namespace zor::platform
