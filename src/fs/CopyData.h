// SPDX-License-Identifier: Apache-2.0
// Copies the data of regular files: shared where the file system can, else copied by the kernel, else read and written.
// Holes stay holes. Remembers what this pair of file systems refused. One thread.
#pragma once

#include "platform/Disk.h"

#include <cstdint>
#include <sys/stat.h>
#include <vector>

namespace zor::fs {

class CopyData {
public:
    explicit CopyData(platform::Disk& disk) : disk_(disk) {}

    /// Both files are open at their beginning, `to` is new. `status` is of `from`: not more than its size is copied,
    /// however fast the file grows. 0 or -errno.
    int copy(int from, int to, const struct stat& status);

private:
    int copyRuns(int from, int to, off_t size);
    /// The bytes copied, fewer at the end of the file; or -errno.
    off_t copyRun(int from, int to, off_t bytes);
    int extend(int from, int to, off_t size);

    platform::Disk& disk_;
    bool cloneRefused_ = false;
    bool kernelCopyRefused_ = false;
    std::vector<std::uint8_t> buffer_;
};

} // namespace zor::fs
