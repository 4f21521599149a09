// SPDX-License-Identifier: Apache-2.0
// The marks by which a file is known to be the one that was read, and unchanged. A change within one tick of the
// kernel's clock (some milliseconds) leaves them as they are: who keeps what was read sees to it that the file is
// older. Pure; any thread.
#pragma once

#include <cstdint>
#include <ctime>
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

} // namespace zor::platform
