// SPDX-License-Identifier: Apache-2.0
// The removal of a tree.
#include "fs/Trees.h"

#include "fs/MountFences.h"
#include "fs/TreeWalker.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>

namespace zor::fs {

namespace {

/// How often a directory is read again because names came into it, and a root that changes its kind is tried again.
constexpr unsigned passesMax = 64;

/// Whether one of `unwanted` was set and all of them are cleared.
ErrnoOr<bool> clearInodeFlags(platform::Disk& disk, int fd, int unwanted) {
    int flags = 0;
    if (::ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0 && errno != ENOTTY && errno != EOPNOTSUPP && errno != ENOSYS)
        return Errno::last();
    if ((flags & unwanted) == 0)
        return false;
    TRY(disk.setInodeFlags(fd, flags & ~unwanted));
    return true;
}

class Remover {
public:
    Remover(platform::Disk& disk, const RemoveCallbacks& callbacks) : disk_(disk), callbacks_(callbacks) {}

    Errno remove(int directory, const char* name);

private:
    WalkStep visit(const WalkEntry& entry);
    WalkStep removeFile(const WalkEntry& entry);
    WalkStep removeDirectory(const WalkEntry& entry);
    WalkStep changed(const WalkEntry& entry, Errno error);
    WalkStep failed(const WalkEntry& entry, Errno error);
    bool makeParentMutable(const WalkEntry& entry);
    bool makeMutable(int directory, const std::string& path);
    [[nodiscard]] static bool stillNamed(const WalkEntry& entry);

