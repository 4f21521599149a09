// SPDX-License-Identifier: Apache-2.0
// A Disk that fails, or stops the process, at the N-th call that changes or syncs the disk.
//
// Calls are counted from the moment a fault is armed; until then, and after disarm, each goes through. A write of two
// bytes or more counts as two points: before anything of it is on disk, and when half of it is. Any thread.
//
// A stop is an object that no handler of the daemon's own errors takes (it is no std::exception). From then on the disk
// does not change any more, as after the death of a process: each further call throws the same again, or, while the
// stack unwinds (destructors may not throw), answers EIO.
#pragma once

#include "base/Mutex.h"
#include "platform/Errno.h"
#include "support/InterceptedDisk.h"

#include <cerrno>

namespace zor::support {

struct ProcessStopped {};

enum class FaultKind {
    /// The call returns an error and does nothing.
    error,
    /// Throws ProcessStopped.
    stop,
};
enum class FaultSpan { once, fromThenOn };

struct Fault {
    /// Counted from 1.
    std::size_t point = 1;
    FaultKind kind = FaultKind::error;
    int error = EIO;
    FaultSpan span = FaultSpan::once;
    /// Only calls it accepts are counted; empty accepts all.
    std::function<bool(const DiskCallInfo&)> filter;
};

class FaultDisk final : public InterceptedDisk {
public:
    using InterceptedDisk::InterceptedDisk;

    void arm(const Fault& fault);
    void disarm();
    /// Whether the armed (or last armed) fault's point was reached, and by which call.
    [[nodiscard]] bool met() const;
    [[nodiscard]] DiskCallInfo metCall() const;

    Errno write(int fd, std::span<const std::uint8_t> bytes) override;
    /// Directories that are encrypted as far as the daemon can see, besides those that are; their names stay readable.
    [[nodiscard]] bool hidesNames(int directory) override {
        return (locked && locked(directory)) || InterceptedDisk::hidesNames(directory);
    }
    std::function<bool(int directory)> locked;
    /// Files that cannot be read: the errno, or 0.
    ErrnoOr<std::size_t> read(int fd, std::span<std::uint8_t> bytes) override {
        TRY(Errno(unreadable ? unreadable(fd) : 0));
        return InterceptedDisk::read(fd, bytes);
    }
    std::function<int(int fd)> unreadable;
    /// Runs before each call, on its thread and under no lock of this disk's.
    std::function<void(const DiskCallInfo&)> before;

protected:
    Errno intercept(const DiskCallInfo& info, const Make& make) override;

private:
    /// No error: go on. Or the end.
    Errno faultOf(const DiskCallInfo& info);

    mutable platform::Mutex mutex_;
    Fault fault_ ZOR_GUARDED_BY(mutex_);
    bool armed_ ZOR_GUARDED_BY(mutex_) = false;
    bool met_ ZOR_GUARDED_BY(mutex_) = false;
    bool stopped_ ZOR_GUARDED_BY(mutex_) = false;
    std::size_t counted_ ZOR_GUARDED_BY(mutex_) = 0;
    DiskCallInfo metCall_ ZOR_GUARDED_BY(mutex_);
};

// A loop runs an operation again and again in a fresh world, with the fault one call later each time, until a run meets
// no fault: complete without counting calls or choosing points.

struct FaultOutcome {
    Fault fault;
    /// False in the last run, which went through.
    bool met = false;
    /// The operation was left by ProcessStopped.
    bool stopped = false;
    /// The call that met the fault.
    std::string call;

    [[nodiscard]] std::string describe() const;
};

/// `makeWorld(FaultDisk&)` returns what `operation(world)` works on, its disk being the one given, not yet armed.
/// `check(world, outcome)` judges what is left, the disk being disarmed again (one that stopped stays stopped), and
/// returns a complaint or nothing. The loop ends at the first complaint, which then says where the fault was.
template <typename MakeWorld, typename Operation, typename Check>
LoopReport forEachFaultPoint(platform::Disk& inner, Fault fault, MakeWorld makeWorld, Operation operation,
                             Check check) {
    constexpr std::size_t pointsMax = 100'000;
    for (fault.point = 1;; ++fault.point) {
        FaultDisk disk(inner);
        auto world = makeWorld(disk);
        FaultOutcome outcome{.fault = fault};
        disk.arm(fault);
        try {
            operation(world);
        } catch (const ProcessStopped&) {
            outcome.stopped = true;
        }
        outcome.met = disk.met();
        outcome.call = outcome.met ? disk.metCall().describe() : "";
        disk.disarm();
        std::string complaint = check(world, outcome);
        if (complaint.empty() && fault.point == pointsMax)
            complaint = "the operation meets fault points without end";
        if (!complaint.empty())
            return {.examined = fault.point, .complaint = outcome.describe() + ": " + complaint};
        if (!outcome.met)
            return {.examined = fault.point, .complaint = ""};
    }
}

} // namespace zor::support
