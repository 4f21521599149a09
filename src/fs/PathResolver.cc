// SPDX-License-Identifier: Apache-2.0
#include "fs/PathResolver.h"

#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/sysmacros.h>

namespace zor::fs {

using platform::openBeneath;

const char* PathResolver::relative(const FileURL& url) const {
    const std::string& root = root_.canonicalPath();
    const std::string& path = url.path();
    if (path.empty() || path[0] != '/')
        return nullptr;
    if (root == "/")
        return path.size() == 1 ? "." : path.c_str() + 1;
    if (path.compare(0, root.size(), root) != 0)
        return nullptr;
    if (path.size() == root.size())
        return ".";
    return path[root.size()] == '/' ? path.c_str() + root.size() + 1 : nullptr;
}

void PathResolver::fence(const FileURL& url, MountFence::Kind kind) const {
    const char* const path = relative(url);
    if (path && std::string_view(path) != ".")
        fences_.add(path, kind);
}

bool PathResolver::answers(const FileURL& url, MountFence::Asked asked) const {
    const char* const path = relative(url);
    MountFence* const fence = path ? fences_.around(path) : nullptr;
    const bool answered = !fence || fence->answers(asked);
    if (!answered)
        noteLeft(url, Errno(EHOSTDOWN));
    return answered;
}

void PathResolver::noteLeft(const FileURL& url, Errno error) const {
    if (left_ && (error == EXDEV || error == EHOSTDOWN))
        left_(url, error);
}

OpenResult PathResolver::openItem(const FileURL& url, int flags) const {
    const char* path = relative(url);
    if (!path)
        return Errno(EXDEV);
    MountFence* const fence = fences_.around(path);
    if (!fence)
        return openBeneath(root_.descriptor(), path, flags | O_NOFOLLOW);
    OpenResult opened = fence->open(path, flags | O_NOFOLLOW);
    if (!opened)
        noteLeft(url, opened.error());
    return opened;
}

OpenResult PathResolver::openDirectory(const FileURL& url) const {
    return openItem(url, O_RDONLY | O_DIRECTORY);
}

OpenResult PathResolver::openDirectoryPath(const FileURL& url) const {
    return openItem(url, O_PATH | O_DIRECTORY);
}

ErrnoOr<ParentAndName> PathResolver::openParent(const FileURL& url) const {
    return ParentAndName{TRY(openDirectoryPath(url.deletingLastPathComponent())), std::string(url.lastPathComponent())};
}

Errno PathResolver::status(const FileURL& url, struct stat& status) const {
    const char* path = relative(url);
    if (!path)
        return Errno(EXDEV);
    if (MountFence* const fence = fences_.around(path)) {
        const Errno error = fence->status(path, status);
        noteLeft(url, error);
        return error;
    }
    const ParentAndName parent = TRY(openParent(url));
    const int found = ::fstatat(parent.directory.get(), parent.name.c_str(), &status, AT_SYMLINK_NOFOLLOW);
    return found == 0 ? Errno() : Errno::last();
}

ErrnoOr<PathResolver::Way> PathResolver::wayTo(const FileURL& url) const {
    const char* const path = relative(url);
    if (!path)
        return Errno(EXDEV);
    MountFence* const fence = fences_.around(path);
    const std::string_view whole(path);
    const std::size_t own = fence ? fence->ownBytes(whole) : whole.size();
    if (!fence || (own == whole.size() && !fence->isHome()))
        return Way{.fence = {}, .base = root_.descriptor(), .path = path, .mounts = Mounts::crossed};
    OpenResult base = fence->open(std::string(whole.substr(0, own)).c_str(), O_PATH | O_DIRECTORY);
    if (!base) {
        noteLeft(url, base.error());
        return base.error();
    }
    const int descriptor = base->get();
    const std::string_view rest = whole.substr(own);
    const std::size_t begin = rest.find_first_not_of('/');
    return Way{.fence = std::move(*base),
               .base = descriptor,
               .path = begin == rest.npos ? "." : std::string(rest.substr(begin)),
               .mounts = Mounts::left};
}

OpenResult openBelow(int base, const char* path, int flags, Mounts mounts) {
    return mounts == Mounts::crossed ? openBeneath(base, path, flags) : platform::openBeneathOnMount(base, path, flags);
}

OpenResult makeDirectories(platform::Disk& disk, int base, std::string_view relativePath, mode_t mode, Mounts mounts) {
    constexpr int flags = O_PATH | O_DIRECTORY | O_NOFOLLOW;
    const std::string whole(relativePath.empty() ? "." : relativePath);
    OpenResult current = openBelow(base, whole.c_str(), flags, mounts);
    if (current || current.error() != ENOENT)
        return current;
    current = openBeneath(base, ".", O_PATH | O_DIRECTORY);
    for (std::size_t begin = 0; current && begin < relativePath.size();) {
        const std::size_t end = std::min(relativePath.find('/', begin), relativePath.size());
        const std::string component(relativePath.substr(begin, end - begin));
        begin = end + 1;
        if (component.empty())
            continue;
        OpenResult below = openBelow(current->get(), component.c_str(), flags, mounts);
        if (!below && below.error() == ENOENT) {
            const Errno made = disk.makeDirectory(current->get(), component.c_str(), mode);
            if (made && made != EEXIST)
                return made;
            below = openBelow(current->get(), component.c_str(), flags, mounts);
        }
        current = std::move(below);
    }
    return current;
}

std::optional<FileURL> hiddenBy(const PathResolver& resolver, platform::Disk& disk, const FileURL& url) {
    FileURL place = url;
    for (;;) {
        const auto opened = resolver.openDirectoryPath(place);
        if (opened)
            return disk.hidesNames(opened->get()) ? std::optional(std::move(place)) : std::nullopt;
        if (opened.error() != ENOENT)
            return std::nullopt;
        FileURL parent = place.deletingLastPathComponent();
        if (parent == place)
            return std::nullopt;
        place = std::move(parent);
    }
}

bool hidesNamesBelow(platform::Disk& disk, int directory, const char* name) {
    const auto below = platform::openBeneathOnMount(directory, name, O_PATH | O_DIRECTORY | O_NOFOLLOW);
    return below && disk.hidesNames(below->get());
}

} // namespace zor::fs
