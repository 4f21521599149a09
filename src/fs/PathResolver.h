// SPDX-License-Identifier: Apache-2.0
// From a path to a descriptor, without following anything.
//
// Below a user's home every name can change between two system calls. So a path is resolved once, from the open root,
// in one openat2 that follows no link and leaves no root; what comes after acts on the descriptor. A path outside the
// root, a link on the way, or a "..", is an error, never a detour. All functions return a descriptor or an errno. Any
// thread.
#pragma once

#include "daemon/base/FileURL.h"
#include "platform/Disk.h"
#include "platform/FileDescriptor.h"
#include "platform/linux/SystemRoot.h"

#include <cstdint>
#include <expected>
#include <string>
#include <string_view>
#include <sys/stat.h>

namespace zor::fs {

using platform::FileDescriptor;
using OpenResult = std::expected<FileDescriptor, int>;

/// An open directory and the name of one item in it.
struct ParentAndName {
    FileDescriptor directory; // O_PATH
    std::string name;
};

/// Which directory it is, and of which mount: what lies at its path has changed when this has.
struct DirectoryId {
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    std::uint64_t mount = 0;
    bool operator==(const DirectoryId&) const = default;
};
/// Asks no server that keeps the file system. An errno.
[[nodiscard]] std::expected<DirectoryId, int> directoryIdOf(int directory);

class PathResolver {
public:
    explicit PathResolver(const platform::SystemRoot& root) : root_(root) {}

    /// For reading its entries and for acting on it.
    [[nodiscard]] OpenResult openDirectory(const FileURL& url) const;
    /// O_PATH: for naming items in it.
    [[nodiscard]] OpenResult openDirectoryPath(const FileURL& url) const;
    /// With any flags; a link in the last place fails with ELOOP.
    [[nodiscard]] OpenResult openItem(const FileURL& url, int flags) const;
    [[nodiscard]] std::expected<ParentAndName, int> openParent(const FileURL& url) const;
    /// lstat: 0 or an errno.
    [[nodiscard]] int status(const FileURL& url, struct stat& status) const;
    /// The path relative to the root ("." for the root itself); nullptr when it lies outside.
    [[nodiscard]] const char* relative(const FileURL& url) const;

    [[nodiscard]] const platform::SystemRoot& root() const { return root_; }

private:
    const platform::SystemRoot& root_;
};

/// Opens a directory below an open one (O_PATH; "" is that one itself), making each missing one on the way, of `mode`
/// before the process's mask.
[[nodiscard]] OpenResult makeDirectories(platform::Disk& disk, int base, std::string_view relativePath, mode_t mode);

} // namespace zor::fs
