// SPDX-License-Identifier: Apache-2.0
// Disk on the real system: each method is its system call, nothing kept between calls. Any thread.
#pragma once

#include "os/FileDescriptor.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

namespace zor::platform {

/// `off` is for throw-away roots: what was acknowledged may then be lost with the power.
enum class Syncs { on, off };

class LinuxDisk final : public Disk {
public:
    explicit LinuxDisk(Syncs syncs = Syncs::on);

    Errno makeDirectory(int directory, const char* name, mode_t mode) override;
    ErrnoOr<FileDescriptor> createFile(int directory, const char* name, mode_t mode) override;
    Errno makeSymbolicLink(const char* target, int directory, const char* name) override;
    Errno makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) override;
    Errno makeFifo(int directory, const char* name, mode_t mode) override;
    Errno rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) override;
    Errno unlinkFile(int directory, const char* name) override;
    Errno removeDirectory(int directory, const char* name) override;

    Errno changeMode(int fd, mode_t mode) override;
    /// These two do nothing, with success, when the process is not root.
    Errno changeOwner(int fd, uid_t uid, gid_t gid) override;
    Errno changeOwnerOf(int directory, const char* name, uid_t uid, gid_t gid) override;
    Errno setTimes(int fd, const timespec& access, const timespec& modification) override;
    Errno setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) override;
    Errno setInodeFlags(int fd, int flags) override;

    Errno write(int fd, std::span<const std::uint8_t> bytes) override;
    Errno cloneData(int from, int to) override;
    ErrnoOr<std::size_t> copyData(int from, int to, std::size_t bytesMax) override;

    Errno sync(int fd) override;
    Errno syncFileSystem(int fd) override;
    Errno orderData(int fd) override;

    ErrnoOr<std::size_t> read(int fd, std::span<std::uint8_t> bytes) override;
    [[nodiscard]] bool hidesNames(int directory) override;

private:
    const Syncs syncs_;
    const bool ownershipCanChange_;
};

} // namespace zor::platform
