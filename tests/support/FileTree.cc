// SPDX-License-Identifier: Apache-2.0
#include "support/FileTree.h"

#include "support/Files.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <ftw.h>
#include <functional>
#include <string_view>
#include <sys/xattr.h>
#include <unistd.h>

namespace zor::support {

using platform::FileDescriptor;

namespace {

std::map<std::string, Bytes> readAttributes(int fd) {
    std::map<std::string, Bytes> attributes;
    char names[4096];
    const ssize_t length = ::flistxattr(fd, names, sizeof names);
    if (length < 0 && errno == EOPNOTSUPP)
        return attributes;
    checked(length, "flistxattr");
    for (ssize_t at = 0; at < length;) {
        const std::string name(names + at);
        at += static_cast<ssize_t>(name.size()) + 1;
        // Labels and access lists are the machine's, not the daemon's.
        if (!name.starts_with("user.") && !name.starts_with("trusted."))
            continue;
        Bytes value(4096);
        value.resize(checked(::fgetxattr(fd, name.c_str(), value.data(), value.size()), "fgetxattr " + name));
        attributes.emplace(name, std::move(value));
    }
    return attributes;
}

std::string joined(const std::string& path, const std::string& name) {
    return path.empty() ? name : path + "/" + name;
}

/// Contents are told apart by length and hash: enough for a comparison, short enough for a message.
std::string digest(const Bytes& bytes) {
    const std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
    return std::to_string(bytes.size()) + ":" + std::to_string(std::hash<std::string_view>{}(text));
}

void materialiseItem(const Inode& inode, int parent, const std::string& path) {
    const std::string text(inode.content.begin(), inode.content.end());
    if (S_ISDIR(inode.mode))
        makeDirectory(parent, path, 0700);
    else if (S_ISREG(inode.mode))
        makeFile(parent, path, text, 0600);
    else if (S_ISLNK(inode.mode))
        makeLink(parent, path, text);
    else
        checked(::mknodat(parent, path.c_str(), inode.mode, 0), "mknod " + path);
    for (const auto& [name, value] : inode.attributes) {
        const FileDescriptor fd(checked(::openat(parent, path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC), path));
        checked(::fsetxattr(fd.get(), name.c_str(), value.data(), value.size(), 0),
                "fsetxattr " + name + " of " + path);
    }
    if (::geteuid() == 0)
        checked(::fchownat(parent, path.c_str(), inode.uid, inode.gid, AT_SYMLINK_NOFOLLOW), "chown " + path);
}

/// Its status, itself where it is a link.
struct stat statusOf(int directory, const std::string& name) {
    struct stat status = {};
    checked(::fstatat(directory, name.c_str(), &status, AT_SYMLINK_NOFOLLOW), "stat " + name);
    return status;
}

} // namespace

InodeId FileTree::resolve(std::string_view path) const {
    InodeId id = rootId;
    while (!path.empty()) {
        const std::size_t slash = std::min(path.find('/'), path.size());
        const auto& entries = inodes.at(id).entries;
        const auto entry = entries.find(std::string(path.substr(0, slash)));
        if (entry == entries.end())
            return 0;
        id = entry->second;
        path.remove_prefix(std::min(slash + 1, path.size()));
    }
    return id;
}

std::string FileTree::describe() const {
    std::map<std::string, std::string> lines;
    std::map<InodeId, std::string> names;
    std::vector<std::pair<std::string, InodeId>> pending = {{"", rootId}};
    while (!pending.empty()) {
        const auto [path, id] = pending.back();
        pending.pop_back();
        const Inode& inode = inodes.at(id);
        std::string line(64, '\0');
        line.resize(std::snprintf(line.data(), line.size(), "%06o %u:%u", inode.mode, inode.uid, inode.gid));
        if (!inode.isDirectory())
            line += " " + digest(inode.content);
        for (const auto& [name, value] : inode.attributes)
            line += " " + name + "=" + digest(value);
        const auto [first, isNew] = names.emplace(id, path);
        if (!isNew)
            line += " also " + first->second;
        lines.emplace(path, line);
        if (!isNew)
            continue;
        // Pushed backwards, so that the first name of an inode is the same one in equal trees.
        for (auto entry = inode.entries.rbegin(); entry != inode.entries.rend(); ++entry)
            pending.emplace_back(joined(path, entry->first), entry->second);
    }
    std::string text;
    for (const auto& [path, line] : lines)
        text += "/" + path + " " + line + "\n";
    return text;
}

bool FileTree::isTree() const {
    std::map<InodeId, InodeId> parents;
    for (const auto& [id, inode] : inodes) {
        for (const auto& [name, child] : inode.entries) {
            if (inodes.at(child).isDirectory() && !parents.emplace(child, id).second)
                return false;
        }
    }
    for (const auto& [start, parent] : parents) {
        InodeId id = start;
        std::size_t steps = 0;
        for (auto up = parents.find(id); up != parents.end(); up = parents.find(id)) {
            id = up->second;
            if (++steps > parents.size())
                return false;
        }
    }
    return true;
}

Inode readInode(int directory, const char* name) {
    const struct stat status = statusOf(directory, name);
    Inode inode{.mode = status.st_mode, .uid = status.st_uid, .gid = status.st_gid, .device = status.st_dev};
    if (S_ISLNK(status.st_mode)) {
        char target[4096];
        inode.content.assign(target, target + checked(::readlinkat(directory, name, target, sizeof target), name));
    } else if (S_ISREG(status.st_mode) || S_ISDIR(status.st_mode)) {
        constexpr int flags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
        const FileDescriptor fd(checked(::openat(directory, name, flags), name));
        inode.attributes = readAttributes(fd.get());
        if (S_ISREG(status.st_mode)) {
            inode.content.resize(static_cast<std::size_t>(status.st_size));
            inode.content.resize(checked(::read(fd.get(), inode.content.data(), inode.content.size()), name));
        }
    }
    return inode;
}

FileTree readTree(const std::string& directory, const std::set<std::string>& excluded,
                  std::map<DeviceInode, InodeId>* known) {
    FileTree tree;
    std::map<DeviceInode, InodeId> ids;
    const auto add = [&](const std::string& path) {
        const struct stat status = statusOf(AT_FDCWD, path);
        const auto [id, isNew] = ids.emplace(DeviceInode(status.st_dev, status.st_ino), FileTree::rootId + ids.size());
        if (isNew)
            tree.inodes.emplace(id->second, readInode(AT_FDCWD, path.c_str()));
        return id->second;
    };
    std::vector<std::pair<std::string, InodeId>> pending = {{"", add(directory)}};
    while (!pending.empty()) {
        const auto [path, id] = pending.back();
        pending.pop_back();
        std::set<std::string> names;
        for (const auto& entry : std::filesystem::directory_iterator(joined(directory, path)))
            names.insert(entry.path().filename().string());
        for (const std::string& name : names) {
            const std::string itemPath = joined(path, name);
            if (excluded.contains(itemPath))
                continue;
            const InodeId child = add(joined(directory, itemPath));
            tree.inodes.at(id).entries.emplace(name, child);
            if (tree.inodes.at(child).isDirectory())
                pending.emplace_back(itemPath, child);
        }
    }
    if (known != nullptr)
        *known = std::move(ids);
    return tree;
}

void materialise(const FileTree& tree, const std::string& directory) {
    const FileDescriptor root = openDirectory(directory);
    std::map<InodeId, std::string> made;
    std::vector<std::pair<std::string, InodeId>> pending = {{"", FileTree::rootId}};
    while (!pending.empty()) {
        const auto [path, id] = pending.back();
        pending.pop_back();
        const Inode& inode = tree.inodes.at(id);
        if (id != FileTree::rootId) {
            const auto [first, isNew] = made.emplace(id, path);
            if (!isNew) {
                checked(::linkat(root.get(), first->second.c_str(), root.get(), path.c_str(), 0), "link " + path);
                continue;
            }
            materialiseItem(inode, root.get(), path);
        }
        for (const auto& [name, child] : inode.entries)
            pending.emplace_back(joined(path, name), child);
    }
    // Modes come last: neither a change of owner nor a directory without write permission may get in the way.
    made.emplace(FileTree::rootId, ".");
    for (const auto& [id, path] : made) {
        const Inode& inode = tree.inodes.at(id);
        if (!S_ISLNK(inode.mode))
            checked(::fchmodat(root.get(), path.c_str(), inode.mode & 07777, 0), "chmod " + path);
    }
}

namespace {
/// The daemon's platform starts its own program once, only to see that it does, and kills it: a test program would have
/// begun its tests by then, and leave their directories.
[[gnu::constructor]] void endTrial(int count, char** arguments) {
    if (count == 2 && std::string_view(arguments[1]) == "--version")
        ::_exit(0);
}
} // namespace

TemporaryDirectory::TemporaryDirectory(const std::string& parent) : path_(parent + "/zorvane-test.XXXXXX") {
    checked(::mkdtemp(path_.data()) == nullptr ? -1 : 0, "mkdtemp in " + parent);
}

TemporaryDirectory::~TemporaryDirectory() {
    constexpr int descriptorsMax = 32;
    const auto removeItem = [](const char* path, const struct stat*, int, FTW*) { return ::remove(path); };
    ::nftw(path_.c_str(), removeItem, descriptorsMax, FTW_DEPTH | FTW_PHYS);
}

} // namespace zor::support
