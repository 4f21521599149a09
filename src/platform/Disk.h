// SPDX-License-Identifier: Apache-2.0
// Every call of the daemon that changes or syncs the disk goes through this interface, one method a system call.
//
// That is what makes crash safety testable: the real make passes each call on, a counting make fails it or ends the
// process at the N-th, a recording make keeps a log from which the states that a power cut may leave are built. Calls
// that only look (openat2, fstat, getdents) change nothing and are made directly, but for those on whose failure a loss
// may hang.
//
// Calls act on descriptors or on one name (never a path) inside an open directory; nothing here follows a link in the
// last component. Each says how it failed by an Errno, alone or in the place of its value. Any thread.
#pragma once

#include "platform/Errno.h"

#include <cstddef>
#include <cstdint>
#include <ctime>
#include <span>
#include <string_view>
#include <sys/types.h>

namespace zor::platform {

class FileDescriptor;

class Disk {
public:
    virtual ~Disk() = default;

    // Names.
    virtual Errno makeDirectory(int directory, const char* name, mode_t mode) = 0;
    /// A new regular file, opened for reading and writing: O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC.
    virtual ErrnoOr<FileDescriptor> createFile(int directory, const char* name, mode_t mode) = 0;
    virtual Errno makeSymbolicLink(const char* target, int directory, const char* name) = 0;
    virtual Errno makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) = 0;
    virtual Errno makeFifo(int directory, const char* name, mode_t mode) = 0;
    /// `flags` as renameat2's: 0 or RENAME_NOREPLACE or RENAME_EXCHANGE.
    virtual Errno rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) = 0;
    virtual Errno unlinkFile(int directory, const char* name) = 0;
    virtual Errno removeDirectory(int directory, const char* name) = 0;

    // Inodes. `fd` may be an O_PATH descriptor for changeMode, changeOwner and setAttribute.
    virtual Errno changeMode(int fd, mode_t mode) = 0;
    virtual Errno changeOwner(int fd, uid_t uid, gid_t gid) = 0;
    /// The same of a name, for a directory in which nobody else can name anything.
    virtual Errno changeOwnerOf(int directory, const char* name, uid_t uid, gid_t gid) = 0;
    virtual Errno setTimes(int fd, const timespec& access, const timespec& modification) = 0;
    virtual Errno setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) = 0;
    /// The inode flags of FS_IOC_SETFLAGS (FS_IMMUTABLE_FL and its kin).
    virtual Errno setInodeFlags(int fd, int flags) = 0;

    // Data.
    /// Writes all of `bytes` at the descriptor's offset, or fails.
    virtual Errno write(int fd, std::span<const std::uint8_t> bytes) = 0;
    /// Makes `to`, empty and new, share all data of `from` (FICLONE); EOPNOTSUPP, EXDEV, EINVAL where that cannot
    /// be.
    virtual Errno cloneData(int from, int to) = 0;
    /// Copies up to `bytesMax` at both offsets (copy_file_range); the count copied, 0 at the end.
    virtual ErrnoOr<std::size_t> copyData(int from, int to, std::size_t bytesMax) = 0;

    // Syncs.
    /// The file's data and everything needed to reach it through its inode; for a directory, its entries.
    virtual Errno sync(int fd) = 0;
    /// Everything of the file system that `fd` lies on.
    virtual Errno syncFileSystem(int fd) = 0;
    /// Writes the file's data out and waits, so that on a file system with an ordered journal no later change can
    /// become durable before it. Commits nothing by itself.
    virtual Errno orderData(int fd) = 0;

    // Looking. Changes nothing that lasts.
    /// At the descriptor's offset; 0 at the end.
    virtual ErrnoOr<std::size_t> read(int fd, std::span<std::uint8_t> bytes) = 0;
    /// Asks by a call that could change something. Whether an encryption whose key is away hides what is in the
    /// directory: nothing that is not found there is known to be missing, and no name that is listed is one.
    [[nodiscard]] virtual bool hidesNames(int directory) = 0;
};

} // namespace zor::platform
