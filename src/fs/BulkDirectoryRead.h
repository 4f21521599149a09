// SPDX-License-Identifier: Apache-2.0
// The entries of an open directory, as many at a time as fit a caller's buffer (getdents64).
//
// "." and ".." are left out. A directory that was removed meanwhile has no entries; that is no error. Entries that
// others add or remove while it is read may be seen or not; every other entry is seen exactly once. The descriptor and
// the buffer belong to the caller and have to outlive the reader. One thread at a time.
#pragma once

#include "platform/Errno.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>
#include <sys/types.h>

namespace zor::fs {

class BulkDirectoryRead {
public:
    static constexpr std::size_t bufferBytes = 32768;
    using Buffer = std::array<std::byte, bufferBytes>;

    struct Entry {
        /// NUL-terminated, one component; valid until the call of next() after the one that gave it.
        const char* name = nullptr;
        std::size_t nameBytes = 0;
        ino_t inode = 0;
        /// A DT_ value of <dirent.h>; DT_UNKNOWN where the file system does not say.
        unsigned char type = 0;
    };

    /// Reads on from the descriptor's offset. The buffer holds at least one entry of any name: 512 bytes or more.
    BulkDirectoryRead(int directory, std::span<std::byte> buffer);

    /// The next entry, or nullptr at the end and after an error.
    const Entry* next();
    /// The error of the read that ended the entries.
    [[nodiscard]] Errno error() const { return error_; }
    /// The place at which the entry after the last one given begins. Good for seek(), on this or another descriptor of
    /// the same directory.
    [[nodiscard]] off_t position() const { return position_; }
    /// Goes on at a position; 0 is the beginning.
    Errno seek(off_t position);

private:
    bool fill();

    int directory_;
    std::span<std::byte> buffer_;
    std::size_t filled_ = 0;
    std::size_t used_ = 0;
    off_t position_ = 0;
    Errno error_;
    Entry entry_;
};

} // namespace zor::fs
