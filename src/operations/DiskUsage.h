// SPDX-License-Identifier: Apache-2.0
// How many bytes a container takes. The size of a live bundle is measured once and kept with its info, since its
// content does not change; everything else is measured each time. A transient bundle is being filled.
//
// A bundle that is being filled is measured too, but not kept: nothing of what was walked may have changed within
// settledTime before the walk, or in it. Two fills are not seen: one that pauses for longer than that, and one that
// begins during the walk in what was walked before, below the container's own directory.
//
// The walk holds no lock: a creation or deletion waits for every identifier lock, so a large container would stop those
// of all clients for as long as it is walked. The container is looked up and opened under its lock, and walked on that
// descriptor; the result is kept only if the lock, taken again, finds the same container at the same place. Any thread.
#pragma once

#include "base/ZORError.h"
#include "fs/ZORFileManager.h"
#include "operations/Basics.h"
#include "operations/InfoValues.h"

#include <chrono>
#include <cstdint>
#include <optional>

namespace zor {

/// The answer to a client; `bytes` counts when `error` is success.
struct DiskUsageAnswer {
    std::uint64_t bytes = 0;
    ErrorCode error = ErrorCode::success;
};

class DiskUsage {
public:
    struct Needs : RecordNeeds {
        ZORFileManager& fileManager;
        InfoValues& infoValues;
    };
    explicit DiskUsage(const Needs& needs) : needs_(needs) {}

    /// Allocated bytes; of bundles measured once. Errors 11, 21, 38, 40.
    DiskUsageAnswer diskUsageForUserId(const Caller& caller, const ContainerAddress& address);

    /// A bundle in which nothing has changed for so long counts as filled: longer than an installation pauses, less
    /// than somebody waits for a second look. Tests make it shorter, before the first question.
    std::chrono::milliseconds settledTime{10'000};

private:
    Result<std::uint64_t> diskUsage(const Caller& caller, const ContainerAddress& address);
    void keepDiskUsage(const Caller& caller, const ContainerAddress& address, const FileURL& measured,
                       std::uint64_t bytes);

    const Needs needs_;
};

} // namespace zor
