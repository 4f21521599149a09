// SPDX-License-Identifier: Apache-2.0
#include "fs/TreeWalker.h"

#include "fs/ItemStatus.h"
#include "os/Openat2.h"

#include <cerrno>
#include <dirent.h>
#include <fcntl.h>

namespace zor::fs {

using platform::FileDescriptor;

namespace {

constexpr int directoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW;
/// How often a name may change between directory and something else under our hands before it counts as unreadable.
constexpr int changesMax = 16;

WalkEntryKind kindOf(mode_t mode) {
    if (S_ISREG(mode))
        return WalkEntryKind::file;
    return S_ISLNK(mode) ? WalkEntryKind::symbolicLink : WalkEntryKind::other;
}

} // namespace

std::string WalkEntry::path() const {
    if (depth == 0)
        return {};
    // At its end a directory is still the stack's deepest level.
    if (depth < stack->depth())
        return stack->path();
    return stack->path().empty() ? std::string(name) : stack->path() + '/' + name;
}

Errno TreeWalker::walk(int parent, const char* name, const Visitor& visitor) {
    stack_.clear();
    visitor_ = &visitor;
    rootParent_ = parent;
    rootName_ = name;
    rootError_ = Errno();
    vanishedDirectories_ = 0;
    WalkStep step = visitRoot();
    while (step != WalkStep::stop && !stack_.empty()) {
        if (const BulkDirectoryRead::Entry* entry = stack_.reader().next())
            step = visitName({.parent = stack_.top(),
                              .name = entry->name,
                              .status = {.st_ino = entry->inode, .st_mode = static_cast<mode_t>(DTTOIF(entry->type))},
                              .depth = stack_.depth(),
                              .index = stack_.nextIndex(),
                              .stack = &stack_},
                             entry->type);
        else
            step = finishDirectory();
    }
    stack_.clear();
    return step == WalkStep::stop ? Errno(ECANCELED) : rootError_;
}

WalkStep TreeWalker::visitRoot() {
    WalkEntry entry{.parent = rootParent_, .name = rootName_.c_str(), .stack = &stack_};
    const Errno error = statusOfName(rootParent_, entry.name, entry.status);
    if (error == EXDEV)
        return visitMountPoint(entry);
    if (error) {
        rootError_ = error;
        return WalkStep::proceed;
    }
    device_ = entry.status.st_dev;
    return visitName(entry, S_ISDIR(entry.status.st_mode) ? DT_DIR : DT_UNKNOWN);
}

WalkStep TreeWalker::visitName(WalkEntry entry, unsigned char type) {
    for (int change = 0;; ++change) {
        if (type != DT_DIR) {
            if (type == DT_UNKNOWN || statusWanted_ == WalkStatus::full) {
                const Errno error = statusOfName(entry.parent, entry.name, entry.status);
                if (error == EXDEV)
                    return visitMountPoint(entry);
                if (error) {
                    entry.error = error;
                    if (entry.depth == 0)
                        rootError_ = entry.error;
                    else if (entry.error != ENOENT)
                        return (*visitor_)(entry);
                    return WalkStep::proceed;
                }
            }
            if (!S_ISDIR(entry.status.st_mode))
                return visitNonDirectory(entry);
        }
        auto directory = platform::openBeneathOnMount(entry.parent, entry.name, directoryFlags);
        if (directory)
            return visitDirectory(entry, std::move(*directory));
        const Errno error = directory.error();
        if ((error != ENOTDIR && error != ELOOP && error != ENOENT) || change == changesMax)
            return visitUnopened(entry, error);
        if (error == ENOENT && entry.depth > 0)
            return WalkStep::proceed;
        type = DT_UNKNOWN;
    }
}

WalkStep TreeWalker::visitNonDirectory(WalkEntry& entry) {
    entry.kind = kindOf(entry.status.st_mode);
    entry.onOtherFileSystem = statusWanted_ == WalkStatus::full && entry.status.st_dev != device_;
    return (*visitor_)(entry);
}

WalkStep TreeWalker::visitDirectory(WalkEntry& entry, FileDescriptor directory) {
    if (::fstat(directory.get(), &entry.status) != 0)
        return visitUnopened(entry, Errno::last());
    if (atRoot())
        device_ = entry.status.st_dev;
    if (entry.status.st_dev != device_)
        return visitMountPoint(entry);
    entry.kind = WalkEntryKind::directory;
    entry.directory = directory.get();
    const WalkStep step = (*visitor_)(entry);
    if (step == WalkStep::skip) {
        entry.kind = WalkEntryKind::directoryEnd;
        return (*visitor_)(entry);
    }
    if (step != WalkStep::stop)
        stack_.push(std::move(directory), device_, entry.status.st_ino, entry.name);
    return step;
}

WalkStep TreeWalker::visitMountPoint(WalkEntry& entry) {
    const mode_t type = entry.status.st_mode & S_IFMT;
    entry.status = {};
    entry.status.st_mode = type == 0 ? mode_t{S_IFDIR} : type;
    entry.onOtherFileSystem = true;
    if (!S_ISDIR(entry.status.st_mode)) {
        entry.kind = kindOf(type);
        return (*visitor_)(entry);
    }
    entry.kind = WalkEntryKind::directory;
    if (const WalkStep step = (*visitor_)(entry); step == WalkStep::stop)
        return step;
    entry.kind = WalkEntryKind::directoryEnd;
    return (*visitor_)(entry);
}

WalkStep TreeWalker::visitUnopened(WalkEntry& entry, Errno error) {
    if (error == EXDEV)
        return visitMountPoint(entry);
    if (statusWanted_ == WalkStatus::full && statusOfName(entry.parent, entry.name, entry.status) == ENOENT)
        return WalkStep::proceed;
    entry.kind = WalkEntryKind::directory;
    if (const WalkStep step = (*visitor_)(entry); step == WalkStep::stop)
        return step;
    entry.kind = WalkEntryKind::unreadableDirectory;
    entry.error = error;
    return (*visitor_)(entry);
}

WalkStep TreeWalker::finishDirectory() {
    std::size_t levelsLost = 0;
    if (!stack_.ensureParent(levelsLost)) {
        vanishedDirectories_ += levelsLost;
        return WalkStep::proceed;
    }
    const bool isRoot = stack_.depth() == 1;
    const std::string name = isRoot ? rootName_ : stack_.name();
    WalkEntry entry{.kind = WalkEntryKind::directoryEnd,
                    .parent = isRoot ? rootParent_ : stack_.parent(),
                    .name = name.c_str(),
                    .directory = stack_.top(),
                    .error = stack_.reader().error(),
                    .depth = stack_.depth() - 1,
                    .pass = stack_.pass(),
                    .stack = &stack_};
    entry.status.st_mode = S_IFDIR;
    if (statusWanted_ == WalkStatus::full && ::fstat(entry.directory, &entry.status) != 0)
        entry.error = Errno::last();
    if (entry.error)
        entry.kind = WalkEntryKind::unreadableDirectory;
    const WalkStep step = (*visitor_)(entry);
    if (step == WalkStep::again && entry.kind == WalkEntryKind::directoryEnd)
        stack_.rewind();
    else if (step != WalkStep::stop)
        stack_.pop();
    return step;
}

} // namespace zor::fs
