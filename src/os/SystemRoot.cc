// SPDX-License-Identifier: Apache-2.0
#include "os/SystemRoot.h"

#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <memory>
#include <string>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::platform {

namespace {

constexpr mode_t runtimeMode = 0755;

/// Makes the directory unless it is there, and opens it.
ErrnoOr<FileDescriptor> makeAndOpen(Disk& disk, int parent, const char* name) {
    const Errno made = disk.makeDirectory(parent, name, runtimeMode);
    if (made && made != EEXIST)
        return made;
    FileDescriptor opened = TRY(openBeneath(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW));
    // The process's umask does not decide who can reach the sockets.
    if (!made)
        TRY(disk.changeMode(opened.get(), runtimeMode));
    return opened;
}

} // namespace

ErrnoOr<SystemRoot> SystemRoot::open(const std::string& directory) {
    const std::unique_ptr<char, decltype(&std::free)> canonical(::realpath(directory.c_str(), nullptr), &std::free);
    if (!canonical)
        return Errno::last();
    SystemRoot root;
    root.canonicalPath_ = canonical.get();
    root.directory_.reset(::open(canonical.get(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!root.directory_.valid())
        return Errno::last();
    return root;
}

std::string SystemRoot::path(std::string_view systemPath) const {
    std::string result = isDeviceRoot() ? std::string() : canonicalPath_;
    if (systemPath.empty() || systemPath == "/")
        return isDeviceRoot() ? "/" : result;
    if (systemPath.front() != '/')
        result += '/';
    result += systemPath;
    return result;
}

Errno SystemRoot::makeRuntimeDirectory(Disk& disk) {
    const FileDescriptor parent = TRY(makeAndOpen(disk, directory_.get(), names::runParent));
    return adoptRuntimeDirectory(TRY(makeAndOpen(disk, parent.get(), names::runtimeName)));
}

Errno SystemRoot::openRuntimeDirectory() {
    return adoptRuntimeDirectory(TRY(openBeneath(directory_.get(), names::runtimeDirectory, O_RDONLY | O_DIRECTORY)));
}

Errno SystemRoot::adoptRuntimeDirectory(FileDescriptor directory) {
    struct stat status{};
    if (::fstat(directory.get(), &status) != 0)
        return Errno::last();
    if ((status.st_uid != 0 && status.st_uid != ::geteuid()) || (status.st_mode & (S_IWGRP | S_IWOTH)) != 0)
        return Errno(EPERM);
    runtimeDirectory_ = std::move(directory);
    return Errno();
}

namespace {
/// A process that can open the file can hold the lock and keep the daemon from starting.
constexpr mode_t lockMode = 0600;
/// A line of /proc/locks is about 60 bytes.
constexpr std::size_t lockListBytesMax = std::size_t{16} << 20;
/// Whether a line of the list is about a lock on that inode which its file's owner holds. "1: FLOCK  ADVISORY  WRITE
/// 4711 00:1c:12345 0 EOF". Stacked file systems give the device of a lower one, so the inode alone has to do; and
/// everybody can make one with that number somewhere, so the process counts too.
bool isOwnersLock(const std::string& line, const struct stat& file) {
    int process = 0;
    unsigned long long inode = 0;
    if (std::sscanf(line.c_str(), "%*d: FLOCK %*s WRITE %d %*x:%*x:%llu ", &process, &inode) != 2 ||
        inode != file.st_ino)
        return false;
    struct stat status{};
    return ::stat(("/proc/" + std::to_string(process)).c_str(), &status) == 0 && status.st_uid == file.st_uid;
}

} // namespace

ErrnoOr<DaemonLock> DaemonLock::take(const SystemRoot& root) {
    FileDescriptor file =
        TRY(openBeneath(root.runtimeDirectory(), names::lockFile, O_RDWR | O_CREAT | O_NONBLOCK, lockMode));
    struct stat status{};
    if (::fstat(file.get(), &status) != 0)
        return Errno::last();
    if (!S_ISREG(status.st_mode))
        return Errno(EINVAL);
    while (::flock(file.get(), LOCK_EX | LOCK_NB) != 0) {
        if (errno != EINTR)
            return Errno::last();
    }
    // For people who ask who holds it; nothing reads it.
    const std::string pid = std::to_string(::getpid()) + "\n";
    if (::ftruncate(file.get(), 0) == 0)
        (void)!::pwrite(file.get(), pid.data(), pid.size(), 0);
    return DaemonLock(std::move(file));
}

bool DaemonLock::isHeld(const SystemRoot& root) {
    struct stat status{};
    if (::fstatat(root.runtimeDirectory(), names::lockFile, &status, AT_SYMLINK_NOFOLLOW) != 0)
        return false;
    const FileDescriptor file(::open("/proc/locks", O_RDONLY | O_CLOEXEC));
    const auto locks = file.valid() ? readSmallFile(file.get(), lockListBytesMax) : Errno::last();
    if (!locks)
        return false;
    for (std::size_t begin = 0; begin < locks->size();) {
        const std::size_t end = std::min(locks->find('\n', begin), locks->size());
        if (isOwnersLock(locks->substr(begin, end - begin), status))
            return true;
        begin = end + 1;
    }
    return false;
}

} // namespace zor::platform
