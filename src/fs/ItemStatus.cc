// SPDX-License-Identifier: Apache-2.0
#include "fs/ItemStatus.h"

#include <array>
#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
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

namespace {

/// Newer than the headers; a kernel that does not know it says so in the answer's mask.
constexpr unsigned uniqueMountWanted = 0x4000;
constexpr int remembered = AT_STATX_DONT_SYNC | AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT;

timespec timeOf(const statx_timestamp& time) {
    return {.tv_sec = time.tv_sec, .tv_nsec = time.tv_nsec};
}

struct stat statusIn(const struct statx& found) {
    struct stat status{};
    status.st_dev = ::makedev(found.stx_dev_major, found.stx_dev_minor);
    status.st_ino = found.stx_ino;
    status.st_mode = found.stx_mode;
    status.st_nlink = found.stx_nlink;
    status.st_uid = found.stx_uid;
    status.st_gid = found.stx_gid;
    status.st_rdev = ::makedev(found.stx_rdev_major, found.stx_rdev_minor);
    status.st_size = static_cast<off_t>(found.stx_size);
    status.st_blksize = static_cast<blksize_t>(found.stx_blksize);
    status.st_blocks = static_cast<blkcnt_t>(found.stx_blocks);
    status.st_atim = timeOf(found.stx_atime);
    status.st_mtim = timeOf(found.stx_mtime);
    status.st_ctim = timeOf(found.stx_ctime);
    return status;
}

} // namespace

Errno statusOfName(int directory, const char* name, struct stat& status) {
    struct statx found{};
    if (::statx(directory, name, remembered, STATX_BASIC_STATS, &found) != 0)
        return Errno::last();
    status = statusIn(found);
    // A directory that is open may be the root of a mount itself: "." leads nowhere else.
    const bool crossed = (found.stx_attributes & STATX_ATTR_MOUNT_ROOT) != 0 && std::strcmp(name, ".") != 0;
    return crossed ? Errno(EXDEV) : Errno();
}

Errno statusOfDescriptor(int descriptor, struct stat& status, MountIdentity& mount) {
    struct statx found{};
    if (::statx(descriptor, "", AT_EMPTY_PATH | remembered, STATX_BASIC_STATS | STATX_MNT_ID | uniqueMountWanted,
                &found) != 0)
        return Errno::last();
    status = statusIn(found);
    mount = {.mount = found.stx_mnt_id, .device = status.st_dev};
    return Errno();
}

std::uint64_t mountNumber(int descriptor) {
    struct statx found{};
    if (::statx(descriptor, "", AT_EMPTY_PATH | remembered, STATX_MNT_ID, &found) != 0)
        return 0;
    return found.stx_mnt_id;
}

bool isFreshDirectory(int directory) {
    struct stat status{};
    if (::fstat(directory, &status) != 0 || status.st_uid != ::geteuid() || (status.st_mode & 077) != 0)
        return false;
    std::array<std::byte, 1024> buffer;
    BulkDirectoryRead entries(directory, buffer);
    return !entries.seek(0) && entries.next() == nullptr && !entries.error();
}

} // namespace zor::fs
