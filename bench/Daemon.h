// SPDX-License-Identifier: Apache-2.0
// A real daemon on a root of its own, and what can be seen of it from outside.
#pragma once

#include "Client.h"
#include "Processes.h"
#include "Scratch.h"
#include "Statistics.h"
#include "SyncCounter.h"

#include <memory>
#include <optional>
#include <string>

namespace zor::bench {

/// The means of a run: the programs, its place, and how long it may take.
struct Settings {
    bool quick = false;
    std::string daemonProgram;
    std::string ownProgram; // the registry of a root grants it everything
    const Scratch* scratch = nullptr;

    /// A count, or the smaller one for a quick run.
    [[nodiscard]] int rounds(int full, int quickly) const { return quick ? quickly : full; }
};

/// Whom the registry of a root takes this program for.
inline constexpr const char* benchIdentifier = "com.veltra.zorvane-bench";
/// Makes what a daemon needs to find below `root`, which exists and is empty.
void prepareRoot(const Settings& settings, const std::string& root);
/// Enters a program into the registry of a root.
void admitProgram(const std::string& root, const std::string& name, const plist::Dictionary& entry);
/// The class directory of `userId` in a root, made with the owner that the daemon gives it.
std::string makeClassDirectory(const std::string& root, ContainerClass containerClass);

class Daemon {
public:
    enum class Syncs { off, on };
    struct Options {
        Syncs syncs = Syncs::off;
        std::optional<int> processor{};     // pins all of it
        SyncCounter* syncCounter = nullptr; // sees its syncs from the start on
        bool forgetBoot = false;            // its launch is the first after a boot
    };
    /// Starts it on the root and returns when it serves clients.
    Daemon(const Settings& settings, const std::string& root, const Options& options);
    /// SIGTERM, and a failure said on standard error when that does not end it.
    ~Daemon();
    Daemon(const Daemon&) = delete;
    Daemon& operator=(const Daemon&) = delete;

    [[nodiscard]] Client connect() const;
    [[nodiscard]] const std::string& socketDirectory() const { return socketDirectory_; }
    /// Just before the process was made.
    [[nodiscard]] Clock::time_point startedAt() const { return startedAt_; }
    /// How long it took from then until it served clients.
    [[nodiscard]] double readySeconds() const { return readySeconds_; }
    /// Its counters, as the status socket tells them.
    [[nodiscard]] plist::Dictionary counters() const;
    [[nodiscard]] double processorSeconds() const { return process_->processorSeconds(); }
    [[nodiscard]] double residentKiB() const;
    [[nodiscard]] int descriptorCount() const;

private:
    void waitUntilReady(int notices);

    const std::string socketDirectory_;
    Clock::time_point startedAt_;
    double readySeconds_ = 0;
    std::unique_ptr<ChildProcess> process_;
};

} // namespace zor::bench
