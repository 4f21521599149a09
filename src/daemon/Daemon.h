// SPDX-License-Identifier: Apache-2.0
// The daemon's life: start-up in its fixed order, the lock-state follower, and the run loop.
//
// Runs on the main thread. Before the listener is made, no client is served; the setup is alone with the disk. A stop
// during start-up leaves what the setup's own steps leave, and the next launch begins anew; one that was asked for
// counts as a run that ended well.
#pragma once

#include "daemon/Composition.h"
#include "platform/RunLoop.h"

#include <cstddef>
#include <functional>
#include <optional>

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

} // namespace zor
