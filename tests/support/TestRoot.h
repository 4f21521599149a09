// SPDX-License-Identifier: Apache-2.0
// A directory that stands for a device's root, and short ways to make and see what lies in it. Paths are relative to
// it; "" is the root itself. An item that cannot be made throws std::system_error. One thread.
#pragma once

#include "os/LinuxDisk.h"
#include "os/SystemRoot.h"
#include "support/FileTree.h"
#include "support/Files.h"

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <optional>

namespace zor::support {

/// The item at a path: kind, permission bits and owner in one text, "missing" when there is none.
inline std::string itemAt(const std::string& path) {
    struct stat status{};
    if (::lstat(path.c_str(), &status) != 0)
        return "missing";
    const char* kind = S_ISDIR(status.st_mode) ? "directory" : S_ISREG(status.st_mode) ? "file" : "other";
    char text[96];
    std::snprintf(text, sizeof text, "%s %04o %u:%u", kind, static_cast<unsigned>(status.st_mode & 07777),
                  status.st_uid, status.st_gid);
    return text;
}
/// Names in a directory, hidden ones too, sorted.
inline std::vector<std::string> namesIn(const std::string& directory) {
    std::vector<std::string> found;
    std::error_code none;
    for (const auto& entry : std::filesystem::directory_iterator(directory, none))
        found.push_back(entry.path().filename());
    std::ranges::sort(found);
    return found;
}

/// The accounts root, mobile (501), second (502) and homeless (503), and the directories that the daemon expects.
void furnish(const std::string& root);

class TestRoot {
public:
    /// A new one below `parent`; `existing`, when given, in its place, which stays.
    explicit TestRoot(const std::string& parent = "/dev/shm", const std::string& existing = "")
        : path_(existing.empty() ? directory_.emplace(parent).path() : existing) {
        checked(::chmod(path_.c_str(), 0755), path_);
    }

    /// Opened when it is first asked for, with its runtime directory.
    [[nodiscard]] const platform::SystemRoot& root() const {
        if (!root_) {
            root_ = platform::SystemRoot::open(path_).value();
            errno = root_->makeRuntimeDirectory(disk_).number();
            checked(errno == 0 ? 0 : -1, "the runtime directory");
        }
        return *root_;
    }
    [[nodiscard]] platform::Disk& disk() const { return disk_; }

    [[nodiscard]] std::string path(std::string_view relative = "") const {
        return relative.empty() ? path_ : path_ + "/" + std::string(relative);
    }
    /// Missing levels; the last one of the owner and mode given, the others of the owner of the directory above.
    void makeDirectories(std::string_view relative, std::optional<uid_t> lastOwner = {}, mode_t mode = 0755) const;
    /// Directories on the way are made.
    void write(std::string_view relative, std::string_view bytes, mode_t mode = 0644) const {
        const std::size_t slash = relative.rfind('/');
        if (slash != std::string_view::npos && !exists(relative.substr(0, slash)))
            makeDirectories(relative.substr(0, slash));
        writeFile(path(relative), bytes, mode);
    }
    /// By a rename, as whoever writes the files of a running system does it.
    void replace(std::string_view relative, std::string_view bytes, mode_t mode = 0644) const {
        const std::string temporary = std::string(relative) + "~";
        write(temporary, bytes, mode);
        checked(::rename(path(temporary).c_str(), path(relative).c_str()), temporary);
    }
    /// "" when there is no such file.
    [[nodiscard]] std::string read(std::string_view relative) const { return readFile(path(relative)); }
    [[nodiscard]] std::string item(std::string_view relative) const { return itemAt(path(relative)); }
    [[nodiscard]] bool exists(std::string_view relative) const { return item(relative) != "missing"; }
    [[nodiscard]] std::vector<std::string> names(std::string_view relative) const { return namesIn(path(relative)); }

private:
    std::optional<TemporaryDirectory> directory_;
    const std::string path_;
    mutable platform::LinuxDisk disk_{platform::Syncs::off};
    mutable std::optional<platform::SystemRoot> root_;
};

} // namespace zor::support
