// SPDX-License-Identifier: Apache-2.0
// A Disk before another one that brings all calls to one place, which may refuse them, make them or watch them.
#pragma once

#include "os/FileDescriptor.h"
#include "platform/Disk.h"

#include <cerrno>
#include <fcntl.h>
#include <functional>

namespace zor::support {

enum class DiskCall : std::uint8_t {
    makeDirectory,
    createFile,
    makeSymbolicLink,
    makeHardLink,
    makeFifo,
    rename,
    unlinkFile,
    removeDirectory,
    changeMode,
    changeOwner,
    setTimes,
    setAttribute,
    setInodeFlags,
    write,
    cloneData,
    copyData,
    sync,
    syncFileSystem,
    orderData,
};

const char* nameOf(DiskCall call);

/// A call about to be made.
struct DiskCallInfo {
    DiskCall call = DiskCall::sync;
    /// The name it acts on, "FROM -> TO" for two, or empty for one on a descriptor.
    std::string subject;
    /// The directory of the (first) name, or the descriptor.
    int fd = -1;

    [[nodiscard]] std::string describe() const;
};

/// The findings of a loop over fault points or power cuts. An empty complaint is a pass.
struct LoopReport {
    /// Points or states that were judged.
    std::size_t examined = 0;
    std::string complaint;
};

class InterceptedDisk : public platform::Disk {
public:
    explicit InterceptedDisk(platform::Disk& inner) : inner_(inner) {}

    int makeDirectory(int at, const char* name, mode_t mode) override {
        return pass(DiskCall::makeDirectory, name, at, [&] { return inner_.makeDirectory(at, name, mode); });
    }
    int createFile(int at, const char* name, mode_t mode) override {
        return pass(DiskCall::createFile, name, at, [&] { return inner_.createFile(at, name, mode); });
    }
    int makeSymbolicLink(const char* target, int at, const char* name) override {
        return pass(DiskCall::makeSymbolicLink, name, at, [&] { return inner_.makeSymbolicLink(target, at, name); });
    }
    int makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) override {
        return pass(DiskCall::makeHardLink, std::string(from) + " -> " + to, fromDirectory,
                    [&] { return inner_.makeHardLink(fromDirectory, from, toDirectory, to); });
    }
    int makeFifo(int at, const char* name, mode_t mode) override {
        return pass(DiskCall::makeFifo, name, at, [&] { return inner_.makeFifo(at, name, mode); });
    }
    int rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) override {
        return pass(DiskCall::rename, std::string(from) + " -> " + to, fromDirectory,
                    [&] { return inner_.rename(fromDirectory, from, toDirectory, to, flags); });
    }
    int unlinkFile(int at, const char* name) override {
        return pass(DiskCall::unlinkFile, name, at, [&] { return inner_.unlinkFile(at, name); });
    }
    int removeDirectory(int at, const char* name) override {
        return pass(DiskCall::removeDirectory, name, at, [&] { return inner_.removeDirectory(at, name); });
    }
    int changeMode(int fd, mode_t mode) override {
        return pass(DiskCall::changeMode, "", fd, [&] { return inner_.changeMode(fd, mode); });
    }
    int changeOwner(int fd, uid_t uid, gid_t gid) override {
        return pass(DiskCall::changeOwner, "", fd, [&] { return inner_.changeOwner(fd, uid, gid); });
    }
    int changeOwnerOf(int at, const char* name, uid_t uid, gid_t gid) override {
        const platform::FileDescriptor item(::openat(at, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
        return item.valid() ? changeOwner(item.get(), uid, gid) : -errno;
    }
    int setTimes(int fd, const timespec& access, const timespec& modification) override {
        return pass(DiskCall::setTimes, "", fd, [&] { return inner_.setTimes(fd, access, modification); });
    }
    int setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) override {
        return pass(DiskCall::setAttribute, name, fd, [&] { return inner_.setAttribute(fd, name, value); });
    }
    int setInodeFlags(int fd, int flags) override {
        return pass(DiskCall::setInodeFlags, "", fd, [&] { return inner_.setInodeFlags(fd, flags); });
    }
    int write(int fd, std::span<const std::uint8_t> bytes) override {
        return pass(DiskCall::write, "", fd, [&] { return inner_.write(fd, bytes); });
    }
    int cloneData(int from, int to) override {
        return pass(DiskCall::cloneData, "", from, [&] { return inner_.cloneData(from, to); });
    }
    ssize_t copyData(int from, int to, std::size_t bytesMax) override {
        return intercept({DiskCall::copyData, "", from}, [&] { return inner_.copyData(from, to, bytesMax); });
    }
    int sync(int fd) override {
        return pass(DiskCall::sync, "", fd, [&] { return inner_.sync(fd); });
    }
    int syncFileSystem(int fd) override {
        return pass(DiskCall::syncFileSystem, "", fd, [&] { return inner_.syncFileSystem(fd); });
    }
    int orderData(int fd) override {
        return pass(DiskCall::orderData, "", fd, [&] { return inner_.orderData(fd); });
    }
    [[nodiscard]] ssize_t read(int fd, std::span<std::uint8_t> bytes) override { return inner_.read(fd, bytes); }
    [[nodiscard]] bool hidesNames(int directory) override { return inner_.hidesNames(directory); }

protected:
    /// `make` makes the call on the inner disk.
    using Make = std::function<ssize_t()>;
    virtual ssize_t intercept(const DiskCallInfo& info, const Make& make) = 0;
    [[nodiscard]] platform::Disk& inner() { return inner_; }

private:
    int pass(DiskCall call, std::string subject, int fd, const Make& make) {
        return static_cast<int>(intercept({call, std::move(subject), fd}, make));
    }

    platform::Disk& inner_;
};

} // namespace zor::support
