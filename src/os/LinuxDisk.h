// SPDX-License-Identifier: Apache-2.0
// The real make of Disk: each method is its system call, nothing kept between calls. Any thread.
#pragma once

#include "platform/Disk.h"

namespace zor::platform {

/// `off` is for throw-away roots: what was acknowledged may then be lost with the power.
enum class Syncs { on, off };

class LinuxDisk final : public Disk {
public:
    explicit LinuxDisk(Syncs syncs = Syncs::on);

    int makeDirectory(int directory, const char* name, mode_t mode) override;
    int createFile(int directory, const char* name, mode_t mode) override;
    int makeSymbolicLink(const char* target, int directory, const char* name) override;
    int makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) override;
    int makeFifo(int directory, const char* name, mode_t mode) override;
    int rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) override;
    int unlinkFile(int directory, const char* name) override;
    int removeDirectory(int directory, const char* name) override;

    int changeMode(int fd, mode_t mode) override;
    /// These two do nothing, with success, when the process is not root.
    int changeOwner(int fd, uid_t uid, gid_t gid) override;
    int changeOwnerOf(int directory, const char* name, uid_t uid, gid_t gid) override;
    int setTimes(int fd, const timespec& access, const timespec& modification) override;
    int setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) override;
    int setInodeFlags(int fd, int flags) override;

    int write(int fd, std::span<const std::uint8_t> bytes) override;
    int cloneData(int from, int to) override;
    ssize_t copyData(int from, int to, std::size_t bytesMax) override;

    int sync(int fd) override;
    int syncFileSystem(int fd) override;
    int orderData(int fd) override;

    [[nodiscard]] ssize_t read(int fd, std::span<std::uint8_t> bytes) override;
    [[nodiscard]] bool hidesNames(int directory) override;

private:
    const Syncs syncs_;
    const bool ownershipCanChange_;
};

} // namespace zor::platform
