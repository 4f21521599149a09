// SPDX-License-Identifier: Apache-2.0
// A directory tree as a value: inodes by number, each with its kind, mode, owner, extended attributes and content or
// entries.
//
// Read from a real directory, changed in memory, built in another directory. Hard links are one inode with two names.
// Inode numbers are the model's own, so one that a file system uses again stays two inodes here. Times and inode flags
// are left out. Not thread-safe.
#pragma once

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <sys/types.h>
#include <utility>
#include <vector>

namespace zor::support {

using Bytes = std::vector<std::uint8_t>;
/// 0 is no inode.
using InodeId = std::uint64_t;
/// The file system's own name of an inode, valid as long as it lives.
using DeviceInode = std::pair<dev_t, ino_t>;

struct Inode {
    /// Kind and permission bits.
    mode_t mode = 0;
    uid_t uid = 0;
    gid_t gid = 0;
    /// The file system that it was made on; not part of what the tree is.
    dev_t device = 0;
    /// The bytes of a regular file, the target of a symbolic link.
    Bytes content;
    std::map<std::string, Bytes> attributes;
    std::map<std::string, InodeId> entries;

    [[nodiscard]] bool isDirectory() const { return S_ISDIR(mode); }
};

struct FileTree {
    static constexpr InodeId rootId = 1;

    /// May also hold inodes that no name reaches.
    std::map<InodeId, Inode> inodes;

    /// 0 when there is no such item. `path` is relative to the root, "" is the root.
    [[nodiscard]] InodeId resolve(std::string_view path) const;
    /// One line for each name that can be reached, sorted; equal texts are equal trees.
    [[nodiscard]] std::string describe() const;
    /// No directory has two names or lies below itself, as every file system guarantees.
    [[nodiscard]] bool isTree() const;
};

/// A whole tree as it is on disk. `excluded` are paths relative to the tree, left out with all below them.
/// `known`, when given, learns which inode is which. Throws std::system_error where it cannot be read.
FileTree readTree(const std::string& directory, const std::set<std::string>& excluded = {},
                  std::map<DeviceInode, InodeId>* known = nullptr);
/// The inode of `name` in the open directory without its entries.
Inode readInode(int directory, const char* name);

/// Makes the tree in `directory`, which exists and is empty. Owners are set where the process is root.
/// Throws std::system_error.
void materialise(const FileTree& tree, const std::string& directory);

/// A new directory that goes, with everything in it, when this object does.
class TemporaryDirectory {
public:
    explicit TemporaryDirectory(const std::string& parent = "/dev/shm");
    ~TemporaryDirectory();
    TemporaryDirectory(const TemporaryDirectory&) = delete;
    TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

    [[nodiscard]] const std::string& path() const { return path_; }

private:
    std::string path_;
};

} // namespace zor::support
