// SPDX-License-Identifier: Apache-2.0
// Data protection: whether the device is locked, and the classes of files whose keys go with the lock.
#pragma once

#include "base/Mutex.h"
#include "os/FileChanges.h"
#include "os/FileDescriptor.h"
#include "os/RunLoop.h"
#include "os/SystemRoot.h"
#include "platform/Device.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <atomic>
#include <cstdint>
#include <optional>

namespace zor::platform {

// The lock state as the number in run/zorvane/lockstate, which whoever manages the lock replaces by rename.
//
// No file is 0, unlocked. A file that holds no number is -1: neither locked nor unlocked, so nothing that waits for an
// unlock starts, and nothing begins to wait for one that may never be said. It is -1 too when there is no descriptor or
// no memory to look with; then the loop is told a moment later, as of a change, for nobody will change it again because
// a notice was not understood. If the system gives no notices (each user has so many of them), the loop is told four
// times a second, and the notices are tried again each time.
//
// A change of protection class asks for every file, so the state that was read is kept: for a second at most, and only
// while the kernel has queued no notice of the directory and the loop has taken none. Without that, what was read
// counts for as long as the file is the same and unchanged, which is looked up each time. Any thread.

class FileDeviceLockState final : public DeviceLockState {
public:
    static constexpr int unknown = -1;

    explicit FileDeviceLockState(const SystemRoot& root) : root_(root) {}
    [[nodiscard]] int currentState() const override;
    /// Once. The loop outlives this object, and has ended when it goes.
    Errno registerForChanges(RunLoop& loop, std::function<void()> changed) override;
    [[nodiscard]] const char* registrationCallName() const override { return "inotify_add_watch"; }
    [[nodiscard]] const char* notificationName() const override;

private:
    /// The state that a file holds, and by what it is known again.
    struct Known {
        FileStamp stamp;
        int state;
    };
    /// The state that the last look gave, for as long as nothing can have changed since.
    struct Kept {
        int state;
        /// See takes_; read before the look.
        std::uint64_t takes;
        std::int64_t untilMilliseconds;
    };
    [[nodiscard]] std::optional<int> keptState() const;
    [[nodiscard]] ErrnoOr<int> look() const;
    [[nodiscard]] ErrnoOr<int> readState() const;
    /// The state that a look gives that failed.
    [[nodiscard]] int stateUnread(Errno error) const;
    [[nodiscard]] bool takeEvents();
    /// The error for which there are no notices.
    Errno follow();
    void lookAgain();

    const SystemRoot& root_;
    RunLoop* loop_ = nullptr;
    std::function<void()> changed_;
    /// Invalid: there are no notices.
    FileDescriptor inotify_;
    /// Runs out a moment after a look that a shortage prevented, and again and again where there are no notices.
    std::optional<LoopTimer> again_;
    /// The descriptor of the notices for other threads, or -1: it is set once.
    std::atomic<int> notices_{-1};
    /// How often the loop has begun, and ended, to take notices: odd while it takes some.
    std::atomic<std::uint64_t> takes_{0};
    mutable Mutex mutex_;
    mutable std::optional<Known> known_ ZOR_GUARDED_BY(mutex_);
    mutable std::optional<Kept> kept_ ZOR_GUARDED_BY(mutex_);
};

// Data-protection classes as decimal numbers in an extended attribute. Nothing is encrypted by it: what the class means
// is the business of whoever encrypts; the daemon keeps the record and the rule of what a lock takes away.
//
// While the device is locked, a set is refused where the class of the file, before or after, is one whose keys are away
// (1 and 2). Any thread.

class XattrProtectionClass final : public FileProtectionClass {
public:
    /// Looks once whether this process may set attributes that clients cannot: else the attribute is one that a file's
    /// owner can forge.
    XattrProtectionClass(Disk& disk, const DeviceLockState& lockState);

    /// The class that an attribute of an open file says; nullopt when it has none (or its file system has none at all).
    /// A value that is no class of ours reads as the default.
    [[nodiscard]] static ErrnoOr<std::optional<int>> classIn(int fd, const char* attribute);

    [[nodiscard]] ErrnoOr<int> classOf(int fd) const override;
    /// EINVAL for a negative class.
    Errno setClass(int fd, int protectionClass) override;
    [[nodiscard]] bool supported() const override { return supported_.load(std::memory_order_relaxed); }
    [[nodiscard]] const char* attributeName() const { return attribute_; }

private:
    const char* const attribute_;
    Disk& disk_;
    const DeviceLockState& lockState_;
    std::atomic<bool> supported_{true};
};

} // namespace zor::platform
