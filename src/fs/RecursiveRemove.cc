// SPDX-License-Identifier: Apache-2.0
// The removal of a tree.
//
// A second thread only empties: it unlinks what is no directory in open directories that the walk has come to, and
// looks at no error. The walk leaves those alone and reads the directory that holds them once more, when they have been
// emptied as far as that went; what stayed, and each directory itself, it removes as any other. So what is refused,
// repaired and told is the walk's alone, and told once; and only the walk opens anything by name.
#include "fs/Trees.h"

#include "fs/MountFences.h"
#include "fs/SharedWork.h"
#include "fs/TreeWalker.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cerrno>
#include <dirent.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <utility>
#include <vector>

namespace zor::fs {

namespace {

/// How often a directory is read again because names came into it, and a root that changes its kind is tried again.
constexpr unsigned passesMax = 64;

/// A second thread is for trees of more files than these.
constexpr std::size_t filesForOneThread = 1024;
/// Directories that it gets at a time.
constexpr std::size_t emptiedAtOnce = 4;

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
    /// Whether the walk comes to this directory later, when either thread has emptied it.
    bool isForLater(const WalkEntry& entry);
    bool handOn(const WalkEntry& entry);
    void unlinkFiles(const platform::FileDescriptor& directory);
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
    std::size_t unlinked_ = 0;
    /// By depth, of the directories of the current path: whether one in it has been handed on.
    std::vector<bool> hasHandedOn_;
    /// The walk is about to leave a directory that it comes to later.
    bool skipped_ = false;
    HandedOn<platform::FileDescriptor, emptiedAtOnce, emptiedAtOnce> emptied_{
        [this](const platform::FileDescriptor& directory) { unlinkFiles(directory); }};
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
        hasHandedOn_.resize(entry.depth + 1);
        hasHandedOn_[entry.depth] = false;
        skipped_ = isForLater(entry);
        return skipped_ ? WalkStep::skip : WalkStep::proceed;
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
    if (!result || result == ENOENT) {
        ++unlinked_;
        return WalkStep::proceed;
    }
    return result == EISDIR ? changed(entry, result) : failed(entry, result);
}

bool Remover::isForLater(const WalkEntry& entry) {
    // A directory that is read once more had some handed on, or is being filled by somebody else.
    if (unlinked_ < filesForOneThread || callbacks_.goOn || entry.depth == 0 || entry.stack->pass() != 1)
        return false;
    // The directory is read again only when nothing in it has been told of yet; from then on nothing in it is, until it
    // is read again.
    const std::size_t above = entry.depth - 1;
    const bool doomed = doomedDepth_ >= static_cast<long>(above);
    if (!doomed && handOn(entry))
        hasHandedOn_[above] = true;
    return hasHandedOn_[above];
}

bool Remover::handOn(const WalkEntry& entry) {
    platform::FileDescriptor directory(entry.directory < 0 ? -1 : ::fcntl(entry.directory, F_DUPFD_CLOEXEC, 0));
    if (!directory.valid())
        return false;
    emptied_.add(std::move(directory));
    return true;
}

void Remover::unlinkFiles(const platform::FileDescriptor& directory) {
    BulkDirectoryRead::Buffer buffer;
    BulkDirectoryRead entries(directory.get(), buffer);
    while (const BulkDirectoryRead::Entry* entry = entries.next())
        if (entry->type != DT_DIR && entry->type != DT_UNKNOWN)
            (void)disk_.unlinkFile(directory.get(), entry->name);
}

WalkStep Remover::removeDirectory(const WalkEntry& entry) {
    if (std::exchange(skipped_, false))
        return WalkStep::proceed;
    if (hasHandedOn_[entry.depth]) {
        hasHandedOn_[entry.depth] = false;
        emptied_.settle();
        if (entry.kind == WalkEntryKind::directoryEnd)
            return WalkStep::again;
    }
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
    if (entry.depth > 0 && hasHandedOn_[entry.depth - 1])
        return WalkStep::proceed; // the walk meets it again
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
