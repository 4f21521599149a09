// SPDX-License-Identifier: Apache-2.0
#include "support/FileTree.h"

#include "platform/FileDescriptor.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <dirent.h>
#include <fcntl.h>
#include <ftw.h>
#include <functional>
#include <memory>
#include <sys/xattr.h>
#include <system_error>
#include <unistd.h>

namespace zor::support {

using platform::FileDescriptor;

namespace {

[[noreturn]] void fail(const std::string& what) {
    throw std::system_error(errno, std::generic_category(), what);
}

FileDescriptor openDirectory(int parent, const std::string& path) {
    FileDescriptor fd(::openat(parent, path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd.valid())
        fail("open directory " + path);
    return fd;
}

Bytes readAll(int fd) {
    Bytes bytes;
    std::uint8_t buffer[16384];
    for (;;) {
        const ssize_t count = ::read(fd, buffer, sizeof buffer);
        if (count < 0)
            fail("read");
        if (count == 0)
            return bytes;
        bytes.insert(bytes.end(), buffer, buffer + count);
    }
}

std::map<std::string, Bytes> readAttributes(int fd) {
    std::map<std::string, Bytes> attributes;
    char names[4096];
    const ssize_t length = ::flistxattr(fd, names, sizeof names);
    if (length < 0) {
        if (errno == EOPNOTSUPP)
            return attributes;
        fail("flistxattr");
    }
    for (ssize_t at = 0; at < length;) {
        const std::string name(names + at);
        at += static_cast<ssize_t>(name.size()) + 1;
        // Labels and access lists are the machine's, not the daemon's.
        if (!name.starts_with("user.") && !name.starts_with("trusted."))
            continue;
        Bytes value(4096);
        const ssize_t size = ::fgetxattr(fd, name.c_str(), value.data(), value.size());
        if (size < 0)
            fail("fgetxattr " + name);
        value.resize(static_cast<std::size_t>(size));
        attributes.emplace(name, std::move(value));
    }
    return attributes;
}

std::vector<std::string> listNames(DIR* stream) {
    std::vector<std::string> names;
    errno = 0;
    while (const dirent* entry = ::readdir(stream)) {
        const std::string_view name = entry->d_name;
        if (name != "." && name != "..")
            names.emplace_back(name);
    }
    if (errno != 0)
        fail("readdir");
    std::sort(names.begin(), names.end());
    return names;
}

Inode inodeOf(const struct stat& status) {
    return {.mode = status.st_mode, .uid = status.st_uid, .gid = status.st_gid, .device = status.st_dev};
}

std::string joined(const std::string& path, const std::string& name) {
    return path.empty() ? name : path + "/" + name;
}

std::string hexadecimal(std::size_t value) {
    char text[32];
    std::snprintf(text, sizeof text, "%zx", value);
    return text;
}

/// Contents are told apart by length and hash: enough for a comparison, short enough for a message.
std::string digest(const Bytes& bytes) {
    const std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
    return std::to_string(bytes.size()) + ":" + hexadecimal(std::hash<std::string_view>{}(text));
}

void materialiseItem(const Inode& inode, int parent, const std::string& path) {
    FileDescriptor fd;
    if (S_ISDIR(inode.mode)) {
        if (::mkdirat(parent, path.c_str(), 0700) != 0)
            fail("mkdir " + path);
        fd = openDirectory(parent, path);
    } else if (S_ISREG(inode.mode)) {
        fd.reset(::openat(parent, path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
        if (!fd.valid())
            fail("create " + path);
        if (::write(fd.get(), inode.content.data(), inode.content.size()) != static_cast<ssize_t>(inode.content.size()))
            fail("write " + path);
    } else if (S_ISLNK(inode.mode)) {
        const std::string target(inode.content.begin(), inode.content.end());
        if (::symlinkat(target.c_str(), parent, path.c_str()) != 0)
            fail("symlink " + path);
    } else if (::mknodat(parent, path.c_str(), inode.mode, 0) != 0) {
        fail("mknod " + path);
    }
    for (const auto& [name, value] : inode.attributes) {
        if (::fsetxattr(fd.get(), name.c_str(), value.data(), value.size(), 0) != 0)
            fail("fsetxattr " + name + " of " + path);
    }
    if (::geteuid() == 0 && ::fchownat(parent, path.c_str(), inode.uid, inode.gid, AT_SYMLINK_NOFOLLOW) != 0)
        fail("chown " + path);
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
    std::set<InodeId> above;
    while (!pending.empty()) {
        const auto [path, id] = pending.back();
        pending.pop_back();
        const Inode& inode = inodes.at(id);
        char head[64];
        std::snprintf(head, sizeof head, "%06o %u:%u", inode.mode, inode.uid, inode.gid);
        std::string line = head;
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
    struct stat status = {};
    if (::fstatat(directory, name, &status, AT_SYMLINK_NOFOLLOW) != 0)
        fail(std::string("stat ") + name);
    Inode inode = inodeOf(status);
    if (S_ISLNK(status.st_mode)) {
        char target[4096];
        const ssize_t length = ::readlinkat(directory, name, target, sizeof target);
        if (length < 0)
            fail(std::string("readlink ") + name);
        inode.content.assign(target, target + length);
    } else if (S_ISREG(status.st_mode) || S_ISDIR(status.st_mode)) {
        const FileDescriptor fd(::openat(directory, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
        if (!fd.valid())
            fail(std::string("open ") + name);
        inode.attributes = readAttributes(fd.get());
        if (S_ISREG(status.st_mode))
            inode.content = readAll(fd.get());
    }
    return inode;
}

FileTree readTree(const std::string& directory, const std::set<std::string>& excluded,
                  std::map<DeviceInode, InodeId>* known) {
    const FileDescriptor root = openDirectory(AT_FDCWD, directory);
    FileTree tree;
    std::map<DeviceInode, InodeId> ids;
    InodeId next = FileTree::rootId;
    const auto add = [&](int parent, const std::string& name) {
        struct stat status = {};
        if (::fstatat(parent, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0)
            fail("stat " + name);
        const auto [id, isNew] = ids.emplace(DeviceInode(status.st_dev, status.st_ino), next);
        // A directory is opened once, below.
        if (isNew)
            tree.inodes.emplace(next++, S_ISDIR(status.st_mode) ? inodeOf(status) : readInode(parent, name.c_str()));
        return id->second;
    };
    std::vector<std::pair<std::string, InodeId>> pending = {{"", add(root.get(), ".")}};
    while (!pending.empty()) {
        const auto [path, id] = pending.back();
        pending.pop_back();
        FileDescriptor fd = openDirectory(root.get(), path.empty() ? "." : path);
        tree.inodes.at(id).attributes = readAttributes(fd.get());
        const std::unique_ptr<DIR, int (*)(DIR*)> stream(::fdopendir(fd.release()), ::closedir);
        for (const std::string& name : listNames(stream.get())) {
            const std::string itemPath = joined(path, name);
            if (excluded.contains(itemPath))
                continue;
            const InodeId child = add(::dirfd(stream.get()), name);
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
    const FileDescriptor root = openDirectory(AT_FDCWD, directory);
    std::map<InodeId, std::string> made;
    std::vector<std::pair<std::string, InodeId>> pending = {{"", FileTree::rootId}};
    while (!pending.empty()) {
        const auto [path, id] = pending.back();
        pending.pop_back();
        const Inode& inode = tree.inodes.at(id);
        if (id != FileTree::rootId) {
            const auto [first, isNew] = made.emplace(id, path);
            if (!isNew) {
                if (::linkat(root.get(), first->second.c_str(), root.get(), path.c_str(), 0) != 0)
                    fail("link " + path);
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
        if (!S_ISLNK(inode.mode) && ::fchmodat(root.get(), path.c_str(), inode.mode & 07777, 0) != 0)
            fail("chmod " + path);
    }
}

TemporaryDirectory::TemporaryDirectory(const std::string& parent) : path_(parent + "/zorvane-test.XXXXXX") {
    if (::mkdtemp(path_.data()) == nullptr)
        fail("mkdtemp in " + parent);
}

TemporaryDirectory::~TemporaryDirectory() {
    constexpr int descriptorsMax = 32;
    const auto removeItem = [](const char* path, const struct stat*, int, FTW*) { return ::remove(path); };
    ::nftw(path_.c_str(), removeItem, descriptorsMax, FTW_DEPTH | FTW_PHYS);
}

} // namespace zor::support
