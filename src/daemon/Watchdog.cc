// SPDX-License-Identifier: Apache-2.0
#include "daemon/Watchdog.h"

namespace zor {

namespace {
/// Questions in the time that the manager waits: a pool that is late once is asked again before it is too late.
constexpr int questions = 4;
} // namespace

void Watchdog::start(std::optional<std::chrono::microseconds> patience) {
    if (!patience)
        return;
    every_ = std::chrono::ceil<std::chrono::milliseconds>(*patience / questions);
    feed();
}

void Watchdog::feed() {
    if (poolAnswers_())
        (void)notify_.send("WATCHDOG=1\nSTATUS=" + describe_());
    timer_.set(every_);
}

} // namespace zor
