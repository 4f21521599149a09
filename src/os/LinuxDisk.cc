// SPDX-License-Identifier: Apache-2.0
#include "os/LinuxDisk.h"

#include "base/BlockingScope.h"
#include "os/Openat2.h"

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

/// The call's result, or the negative errno; a call that a signal interrupted is made again.
template <typename Call>
auto checked(Call call) -> decltype(call()) {
    for (;;) {
        const auto result = call();
        if (result >= 0)
            return result;
        if (errno != EINTR)
            return -errno;
    }
}

} // namespace

LinuxDisk::LinuxDisk(Syncs syncs) : syncs_(syncs), ownershipCanChange_(::geteuid() == 0) {}

int LinuxDisk::makeDirectory(int directory, const char* name, mode_t mode) {
    return checked([&] { return ::mkdirat(directory, name, mode); });
}

int LinuxDisk::createFile(int directory, const char* name, mode_t mode) {
    return checked([&] { return ::openat(directory, name, O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode); });
}

int LinuxDisk::makeSymbolicLink(const char* target, int directory, const char* name) {
    return checked([&] { return ::symlinkat(target, directory, name); });
}

int LinuxDisk::makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) {
    return checked([&] { return ::linkat(fromDirectory, from, toDirectory, to, 0); });
}

int LinuxDisk::makeFifo(int directory, const char* name, mode_t mode) {
    return checked([&] { return ::mkfifoat(directory, name, mode); });
}

int LinuxDisk::rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) {
    return checked([&] { return ::renameat2(fromDirectory, from, toDirectory, to, flags); });
}

int LinuxDisk::unlinkFile(int directory, const char* name) {
    return checked([&] { return ::unlinkat(directory, name, 0); });
}

int LinuxDisk::removeDirectory(int directory, const char* name) {
    return checked([&] { return ::unlinkat(directory, name, AT_REMOVEDIR); });
}

int LinuxDisk::changeMode(int fd, mode_t mode) {
    int result = checked([&] { return ::fchmod(fd, mode); });
    if (result != -EBADF)
        return result;
    // An O_PATH descriptor. Kernels before 6.6 lack the call, and some sandboxes answer EPERM for a call unknown to
    // them.
    result = checked([&] { return static_cast<int>(::syscall(fchmodat2Number, fd, "", mode, AT_EMPTY_PATH)); });
    if (result != -ENOSYS && result != -EPERM)
        return result;
    char path[32];
    std::snprintf(path, sizeof path, "/proc/self/fd/%d", fd);
    return checked([&] { return ::chmod(path, mode); });
}

int LinuxDisk::changeOwner(int fd, uid_t uid, gid_t gid) {
    if (!ownershipCanChange_)
        return 0;
    return checked([&] { return ::fchownat(fd, "", uid, gid, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW); });
}

int LinuxDisk::changeOwnerOf(int directory, const char* name, uid_t uid, gid_t gid) {
    if (!ownershipCanChange_)
        return 0;
    return checked([&] { return ::fchownat(directory, name, uid, gid, AT_SYMLINK_NOFOLLOW); });
}

int LinuxDisk::setTimes(int fd, const timespec& access, const timespec& modification) {
    const timespec times[2] = {access, modification};
    return checked([&] { return ::utimensat(fd, "", times, AT_EMPTY_PATH); });
}

int LinuxDisk::setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) {
    const int set = checked([&] { return ::fsetxattr(fd, name, value.data(), value.size(), 0); });
    // One that was opened for its path alone is reached by the kernel's link to it.
    const std::string link = set == -EBADF && fd >= 0 ? "/proc/self/fd/" + std::to_string(fd) : "";
    return link.empty() ? set : checked([&] { return ::setxattr(link.c_str(), name, value.data(), value.size(), 0); });
}

int LinuxDisk::setInodeFlags(int fd, int flags) {
    return checked([&] { return ::ioctl(fd, FS_IOC_SETFLAGS, &flags); });
}

int LinuxDisk::write(int fd, std::span<const std::uint8_t> bytes) {
    while (!bytes.empty()) {
        const ssize_t written = checked([&] { return ::write(fd, bytes.data(), bytes.size()); });
        if (written < 0)
            return static_cast<int>(written);
        if (written == 0)
            return -EIO;
        bytes = bytes.subspan(static_cast<std::size_t>(written));
    }
    return 0;
}

int LinuxDisk::cloneData(int from, int to) {
    return checked([&] { return ::ioctl(to, FICLONE, from); });
}

ssize_t LinuxDisk::copyData(int from, int to, std::size_t bytesMax) {
    return checked([&] { return ::copy_file_range(from, nullptr, to, nullptr, bytesMax, 0); });
}

int LinuxDisk::sync(int fd) {
    if (syncs_ == Syncs::off)
        return 0;
    const BlockingScope scope;
    return checked([&] { return ::fsync(fd); });
}

int LinuxDisk::syncFileSystem(int fd) {
    if (syncs_ == Syncs::off)
        return 0;
    const BlockingScope scope;
    return checked([&] { return ::syncfs(fd); });
}

int LinuxDisk::orderData(int fd) {
    if (syncs_ == Syncs::off)
        return 0;
    const BlockingScope scope;
    constexpr unsigned whole = SYNC_FILE_RANGE_WAIT_BEFORE | SYNC_FILE_RANGE_WRITE | SYNC_FILE_RANGE_WAIT_AFTER;
    const int result = checked([&] { return ::sync_file_range(fd, 0, 0, whole); });
    return result == -ENOSYS ? checked([&] { return ::fdatasync(fd); }) : result;
}

ssize_t LinuxDisk::read(int fd, std::span<std::uint8_t> bytes) {
    return readOnce(fd, bytes);
}

bool LinuxDisk::hidesNames(int directory) {
    return platform::hidesNames(directory);
}

} // namespace zor::platform
