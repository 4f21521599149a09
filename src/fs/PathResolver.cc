// SPDX-License-Identifier: Apache-2.0
#include "fs/PathResolver.h"

#include "platform/linux/Openat2.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/sysmacros.h>

namespace zor::fs {

using platform::openBeneath;

std::expected<DirectoryId, int> directoryIdOf(int directory) {
    struct statx status{};
    if (::statx(directory, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC, STATX_INO | STATX_MNT_ID, &status) != 0)
        return std::unexpected(errno);
    return DirectoryId{.device = makedev(status.stx_dev_major, status.stx_dev_minor),
                       .inode = status.stx_ino,
                       .mount = status.stx_mnt_id};
}

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

OpenResult PathResolver::openItem(const FileURL& url, int flags) const {
    const char* path = relative(url);
    if (!path)
        return std::unexpected(EXDEV);
    return openBeneath(root_.descriptor(), path, flags | O_NOFOLLOW);
}

OpenResult PathResolver::openDirectory(const FileURL& url) const {
    return openItem(url, O_RDONLY | O_DIRECTORY);
}

OpenResult PathResolver::openDirectoryPath(const FileURL& url) const {
    return openItem(url, O_PATH | O_DIRECTORY);
}

std::expected<ParentAndName, int> PathResolver::openParent(const FileURL& url) const {
    OpenResult directory = openDirectoryPath(url.deletingLastPathComponent());
    if (!directory)
        return std::unexpected(directory.error());
    return ParentAndName{std::move(*directory), std::string(url.lastPathComponent())};
}

int PathResolver::status(const FileURL& url, struct stat& status) const {
    const auto parent = openParent(url);
    if (!parent)
        return parent.error();
    return ::fstatat(parent->directory.get(), parent->name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
}

OpenResult makeDirectories(platform::Disk& disk, int base, std::string_view relativePath, mode_t mode) {
    const std::string whole(relativePath.empty() ? "." : relativePath);
    OpenResult current = openBeneath(base, whole.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW);
    if (current || current.error() != ENOENT)
        return current;
    current = openBeneath(base, ".", O_PATH | O_DIRECTORY);
    for (std::size_t begin = 0; current && begin < relativePath.size();) {
        const std::size_t end = std::min(relativePath.find('/', begin), relativePath.size());
        const std::string component(relativePath.substr(begin, end - begin));
        begin = end + 1;
        if (component.empty())
            continue;
        OpenResult below = openBeneath(current->get(), component.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW);
        if (!below && below.error() == ENOENT) {
            const int made = disk.makeDirectory(current->get(), component.c_str(), mode);
            if (made < 0 && made != -EEXIST)
                return std::unexpected(-made);
            below = openBeneath(current->get(), component.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW);
        }
        current = std::move(below);
    }
    return current;
}

} // namespace zor::fs
