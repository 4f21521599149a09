// SPDX-License-Identifier: Apache-2.0
// Counts the calls with which a process syncs the disk, whatever its libraries call them.
//
// The kernel's system call filter stops each such call and tells this process, which counts it and lets it go on:
// exact, needs no tool, but slow, so nothing is timed meanwhile.
#pragma once

#include "os/FileDescriptor.h"

#include <atomic>
#include <thread>

namespace zor::bench {

class SyncCounter {
public:
    SyncCounter();
    ~SyncCounter();
    SyncCounter(const SyncCounter&) = delete;
    SyncCounter& operator=(const SyncCounter&) = delete;

    /// In the new process, before it runs the program.
    void watchThisProcess() const;
    /// In this process, once after the other was made.
    void start();
    /// False where the kernel does not offer this.
    [[nodiscard]] bool works() const { return filter_.valid(); }
    [[nodiscard]] long count() const { return count_; }

private:
    void run();

    platform::FileDescriptor ours_;
    platform::FileDescriptor theirs_;
    platform::FileDescriptor filter_;
    std::atomic<long> count_{0};
    std::atomic<bool> stopping_{false};
    std::thread thread_;
};

} // namespace zor::bench
