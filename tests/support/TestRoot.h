// SPDX-License-Identifier: Apache-2.0
// A directory that stands for a device's root, and short ways to make and see what lies in it. Paths are relative to
// it; "" is the root itself. What cannot be made throws std::system_error. One thread.
#pragma once

#include "os/LinuxDisk.h"
#include "os/SystemRoot.h"
#include "support/FileTree.h"

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zor::support {

/// The item at a path: kind, permission bits and owner in one text, "missing" when there is none.
std::string itemAt(const std::string& path);
/// Names in a directory, hidden ones too, sorted.
std::vector<std::string> namesIn(const std::string& directory);

/// The accounts root, mobile (501), second (502) and homeless (503), and the directories that the daemon expects.
void furnish(const std::string& root);

class TestRoot {
public:
    /// A new one below `parent`; `existing`, when given, in its place, which stays.
    explicit TestRoot(const std::string& parent = "/dev/shm", const std::string& existing = "");

    /// Opened when it is first asked for, with its runtime directory; again after `reopen`, to see later mounts.
    [[nodiscard]] const platform::SystemRoot& root() const;
    void reopen() { root_.reset(); }
    [[nodiscard]] platform::Disk& disk() const { return disk_; }

    [[nodiscard]] std::string path(std::string_view relative = "") const;
    /// Missing levels; the last one of the owner and mode given, the others of the owner of the directory above.
    void makeDirectories(std::string_view relative, std::optional<uid_t> lastOwner = {}, mode_t mode = 0755) const;
    /// Directories on the way are made.
    void write(std::string_view relative, std::string_view bytes, mode_t mode = 0644) const;
    /// By a rename, as whoever writes the files of a running system does it.
    void replace(std::string_view relative, std::string_view bytes, mode_t mode = 0644) const;
    /// "" when there is no such file.
    [[nodiscard]] std::string read(std::string_view relative) const;
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
