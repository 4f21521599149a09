// SPDX-License-Identifier: Apache-2.0
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
#pragma once

#include "base/Mutex.h"
#include "os/FileChanges.h"
#include "os/FileDescriptor.h"
#include "os/RunLoop.h"
#include "os/SystemRoot.h"
#include "platform/Device.h"
#include "platform/Errno.h"

#include <atomic>
#include <cstdint>
#include <optional>

namespace zor::platform {

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

} // namespace zor::platform
