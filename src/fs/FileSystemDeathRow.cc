// SPDX-License-Identifier: Apache-2.0
#include "fs/FileSystemDeathRow.h"

#include "fs/Names.h"
#include "os/Openat2.h"

#include <cerrno>
#include <fcntl.h>
#include <unistd.h>

namespace zor::fs {

namespace {

constexpr mode_t closedMode = 0700;

/// A directory of the daemon's own that nobody else may enter.
OpenResult openClosed(int parent, const char* name) {
    auto opened = platform::openBeneathOnMount(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!opened && (opened.error() == ENOTDIR || opened.error() == ELOOP || opened.error() == EXDEV))
        return Errno(EPERM);
    if (!opened)
        return opened;
    struct stat status{};
    if (::fstat(opened->get(), &status) != 0)
        return Errno::last();
    if (status.st_uid != ::geteuid() || (status.st_mode & 0777) != closedMode)
        return Errno(EPERM);
    return opened;
}

int makeIfMissing(platform::Disk& disk, int parent, const char* name) {
    const int made = disk.makeDirectory(parent, name, closedMode);
    return made == -EEXIST ? 0 : -made;
}

OpenResult openInner(int top, const char* inner) {
    const OpenResult outer = openClosed(top, deathRowOuter);
    return outer ? openClosed(outer->get(), inner) : OpenResult(outer.error());
}

OpenResult openOrMakeInner(platform::Disk& disk, int top, const char* inner) {
    if (const int failed = makeIfMissing(disk, top, deathRowOuter))
        return Errno(failed);
    const OpenResult outer = openClosed(top, deathRowOuter);
    if (!outer)
        return outer.error();
    if (const int failed = makeIfMissing(disk, outer->get(), inner))
        return Errno(failed);
    return openClosed(outer->get(), inner);
}

} // namespace

ErrnoOr<MountTop> topOfMount(const PathResolver& resolver, const FileURL& url) {
    auto directory = resolver.openDirectoryPath(url);
    if (!directory)
        return directory.error();
    const auto mount = platform::mountIdOf(directory->get());
    if (!mount)
        return mount.error();
    FileURL top = url;
    while (top.path() != resolver.root().canonicalPath() && top.path() != "/") {
        const FileURL above = top.deletingLastPathComponent();
        auto opened = resolver.openDirectoryPath(above);
        if (!opened)
            return opened.error();
        const auto mountAbove = platform::mountIdOf(opened->get());
        if (!mountAbove || *mountAbove != *mount)
            break;
        top = above;
        directory = std::move(opened);
    }
    struct stat status{};
    if (::fstat(directory->get(), &status) != 0)
        return Errno::last();
    return MountTop{
        .url = std::move(top), .directory = std::move(*directory), .identity = {status.st_dev, status.st_ino}};
}

FileURL deathRowBelow(const FileURL& top) {
    return top.appendingDirectory(deathRowOuter).appendingDirectory(deathRowInner);
}

FileURL asideBelow(const FileURL& top) {
    return top.appendingDirectory(deathRowOuter).appendingDirectory(asideInner);
}

OpenResult openDeathRow(int top) {
    return openInner(top, deathRowInner);
}

OpenResult openAside(int top) {
    return openInner(top, asideInner);
}

OpenResult openOrMakeDeathRow(platform::Disk& disk, int top) {
    return openOrMakeInner(disk, top, deathRowInner);
}

OpenResult openOrMakeAside(platform::Disk& disk, int top) {
    return openOrMakeInner(disk, top, asideInner);
}

OpenResult openAsideOf(const PathResolver& resolver, const FileURL& item) {
    const FileURL aside = item.deletingLastPathComponent();
    const FileURL top = aside.deletingLastPathComponent().deletingLastPathComponent();
    if (asideBelow(top) != aside)
        return Errno(EINVAL);
    const auto opened = resolver.openDirectoryPath(top);
    return opened ? openAside(opened->get()) : OpenResult(opened.error());
}

void removeEmptyDeathRow(platform::Disk& disk, int top) {
    const OpenResult outer = openClosed(top, deathRowOuter);
    if (!outer)
        return;
    bool empty = true;
    for (const char* inner : {deathRowInner, asideInner}) {
        const int removed = disk.removeDirectory(outer->get(), inner);
        empty = empty && (removed == 0 || removed == -ENOENT);
    }
    if (empty)
        (void)disk.removeDirectory(top, deathRowOuter);
}

} // namespace zor::fs
