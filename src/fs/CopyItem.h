// SPDX-License-Identifier: Apache-2.0
// One item copied: its attributes and its data.
#pragma once

#include "platform/Disk.h"
#include "platform/Errno.h"

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <utility>
#include <vector>

namespace zor::fs {

// Gives a copied file or directory what the source has besides its data: extended attributes, owner and group, mode,
// access control lists, times, in an order in which none undoes another. One thread.

class CopyAttributes {
public:
    explicit CopyAttributes(platform::Disk& disk);

    /// Both are open files or directories; `status` is of `from`, `mode` what the copy gets.
    Errno copy(int from, int to, const struct stat& status, mode_t mode);
    /// Owner, group, mode and times alone.
    Errno giveBasic(int to, const struct stat& status, mode_t mode);
    /// A new directory takes over the default access control list of the one it is made in, and its content would in
    /// turn.
    Errno dropInheritedDefaultAcl(int directory);

private:
    /// The names of the attributes of `file`, each followed by a NUL.
    Errno list(int file);
    Errno copyAttribute(int from, int to, const char* name);
    Errno dropInheritedAcl(int from, int to, mode_t mode);
    [[nodiscard]] bool skips(std::string_view name) const;
    [[nodiscard]] bool mayLack(std::string_view name, Errno error) const;

    platform::Disk& disk_;
    const bool isRoot_;
    std::vector<char> names_;
    std::vector<std::uint8_t> value_;
};

// Copies the data of regular files: shared where the file system can, else copied by the kernel, else read and written.
// Holes stay holes. Remembers what this pair of file systems refused. One thread.

class CopyData {
public:
    /// Told of each piece that was copied; an error ends the copy.
    using Copied = std::function<Errno(std::uint64_t bytes)>;
    explicit CopyData(platform::Disk& disk, Copied copied = {}) : disk_(disk), copied_(std::move(copied)) {}

    /// Both files are open at their beginning, `to` is new. `status` is of `from`: not more than its size is copied,
    /// however fast the file grows; where the data is shared, the whole file is.
    Errno copy(int from, int to, const struct stat& status);

private:
    Errno copyRuns(int from, int to, off_t size);
    /// The bytes copied, fewer at the end of the file.
    ErrnoOr<off_t> copyRun(int from, int to, off_t bytes);
    Errno extend(int from, int to, off_t size);
    Errno tell(off_t bytes) const { return copied_ ? copied_(static_cast<std::uint64_t>(bytes)) : Errno(); }

    platform::Disk& disk_;
    const Copied copied_;
    bool cloneRefused_ = false;
    bool kernelCopyRefused_ = false;
    std::vector<std::uint8_t> buffer_;
};

} // namespace zor::fs
