// SPDX-License-Identifier: Apache-2.0
#include "fs/FileSystemDeathRow.h"

#include "fs/Names.h"
#include "os/FileDescriptor.h"
#include "os/FileModes.h"
#include "platform/Errno.h"

#include <cerrno>
#include <fcntl.h>
#include <unistd.h>

namespace zor::fs {

namespace {

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
    if (status.st_uid != ::geteuid() || (status.st_mode & 0777) != platform::closedMode)
        return Errno(EPERM);
    return opened;
}

Errno makeIfMissing(platform::Disk& disk, int parent, const char* name) {
    const Errno made = disk.makeDirectory(parent, name, platform::closedMode);
    return made == EEXIST ? Errno() : made;
}

OpenResult openInner(int top, const char* inner) {
    return openClosed(TRY(openClosed(top, deathRowOuter)).get(), inner);
}

OpenResult openOrMakeInner(platform::Disk& disk, int top, const char* inner) {
    TRY(makeIfMissing(disk, top, deathRowOuter));
    const FileDescriptor outer = TRY(openClosed(top, deathRowOuter));
    TRY(makeIfMissing(disk, outer.get(), inner));
    return openClosed(outer.get(), inner);
}

} // namespace

ErrnoOr<MountTop> topOfMount(const PathResolver& resolver, const FileURL& url) {
    FileDescriptor directory = TRY(resolver.openDirectoryPath(url));
    const std::uint64_t mount = TRY(platform::mountIdOf(directory.get()));
    FileURL top = url;
    while (top.path() != resolver.root().canonicalPath() && top.path() != "/") {
        const FileURL above = top.deletingLastPathComponent();
        FileDescriptor opened = TRY(resolver.openDirectoryPath(above));
        const auto mountAbove = platform::mountIdOf(opened.get());
        if (!mountAbove || *mountAbove != mount)
            break;
        top = above;
        directory = std::move(opened);
    }
    struct stat status{};
    if (::fstat(directory.get(), &status) != 0)
        return Errno::last();
    return MountTop{
        .url = std::move(top), .directory = std::move(directory), .identity = {status.st_dev, status.st_ino}};
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
    return openAside(TRY(resolver.openDirectoryPath(top)).get());
}

void removeEmptyDeathRow(platform::Disk& disk, int top) {
    const OpenResult outer = openClosed(top, deathRowOuter);
    if (!outer)
        return;
    bool empty = true;
    for (const char* inner : {deathRowInner, asideInner}) {
        const Errno removed = disk.removeDirectory(outer->get(), inner);
        empty = empty && (!removed || removed == ENOENT);
    }
    if (empty)
        (void)disk.removeDirectory(top, deathRowOuter);
}

} // namespace zor::fs
