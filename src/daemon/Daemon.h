// SPDX-License-Identifier: Apache-2.0
// The daemon's life: start-up in its fixed order, the lock-state follower, and the run loop.
//
// Runs on the main thread. Before the listener is made, no client is served; the setup is alone with the disk. A stop
// during start-up leaves what the setup's own steps leave, and the next launch begins anew; one that was asked for
// counts as a run that ended well.
#pragma once

#include "daemon/Composition.h"
#include "os/RunLoop.h"
#include "os/ServiceManager.h"

#include <chrono>
#include <cstddef>
#include <functional>
#include <optional>
#include <string>

namespace zor {

class Daemon {
public:
    struct Options {
        int logLevel = logLevelNotice;
        /// Absent: as StoreLimits has it.
        std::optional<std::size_t> containersPerUser;
        /// Runs when all is set up, before the first client can connect: opens what else is served.
        std::function<void()> beforeClients;
        /// Runs when clients can connect, before the run loop: tells the service manager.
        std::function<void()> ready;
        /// Told every few seconds while the setup goes on: keeps the service manager from taking it for hung.
        std::function<void()> settingUp;
        /// Asked between the setup's items; with true the daemon ends without serving, and the next launch goes on.
        std::function<bool()> stopWanted;
    };
    Daemon(Composition& composition, Options options) : composition_(composition), options_(std::move(options)) {}
    Daemon(const Daemon&) = delete;
    Daemon& operator=(const Daemon&) = delete;

    /// The whole life; returns the exit status: 0, or -1 when start-up cannot go on.
    int run();

    /// The steps of run before the first client is served; tests call them one by one.
    void openLog();
    void setUp();
    void followLockState();
    void evaluateLockState();

private:
    bool startQueues();
    bool startUpcallServer();
    /// Without it the daemon serves the upcall alone, and nobody is told that it is ready: a service manager starts it
    /// again when that has taken too long.
    bool startListener();

    Composition& composition_;
    const Options options_;
    int lastLockState_ = 3; // neither locked nor unlocked seen yet; main thread only
};

/// Tells the service manager, as often as it wants to know, that the daemon works: the run loop comes round to it, and
/// the listener's pool has answered since. One that hangs is then killed and started again, which loses nothing.
///
/// A file system that does not answer holds up no more than its own users' share of the pool, so it does not end the
/// daemon. Main thread only.
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
