// SPDX-License-Identifier: Apache-2.0
// The names of places, and the way from a name to a descriptor, without following anything.
//
// Below a user's home every name can change between two system calls. So a path is resolved once, from the open root,
// in one openat2 that follows no link and leaves no root; what comes after acts on the descriptor. A path outside the
// root, a link on the way, or a "..", is an error, never a detour. Below a fence (fs/MountFences.h) a mount point on
// the way is one too: EXDEV, and EHOSTDOWN where the file system of a home does not answer. Any thread.
#pragma once

#include "fs/MountFences.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <cstdint>
#include <fcntl.h>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <utility>

namespace zor {

/// A place in the file system: an absolute path, and whether it is meant as a directory. Names only; whoever acts on it
/// resolves it anew and goes on with the descriptor.
class FileURL {
public:
    FileURL() = default;
    FileURL(std::string path, bool isDirectory) : path_(std::move(path)), isDirectory_(isDirectory) {
        while (path_.size() > 1 && path_.back() == '/')
            path_.pop_back();
    }
    static FileURL directory(std::string path) { return {std::move(path), true}; }
    static FileURL file(std::string path) { return {std::move(path), false}; }

    /// Without a trailing slash (but for "/").
    [[nodiscard]] const std::string& path() const { return path_; }
    [[nodiscard]] const char* c_str() const { return path_.c_str(); }
    [[nodiscard]] bool isDirectory() const { return isDirectory_; }
    [[nodiscard]] bool empty() const { return path_.empty(); }

    [[nodiscard]] FileURL appendingDirectory(std::string_view components) const { return append(components, true); }
    [[nodiscard]] FileURL appendingFile(std::string_view components) const { return append(components, false); }
    [[nodiscard]] std::string_view lastPathComponent() const {
        return std::string_view(path_).substr(path_.rfind('/') + 1);
    }
    [[nodiscard]] FileURL deletingLastPathComponent() const {
        const auto slash = path_.rfind('/');
        return {slash == 0 || slash == std::string::npos ? "/" : path_.substr(0, slash), true};
    }
    bool operator==(const FileURL&) const = default;

private:
    [[nodiscard]] FileURL append(std::string_view components, bool isDirectory) const {
        std::string joined;
        joined.reserve(path_.size() + 1 + components.size());
        joined += path_;
        if (joined.empty() || joined.back() != '/')
            joined += '/';
        joined += components;
        return {std::move(joined), isDirectory};
    }

    std::string path_;
    bool isDirectory_ = false;
};

} // namespace zor

namespace zor::fs {

using platform::FileDescriptor;

/// Whether a step may lead onto another mount.
enum class Mounts { crossed, left };

/// An open directory and the name of one item in it.
struct ParentAndName {
    FileDescriptor directory; // O_PATH
    std::string name;
};

/// Tells a directory and its mount from any other at the same path.
struct DirectoryId {
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    std::uint64_t mount = 0;
    bool operator==(const DirectoryId&) const = default;
};
/// Asks no server that keeps the file system.
[[nodiscard]] inline ErrnoOr<DirectoryId> directoryIdOf(int directory) {
    struct statx status{};
    if (::statx(directory, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC, STATX_INO | STATX_MNT_ID, &status) != 0)
        return Errno::last();
    return DirectoryId{.device = makedev(status.stx_dev_major, status.stx_dev_minor),
                       .inode = status.stx_ino,
                       .mount = status.stx_mnt_id};
}

class PathResolver {
public:
    /// Told a path that was not entered, and why. Any thread; may throw nothing.
    using Left = std::function<void(const FileURL& url, Errno error)>;
    explicit PathResolver(const platform::SystemRoot& root, Left left = nullptr)
        : root_(root), fences_(root.descriptor()), left_(std::move(left)) {}
    PathResolver(const PathResolver&) = delete;
    PathResolver& operator=(const PathResolver&) = delete;

    /// From now on no mount is crossed below this directory (see MountFence::Kind).
    void fence(const FileURL& url, MountFence::Kind kind) const;
    /// Whether the home that holds the item answers; see MountFence::answers.
    [[nodiscard]] bool answers(const FileURL& url, MountFence::Asked asked = MountFence::Asked::lately) const;

    /// For reading its entries and for acting on it.
    [[nodiscard]] OpenResult openDirectory(const FileURL& url) const;
    /// O_PATH: for naming items in it.
    [[nodiscard]] OpenResult openDirectoryPath(const FileURL& url) const;
    /// With any flags; a link in the last place fails with ELOOP.
    [[nodiscard]] OpenResult openItem(const FileURL& url, int flags) const;
    [[nodiscard]] ErrnoOr<ParentAndName> openParent(const FileURL& url) const;
    /// lstat.
    Errno status(const FileURL& url, struct stat& status) const;
    /// The beginning of a path for a caller that makes its missing parts: at its fence, which has to be there, or at
    /// the root.
    struct Way {
        FileDescriptor fence;
        int base = -1;
        std::string path; ///< relative to `base`
        Mounts mounts = Mounts::left;
    };
    [[nodiscard]] ErrnoOr<Way> wayTo(const FileURL& url) const;
    /// The path relative to the root ("." for the root itself); nullptr when it lies outside.
    [[nodiscard]] const char* relative(const FileURL& url) const;

    [[nodiscard]] const platform::SystemRoot& root() const { return root_; }

private:
    void noteLeft(const FileURL& url, Errno error) const;

    const platform::SystemRoot& root_;
    mutable MountFences fences_; // knows no more of the disk than before
    const Left left_;
};

/// Opens what lies at a relative path, without following a link.
[[nodiscard]] OpenResult openBelow(int base, const char* path, int flags, Mounts mounts);
/// Opens a directory below an open one (O_PATH; "" is that one itself), making each missing one on the way, of `mode`
/// before the process's mask.
[[nodiscard]] OpenResult makeDirectories(platform::Disk& disk, int base, std::string_view relativePath, mode_t mode,
                                         Mounts mounts);

// Telling what is missing from what is hidden: a directory that is encrypted, while its key is away, answers for each
// name that there is none. Asked only where a name was not found, so what is found costs nothing.

/// The directory at `url`, or the nearest one above it that is there, when that hides what is in it.
[[nodiscard]] std::optional<FileURL> hiddenBy(const PathResolver& resolver, platform::Disk& disk, const FileURL& url);
/// Whether the directory `name` in an open one hides what is in it.
[[nodiscard]] bool hidesNamesBelow(platform::Disk& disk, int directory, const char* name);

} // namespace zor::fs
