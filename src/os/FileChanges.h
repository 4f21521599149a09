// SPDX-License-Identifier: Apache-2.0
// The two ways in which a change of a file shows: by the marks of the file itself, and by a notice from its directory;
// and a clock for code that looks at the marks now and then.
//
// Two changes within one tick of the kernel's clock (some milliseconds) leave the same marks: a caller that keeps a
// file's content for as long as its marks stay sees to it that the file is older than that. Any thread; one reader of
// an inotify descriptor at a time.
#pragma once

#include "platform/Errno.h"

#include <cstdint>
#include <ctime>
#include <functional>
#include <string_view>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/types.h>

namespace zor::platform {

[[nodiscard]] inline std::int64_t nanosecondsOf(const timespec& time) {
    return std::int64_t{time.tv_sec} * 1'000'000'000 + time.tv_nsec;
}

/// The marks by which a file is the same one, whatever its name in whichever mount namespace.
struct FileId {
    dev_t device = 0;
    ino_t inode = 0;
    bool operator==(const FileId&) const = default;
};

/// Everything about a file that changes when it does.
struct FileStamp {
    FileId id;
    mode_t mode = 0;
    uid_t uid = 0;
    off_t bytes = 0;
    std::int64_t modifiedNanoseconds = 0;
    std::int64_t changedNanoseconds = 0;
    bool operator==(const FileStamp&) const = default;
};

[[nodiscard]] inline FileStamp stampOf(const struct stat& status) {
    return {.id = {.device = status.st_dev, .inode = status.st_ino},
            .mode = status.st_mode,
            .uid = status.st_uid,
            .bytes = status.st_size,
            .modifiedNanoseconds = nanosecondsOf(status.st_mtim),
            .changedNanoseconds = nanosecondsOf(status.st_ctim)};
}

/// Watches an open directory, wherever its name points by now. The watch's number.
[[nodiscard]] ErrnoOr<int> watchDirectory(int inotify, int directory, std::uint32_t events);

/// Takes all pending events of a non-blocking inotify descriptor. True when `counts` accepted one of them.
bool readInotify(int inotify, const std::function<bool(const inotify_event&, std::string_view name)>& counts);

// The monotonic clock as the kernel's ticks move it on, a few milliseconds at a time: for code that asks at every
// message whether something is due. Costs no system call. Any thread.

[[nodiscard]] inline std::int64_t coarseMilliseconds() {
    timespec now{};
    ::clock_gettime(CLOCK_MONOTONIC_COARSE, &now);
    return std::int64_t{now.tv_sec} * 1000 + now.tv_nsec / 1'000'000;
}

} // namespace zor::platform
