// SPDX-License-Identifier: Apache-2.0
// The progress of a set-up: what earlier ones have done once and for all, and what this launch's does.
#pragma once

#include "base/ZORError.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "platform/Device.h"
#include "store/Configuration.h"

#include <chrono>
#include <cstdint>
#include <functional>
#include <string_view>
#include <utility>
#include <vector>

namespace zor {

// Marker files: each says that something need not be done again, and to people when it was. A marker is replaced
// atomically; a stop leaves none or a whole one. Any thread.

class MigrationMarkers {
public:
    MigrationMarkers(const Log& log, ZORFileManager& fileManager, ZORGlobalConfiguration& configuration,
                     const platform::SystemVersionQuery& systemVersion)
        : log_(log), fileManager_(fileManager), configuration_(configuration), systemVersion_(systemVersion) {}

    /// Failures are logged. In the library directory where no other is given.
    void writeMigrationFileToDiskWithName(std::string_view name, const FileURL& directory);
    void writeMigrationFileToDiskWithName(std::string_view name);
    [[nodiscard]] bool existsMigrationFileWithName(std::string_view name);
    /// Whether the marker is known not to be there: one that cannot be examined makes nothing happen a second time.
    [[nodiscard]] bool isDue(std::string_view name);

private:
    const Log& log_;
    ZORFileManager& fileManager_;
    ZORGlobalConfiguration& configuration_;
    const platform::SystemVersionQuery& systemVersion_;
};

// The work of this launch's setup: each pass inside its own exception boundary, with its time and how many items it
// changed, for the status; and between items, a word to whoever waits for the daemon, and a look whether it is to end.
//
// Used by the thread that starts the daemon, before anything is served; passes() is read afterwards.

class SetupReport {
public:
    struct Pass {
        const char* name;
        std::uint64_t microseconds;
        std::uint64_t changed;
        bool failed;
    };
    /// Both may be absent.
    struct Surroundings {
        /// Told that the setup goes on, at most once in each progressPeriod.
        std::function<void()> progress;
        std::function<bool()> stopWanted;
    };
    static constexpr std::chrono::seconds progressPeriod{5};

    explicit SetupReport(ExceptionBoundary& boundary) : boundary_(boundary) {}

    void setSurroundings(Surroundings surroundings) { surroundings_ = std::move(surroundings); }

    /// Between two items: false when the rest is to be left for the next launch. Once the surroundings have been taken
    /// away, from any thread.
    bool goOn() {
        if (!surroundings_.progress && !surroundings_.stopWanted)
            return !stopped_;
        const auto now = std::chrono::steady_clock::now();
        if (surroundings_.progress && now - progressSaid_ >= progressPeriod) {
            progressSaid_ = now;
            surroundings_.progress();
        }
        stopped_ = stopped_ || (surroundings_.stopWanted && surroundings_.stopWanted());
        return !stopped_;
    }
    [[nodiscard]] bool stopped() const { return stopped_; }
    /// The same, for work that takes a function.
    [[nodiscard]] std::function<bool()> check() {
        return [this] { return goOn(); };
    }

    /// Runs `pass`, which gives the number of items that it changed, and notes it under `name` (a literal). Not when
    /// the setup is to stop. An exception ends this pass alone.
    template <typename Function>
    void run(const char* name, Function&& pass) {
        if (!goOn())
            return;
        const auto begin = std::chrono::steady_clock::now();
        const auto changed =
            boundary_.run({name, __LINE__}, [&]() -> Result<std::uint64_t> { return std::forward<Function>(pass)(); });
        const auto time = std::chrono::steady_clock::now() - begin;
        passes_.push_back({.name = name,
                           .microseconds = static_cast<std::uint64_t>(
                               std::chrono::duration_cast<std::chrono::microseconds>(time).count()),
                           .changed = changed.value_or(0),
                           .failed = !changed});
    }
    [[nodiscard]] const std::vector<Pass>& passes() const { return passes_; }

private:
    ExceptionBoundary& boundary_;
    Surroundings surroundings_;
    std::chrono::steady_clock::time_point progressSaid_{};
    bool stopped_ = false;
    std::vector<Pass> passes_;
};

} // namespace zor
