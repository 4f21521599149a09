// SPDX-License-Identifier: Apache-2.0
// A Disk that fails, or stops the process, at the N-th call that changes or syncs the disk.
//
// Calls are counted from the moment a fault is armed; until then, and after disarm, each goes through. A write of two
// bytes or more counts as two points: before anything of it is on disk, and when half of it is. Any thread.
//
// A stop is an object that no handler of the daemon's own errors takes (it is no std::exception). From then on the disk
// does not change any more, as after the death of a process: each further call throws the same again, or, while the
// stack unwinds (destructors may not throw), returns -EIO.
#pragma once

#include "platform/Disk.h"
#include "platform/Mutex.h"
#include "support/DiskCall.h"

#include <cerrno>
#include <functional>

namespace zor::support {

struct ProcessStopped {};

enum class FaultKind {
    /// The call returns an error and does nothing.
    error,
    /// Throws ProcessStopped.
    stop,
    /// Ends the process without any clean-up, with FaultDisk::exitStatus. For a forked child.
    exit,
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

    [[nodiscard]] std::string describe() const;
};

class FaultDisk : public platform::Disk {
public:
    static constexpr int exitStatus = 86;

    explicit FaultDisk(platform::Disk& inner) : inner_(inner) {}

    void arm(const Fault& fault);
    void disarm();
    /// Whether the armed (or last armed) fault's point was reached, and by which call.
    [[nodiscard]] bool met() const;
    [[nodiscard]] DiskCallInfo metCall() const;

    int makeDirectory(int directory, const char* name, mode_t mode) override;
    int createFile(int directory, const char* name, mode_t mode) override;
    int makeSymbolicLink(const char* target, int directory, const char* name) override;
    int makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) override;
    int makeFifo(int directory, const char* name, mode_t mode) override;
    int rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) override;
    int unlinkFile(int directory, const char* name) override;
    int removeDirectory(int directory, const char* name) override;
    int changeMode(int fd, mode_t mode) override;
    int changeOwner(int fd, uid_t uid, gid_t gid) override;
    int setTimes(int fd, const timespec& access, const timespec& modification) override;
    int setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) override;
    int setInodeFlags(int fd, int flags) override;
    int write(int fd, std::span<const std::uint8_t> bytes) override;
    int cloneData(int from, int to) override;
    ssize_t copyData(int from, int to, std::size_t bytesMax) override;
    int sync(int fd) override;
    int syncFileSystem(int fd) override;
    int orderData(int fd) override;

private:
    /// 0 to go on, the negative errno to return, or the end.
    int pass(DiskCall call, std::string subject = {});

    platform::Disk& inner_;
    mutable platform::Mutex mutex_;
    Fault fault_ ZOR_GUARDED_BY(mutex_);
    bool armed_ ZOR_GUARDED_BY(mutex_) = false;
    bool met_ ZOR_GUARDED_BY(mutex_) = false;
    bool stopped_ ZOR_GUARDED_BY(mutex_) = false;
    std::size_t counted_ ZOR_GUARDED_BY(mutex_) = 0;
    DiskCallInfo metCall_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor::support