    platform::Disk& disk_;
    const RemoveCallbacks& callbacks_;
    /// Why the root has to be looked at once more.
    Errno rootChanged_;
    /// The root is not what is to be removed.
    bool anotherMet_ = false;
    /// Directories of the current path up to this depth hold something that could not be removed; -1: none does.
    long doomedDepth_ = -1;
};

Errno Remover::remove(int directory, const char* name) {
    TreeWalker walker(WalkStatus::typeOnly);
    const TreeWalker::Visitor visitor = [this](const WalkEntry& entry) { return visit(entry); };
    for (unsigned pass = 1;; ++pass) {
        rootChanged_ = Errno();
        doomedDepth_ = -1;
        const Errno result = walker.walk(directory, name, visitor);
        if (anotherMet_)
            return Errno(ESTALE);
        if (result == ENOENT && pass > 1)
            return Errno();
        if (result || !rootChanged_)
            return result;
        if (pass == passesMax) {
            const RemoveFailure failure{.error = rootChanged_, .parent = directory, .name = name};
            callbacks_.failed(failure);
            return Errno();
        }
    }
}

WalkStep Remover::visit(const WalkEntry& entry) {
    if (callbacks_.goOn && !callbacks_.goOn())
        return WalkStep::stop;
    switch (entry.kind) {
    case WalkEntryKind::directory:
        anotherMet_ =
            entry.depth == 0 && entry.directory >= 0 && callbacks_.isMeant && !callbacks_.isMeant(entry.directory);
        if (anotherMet_)
            return WalkStep::stop;
        // The doomed names of this depth belong to a directory before this one.
        doomedDepth_ = std::min(doomedDepth_, static_cast<long>(entry.depth) - 1);
        return WalkStep::proceed;
    case WalkEntryKind::directoryEnd:
    case WalkEntryKind::unreadableDirectory:
        return removeDirectory(entry);
    default:
        return removeFile(entry);
    }
}

WalkStep Remover::removeFile(const WalkEntry& entry) {
    Errno result = disk_.unlinkFile(entry.parent, entry.name);
    if (result == EPERM && makeParentMutable(entry))
        result = disk_.unlinkFile(entry.parent, entry.name);
    if (!result || result == ENOENT)
        return WalkStep::proceed;
    return result == EISDIR ? changed(entry, result) : failed(entry, result);
}

WalkStep Remover::removeDirectory(const WalkEntry& entry) {
    Errno result = disk_.removeDirectory(entry.parent, entry.name);
    if (result == EPERM && makeParentMutable(entry))
        result = disk_.removeDirectory(entry.parent, entry.name);
    if (result == EPERM && entry.directory >= 0 && makeMutable(entry.directory, entry.path()))
        result = disk_.removeDirectory(entry.parent, entry.name);
    const bool doomed = doomedDepth_ >= static_cast<long>(entry.depth);
    doomedDepth_ = std::min(doomedDepth_, static_cast<long>(entry.depth) - 1);
    if (!result || result == ENOENT)
        return WalkStep::proceed;
    if (result == ENOTDIR)
        return changed(entry, result);
    if (result != ENOTEMPTY && result != EEXIST)
        return failed(entry, result);
    if (entry.directory >= 0 && !stillNamed(entry))
        return changed(entry, Errno(ENOTEMPTY));
    if (entry.kind == WalkEntryKind::directoryEnd && entry.directory >= 0 && !doomed && entry.pass < passesMax)
        return WalkStep::again;
    return failed(entry, entry.error ? entry.error : Errno(ENOTEMPTY));
}

/// Something else took the name meanwhile. Its directory, not being empty, is read again and finds it.
WalkStep Remover::changed(const WalkEntry& entry, Errno error) {
    if (entry.depth == 0)
        rootChanged_ = error;
    return WalkStep::proceed;
}

WalkStep Remover::failed(const WalkEntry& entry, Errno error) {
    callbacks_.failed({.path = entry.path(), .error = error, .parent = entry.parent, .name = entry.name});
    struct stat status{};
    const bool repaired = statusOfName(entry.parent, entry.name, status) == ENOENT;
    if (!repaired)
        doomedDepth_ = std::max(doomedDepth_, static_cast<long>(entry.depth) - 1);
    return WalkStep::proceed;
}

bool Remover::makeParentMutable(const WalkEntry& entry) {
    // The directory that holds the root is not ours to change.
    if (entry.depth == 0)
        return false;
    const std::string path = entry.path();
    const std::size_t slash = path.rfind('/');
    return makeMutable(entry.parent, slash == std::string::npos ? std::string() : path.substr(0, slash));
}

bool Remover::makeMutable(int directory, const std::string& path) {
    if (!clearInodeFlags(disk_, directory, FS_IMMUTABLE_FL | FS_APPEND_FL).value_or(false))
        return false;
    if (callbacks_.directoryMadeMutable)
        callbacks_.directoryMadeMutable(path);
    return true;
}

bool Remover::stillNamed(const WalkEntry& entry) {
    struct stat named{};
    struct stat opened{};
    return !statusOfName(entry.parent, entry.name, named) && ::fstat(entry.directory, &opened) == 0 &&
           named.st_dev == opened.st_dev && named.st_ino == opened.st_ino;
}

} // namespace

Errno removeTree(platform::Disk& disk, int directory, const char* name, const RemoveCallbacks& callbacks) {
    return Remover(disk, callbacks).remove(directory, name);
}

Errno removeTree(platform::Disk& disk, int directory, const char* name, const std::function<bool()>& goOn) {
    Errno firstError;
    RemoveCallbacks callbacks;
    callbacks.goOn = goOn;
    callbacks.failed = [&](const RemoveFailure& failure) {
        if (!firstError)
            firstError = failure.error;
    };
    TRY(removeTree(disk, directory, name, callbacks));
    return firstError;
}

ErrnoOr<bool> clearImmutable(platform::Disk& disk, int directory, const char* name) {
    // Only files and directories have inode flags; the same request to a device's driver could mean anything.
    struct stat status{};
    TRY(statusOfName(directory, name, status));
    if (!S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode))
        return false;
    const platform::FileDescriptor item =
        TRY(platform::openBeneathOnMount(directory, name, O_RDONLY | O_NONBLOCK | O_NOCTTY | O_NOFOLLOW));
    if (::fstat(item.get(), &status) != 0)
        return Errno::last();
    if (!S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode))
        return false;
    return clearInodeFlags(disk, item.get(), FS_IMMUTABLE_FL | FS_APPEND_FL);
}

} // namespace zor::fs
