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

OpenResult openDeathRow(int top) {
    const OpenResult outer = openClosed(top, deathRowOuter);
    return outer ? openClosed(outer->get(), deathRowInner) : OpenResult(outer.error());
}

OpenResult openOrMakeDeathRow(platform::Disk& disk, int top) {
    if (const int failed = makeIfMissing(disk, top, deathRowOuter))
        return Errno(failed);
    const OpenResult outer = openClosed(top, deathRowOuter);
    if (!outer)
        return outer.error();
    if (const int failed = makeIfMissing(disk, outer->get(), deathRowInner))
        return Errno(failed);
    return openClosed(outer->get(), deathRowInner);
}

void removeEmptyDeathRow(platform::Disk& disk, int top) {
    if (const OpenResult outer = openClosed(top, deathRowOuter))
        if (const int removed = disk.removeDirectory(outer->get(), deathRowInner); removed == 0 || removed == -ENOENT)
            (void)disk.removeDirectory(top, deathRowOuter);
}

} // namespace zor::fs
