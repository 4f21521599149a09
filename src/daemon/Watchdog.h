// SPDX-License-Identifier: Apache-2.0
// Tells the service manager, as often as it wants to know, that the daemon works: the run loop comes round to it, and
// the listener's pool has answered since. One that hangs is then killed and started again, which loses nothing.
//
// A file system that does not answer holds up no more than its own users' share of the pool, so it does not end the
// daemon. Main thread only.
#pragma once

#include "os/NotifySocket.h"
#include "platform/RunLoop.h"

#include <chrono>
#include <functional>
#include <optional>
#include <string>

namespace zor {

class Watchdog {
public:
    /// `poolAnswers` is asked each time, and asks anew; `describe` is what the manager shows of the daemon.
    Watchdog(platform::RunLoop& loop, const platform::NotifySocket& notify, std::function<bool()> poolAnswers,
             std::function<std::string()> describe)
        : notify_(notify), poolAnswers_(std::move(poolAnswers)), describe_(std::move(describe)),
          timer_(loop, [this] { feed(); }) {}

    /// How long the manager waits for the next word; absent where it does not watch.
    void start(std::optional<std::chrono::microseconds> patience);

private:
    void feed();

    const platform::NotifySocket& notify_;
    const std::function<bool()> poolAnswers_;
    const std::function<std::string()> describe_;
    std::chrono::milliseconds every_{0};
    const platform::LoopTimer timer_;
};

} // namespace zor
