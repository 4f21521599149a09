// SPDX-License-Identifier: Apache-2.0
#include "os/LinuxDisk.h"

#include "base/Mutex.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <linux/fs.h>
#include <string>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace zor::platform {

namespace {

#ifndef SYS_fchmodat2
constexpr long fchmodat2Number = 452;
#else
constexpr long fchmodat2Number = SYS_fchmodat2;
#endif

/// A call that a signal interrupted is made again.
template <typename Call>
auto resultOf(Call call) -> ErrnoOr<decltype(call())> {
    for (;;) {
        const auto result = call();
        if (result >= 0)
            return result;
        if (errno != EINTR)
            return Errno::last();
    }
}

template <typename Call>
Errno made(Call call) {
    (void)TRY(resultOf(call));
    return Errno();
}

} // namespace

LinuxDisk::LinuxDisk(Syncs syncs) : syncs_(syncs), ownershipCanChange_(::geteuid() == 0) {}

Errno LinuxDisk::makeDirectory(int directory, const char* name, mode_t mode) {
    return made([&] { return ::mkdirat(directory, name, mode); });
}

ErrnoOr<FileDescriptor> LinuxDisk::createFile(int directory, const char* name, mode_t mode) {
    constexpr int flags = O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
    return FileDescriptor(TRY(resultOf([&] { return ::openat(directory, name, flags, mode); })));
}

Errno LinuxDisk::makeSymbolicLink(const char* target, int directory, const char* name) {
    return made([&] { return ::symlinkat(target, directory, name); });
}

Errno LinuxDisk::makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) {
    return made([&] { return ::linkat(fromDirectory, from, toDirectory, to, 0); });
}

Errno LinuxDisk::makeFifo(int directory, const char* name, mode_t mode) {
    return made([&] { return ::mkfifoat(directory, name, mode); });
}

Errno LinuxDisk::rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) {
    return made([&] { return ::renameat2(fromDirectory, from, toDirectory, to, flags); });
}

Errno LinuxDisk::unlinkFile(int directory, const char* name) {
    return made([&] { return ::unlinkat(directory, name, 0); });
}

Errno LinuxDisk::removeDirectory(int directory, const char* name) {
    return made([&] { return ::unlinkat(directory, name, AT_REMOVEDIR); });
}

Errno LinuxDisk::changeMode(int fd, mode_t mode) {
    Errno error = made([&] { return ::fchmod(fd, mode); });
    if (error != EBADF)
        return error;
    // An O_PATH descriptor. Kernels before 6.6 lack the call, and some sandboxes answer EPERM for a call unknown to
    // them.
    error = made([&] { return ::syscall(fchmodat2Number, fd, "", mode, AT_EMPTY_PATH); });
    if (error != ENOSYS && error != EPERM)
        return error;
    char path[32];
    std::snprintf(path, sizeof path, "/proc/self/fd/%d", fd);
    return made([&] { return ::chmod(path, mode); });
}

Errno LinuxDisk::changeOwner(int fd, uid_t uid, gid_t gid) {
    if (!ownershipCanChange_)
        return Errno();
    return made([&] { return ::fchownat(fd, "", uid, gid, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW); });
}

Errno LinuxDisk::changeOwnerOf(int directory, const char* name, uid_t uid, gid_t gid) {
    if (!ownershipCanChange_)
        return Errno();
    return made([&] { return ::fchownat(directory, name, uid, gid, AT_SYMLINK_NOFOLLOW); });
}

Errno LinuxDisk::setTimes(int fd, const timespec& access, const timespec& modification) {
    const timespec times[2] = {access, modification};
    return made([&] { return ::utimensat(fd, "", times, AT_EMPTY_PATH); });
}

Errno LinuxDisk::setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) {
    const Errno error = made([&] { return ::fsetxattr(fd, name, value.data(), value.size(), 0); });
    if (error != EBADF || fd < 0)
        return error;
    // One that was opened for its path alone is reached by the kernel's link to it.
    const std::string link = "/proc/self/fd/" + std::to_string(fd);
    return made([&] { return ::setxattr(link.c_str(), name, value.data(), value.size(), 0); });
}

Errno LinuxDisk::setInodeFlags(int fd, int flags) {
    return made([&] { return ::ioctl(fd, FS_IOC_SETFLAGS, &flags); });
}

Errno LinuxDisk::write(int fd, std::span<const std::uint8_t> bytes) {
    while (!bytes.empty()) {
        const ssize_t written = TRY(resultOf([&] { return ::write(fd, bytes.data(), bytes.size()); }));
        if (written == 0)
            return Errno(EIO);
        bytes = bytes.subspan(static_cast<std::size_t>(written));
    }
    return Errno();
}

Errno LinuxDisk::cloneData(int from, int to) {
    return made([&] { return ::ioctl(to, FICLONE, from); });
}

ErrnoOr<std::size_t> LinuxDisk::copyData(int from, int to, std::size_t bytesMax) {
    return static_cast<std::size_t>(
        TRY(resultOf([&] { return ::copy_file_range(from, nullptr, to, nullptr, bytesMax, 0); })));
}

Errno LinuxDisk::sync(int fd) {
    if (syncs_ == Syncs::off)
        return Errno();
    const BlockingScope scope;
    return made([&] { return ::fsync(fd); });
}

Errno LinuxDisk::syncFileSystem(int fd) {
    if (syncs_ == Syncs::off)
        return Errno();
    const BlockingScope scope;
    return made([&] { return ::syncfs(fd); });
}

Errno LinuxDisk::orderData(int fd) {
    if (syncs_ == Syncs::off)
        return Errno();
    const BlockingScope scope;
    constexpr unsigned whole = SYNC_FILE_RANGE_WAIT_BEFORE | SYNC_FILE_RANGE_WRITE | SYNC_FILE_RANGE_WAIT_AFTER;
    const Errno error = made([&] { return ::sync_file_range(fd, 0, 0, whole); });
    return error == ENOSYS ? made([&] { return ::fdatasync(fd); }) : error;
}

ErrnoOr<std::size_t> LinuxDisk::read(int fd, std::span<std::uint8_t> bytes) {
    return readOnce(fd, bytes);
}

bool LinuxDisk::hidesNames(int directory) {
    return platform::hidesNames(directory);
}

} // namespace zor::platform
