// SPDX-License-Identifier: Apache-2.0
// A disk that cannot be changed: every call that would fails with EROFS, whatever a reader that shares code with the
// daemon does.
#pragma once

#include "os/HiddenNames.h"
#include "platform/Disk.h"

#include <cerrno>

namespace zor::check {

class ReadOnlyDisk final : public platform::Disk {
public:
    int makeDirectory(int, const char*, mode_t) override { return -EROFS; }
    int createFile(int, const char*, mode_t) override { return -EROFS; }
    int makeSymbolicLink(const char*, int, const char*) override { return -EROFS; }
    int makeHardLink(int, const char*, int, const char*) override { return -EROFS; }
    int makeFifo(int, const char*, mode_t) override { return -EROFS; }
    int rename(int, const char*, int, const char*, unsigned) override { return -EROFS; }
    int unlinkFile(int, const char*) override { return -EROFS; }
    int removeDirectory(int, const char*) override { return -EROFS; }
    int changeMode(int, mode_t) override { return -EROFS; }
    int changeOwner(int, uid_t, gid_t) override { return -EROFS; }
    int setTimes(int, const timespec&, const timespec&) override { return -EROFS; }
    int setAttribute(int, const char*, std::span<const std::uint8_t>) override { return -EROFS; }
    int setInodeFlags(int, int) override { return -EROFS; }
    int write(int, std::span<const std::uint8_t>) override { return -EROFS; }
    int cloneData(int, int) override { return -EROFS; }
    ssize_t copyData(int, int, std::size_t) override { return -EROFS; }
    int sync(int) override { return -EROFS; }
    int syncFileSystem(int) override { return -EROFS; }
    int orderData(int) override { return -EROFS; }
    [[nodiscard]] bool hidesNames(int directory) override { return platform::hidesNames(directory); }
};

} // namespace zor::check
