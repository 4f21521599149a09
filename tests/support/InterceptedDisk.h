// SPDX-License-Identifier: Apache-2.0
// A Disk before another one that brings all calls to one place, which may refuse them, make them or watch them.
#pragma once

#include "os/FileDescriptor.h"
#include "platform/Disk.h"
#include "platform/Errno.h"
#include "support/Files.h"

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

    Errno makeDirectory(int at, const char* name, mode_t mode) override {
        return pass(DiskCall::makeDirectory, name, at, [&] { return inner_.makeDirectory(at, name, mode); });
    }
    ErrnoOr<platform::FileDescriptor> createFile(int at, const char* name, mode_t mode) override {
        return passFor<platform::FileDescriptor>({DiskCall::createFile, name, at},
                                                 [&] { return inner_.createFile(at, name, mode); });
    }
    Errno makeSymbolicLink(const char* target, int at, const char* name) override {
        return pass(DiskCall::makeSymbolicLink, name, at, [&] { return inner_.makeSymbolicLink(target, at, name); });
    }
    Errno makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) override {
        return pass(DiskCall::makeHardLink, std::string(from) + " -> " + to, fromDirectory,
                    [&] { return inner_.makeHardLink(fromDirectory, from, toDirectory, to); });
    }
    Errno makeFifo(int at, const char* name, mode_t mode) override {
        return pass(DiskCall::makeFifo, name, at, [&] { return inner_.makeFifo(at, name, mode); });
    }
    Errno rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) override {
        return pass(DiskCall::rename, std::string(from) + " -> " + to, fromDirectory,
                    [&] { return inner_.rename(fromDirectory, from, toDirectory, to, flags); });
    }
    Errno unlinkFile(int at, const char* name) override {
        return pass(DiskCall::unlinkFile, name, at, [&] { return inner_.unlinkFile(at, name); });
    }
    Errno removeDirectory(int at, const char* name) override {
        return pass(DiskCall::removeDirectory, name, at, [&] { return inner_.removeDirectory(at, name); });
    }
    Errno changeMode(int fd, mode_t mode) override {
        return pass(DiskCall::changeMode, "", fd, [&] { return inner_.changeMode(fd, mode); });
    }
    Errno changeOwner(int fd, uid_t uid, gid_t gid) override {
        return pass(DiskCall::changeOwner, "", fd, [&] { return inner_.changeOwner(fd, uid, gid); });
    }
    Errno changeOwnerOf(int at, const char* name, uid_t uid, gid_t gid) override {
        const platform::FileDescriptor item(::openat(at, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
        return item.valid() ? changeOwner(item.get(), uid, gid) : Errno::last();
    }
    Errno setTimes(int fd, const timespec& access, const timespec& modification) override {
        return pass(DiskCall::setTimes, "", fd, [&] { return inner_.setTimes(fd, access, modification); });
    }
    Errno setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) override {
        return pass(DiskCall::setAttribute, name, fd, [&] { return inner_.setAttribute(fd, name, value); });
    }
    Errno setInodeFlags(int fd, int flags) override {
        return pass(DiskCall::setInodeFlags, "", fd, [&] { return inner_.setInodeFlags(fd, flags); });
    }
    Errno write(int fd, std::span<const std::uint8_t> bytes) override {
        return pass(DiskCall::write, "", fd, [&] { return inner_.write(fd, bytes); });
    }
    Errno cloneData(int from, int to) override {
        return pass(DiskCall::cloneData, "", from, [&] { return inner_.cloneData(from, to); });
    }
    ErrnoOr<std::size_t> copyData(int from, int to, std::size_t bytesMax) override {
        return passFor<std::size_t>({DiskCall::copyData, "", from},
                                    [&] { return inner_.copyData(from, to, bytesMax); });
    }
    Errno sync(int fd) override {
        return pass(DiskCall::sync, "", fd, [&] { return inner_.sync(fd); });
    }
    Errno syncFileSystem(int fd) override {
        return pass(DiskCall::syncFileSystem, "", fd, [&] { return inner_.syncFileSystem(fd); });
    }
    Errno orderData(int fd) override {
        return pass(DiskCall::orderData, "", fd, [&] { return inner_.orderData(fd); });
    }
    ErrnoOr<std::size_t> read(int fd, std::span<std::uint8_t> bytes) override { return inner_.read(fd, bytes); }
    [[nodiscard]] bool hidesNames(int directory) override { return inner_.hidesNames(directory); }

protected:
    /// `make` makes the call on the inner disk.
    using Make = std::function<Errno()>;
    virtual Errno intercept(const DiskCallInfo& info, const Make& make) = 0;
    [[nodiscard]] platform::Disk& inner() { return inner_; }

private:
    Errno pass(DiskCall call, std::string subject, int fd, const Make& make) {
        return intercept({call, std::move(subject), fd}, make);
    }
    template <typename T, typename Call>
    ErrnoOr<T> passFor(const DiskCallInfo& info, const Call& call) {
        ErrnoOr<T> result = Errno(ECANCELED);
        TRY(intercept(info, [&] {
            result = call();
            return result ? Errno() : result.error();
        }));
        return result;
    }

    platform::Disk& inner_;
};

/// Puts another item in the place of each new one of a kind, before anybody can open it.
class ExchangingDisk final : public InterceptedDisk {
public:
    /// `prefix`: how the new one's name begins.
    ExchangingDisk(Disk& inner, DiskCall call, std::string other, std::string prefix = "")
        : InterceptedDisk(inner), call_(call), other_(std::move(other)), prefix_(std::move(prefix)) {}

private:
    Errno intercept(const DiskCallInfo& info, const Make& make) override {
        const Errno made = make();
        if (info.call == call_ && info.subject.starts_with(prefix_))
            checked(::renameat2(AT_FDCWD, other_.c_str(), info.fd, info.subject.c_str(), RENAME_EXCHANGE), other_);
        return made;
    }

    const DiskCall call_;
    const std::string other_;
    const std::string prefix_;
};

} // namespace zor::support
