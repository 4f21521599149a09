// SPDX-License-Identifier: Apache-2.0
#include "fs/BulkDirectoryRead.h"

#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace zor::fs {

BulkDirectoryRead::BulkDirectoryRead(int directory, std::span<std::byte> buffer)
    : directory_(directory), buffer_(buffer) {}

bool BulkDirectoryRead::fill() {
    long count = 0;
    do
        count = ::syscall(SYS_getdents64, directory_, buffer_.data(), buffer_.size());
    while (count < 0 && errno == EINTR);
    // A directory that is no longer linked anywhere answers ENOENT.
    if (count < 0 && errno != ENOENT)
        error_ = Errno::last();
    used_ = 0;
    filled_ = count > 0 ? static_cast<std::size_t>(count) : 0;
    return filled_ > 0;
}

const BulkDirectoryRead::Entry* BulkDirectoryRead::next() {
    constexpr std::size_t nameOffset = offsetof(dirent64, d_name);
    while (used_ < filled_ || (!error_ && fill())) {
        const auto* record = reinterpret_cast<const dirent64*>(buffer_.data() + used_);
        const std::size_t recordBytes = record->d_reclen;
        if (recordBytes <= nameOffset || recordBytes > filled_ - used_) {
            error_ = Errno(EIO);
            break;
        }
        used_ += recordBytes;
        position_ = record->d_off;
        const char* name = record->d_name;
        const std::size_t nameBytes = ::strnlen(name, recordBytes - nameOffset);
        if (nameBytes == recordBytes - nameOffset) {
            error_ = Errno(EIO);
            break;
        }
        if (name[0] == '.' && (nameBytes == 1 || (nameBytes == 2 && name[1] == '.')))
            continue;
        entry_ = {.name = name, .nameBytes = nameBytes, .inode = record->d_ino, .type = record->d_type};
        return &entry_;
    }
    filled_ = used_ = 0;
    return nullptr;
}

Errno BulkDirectoryRead::seek(off_t position) {
    filled_ = used_ = 0;
    error_ = Errno();
    position_ = position;
    if (::lseek(directory_, position, SEEK_SET) < 0)
        error_ = Errno::last();
    return error_;
}

} // namespace zor::fs
