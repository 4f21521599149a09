// SPDX-License-Identifier: Apache-2.0
// Copies the data of regular files: shared where the file system can, else copied by the kernel, else read and written.
// Holes stay holes. Remembers what this pair of file systems refused. One thread.
#pragma once

#include "platform/Disk.h"

#include <cstdint>
#include <functional>
#include <sys/stat.h>
#include <utility>
#include <vector>

namespace zor::fs {

class CopyData {
public:
    /// Told of each piece that was copied; what is not 0, a -errno, ends the copy.
    using Copied = std::function<int(std::uint64_t bytes)>;
    explicit CopyData(platform::Disk& disk, Copied copied = {}) : disk_(disk), copied_(std::move(copied)) {}

    /// Both files are open at their beginning, `to` is new. `status` is of `from`: not more than its size is copied,
    /// however fast the file grows; where the data is shared, the whole file is. 0 or -errno.
    int copy(int from, int to, const struct stat& status);

private:
    int copyRuns(int from, int to, off_t size);
    /// The bytes copied, fewer at the end of the file; or -errno.
    off_t copyRun(int from, int to, off_t bytes);
    int extend(int from, int to, off_t size);
    [[nodiscard]] int tell(off_t bytes) const { return copied_ ? copied_(static_cast<std::uint64_t>(bytes)) : 0; }

    platform::Disk& disk_;
    const Copied copied_;
    bool cloneRefused_ = false;
    bool kernelCopyRefused_ = false;
    std::vector<std::uint8_t> buffer_;
};

} // namespace zor::fs
