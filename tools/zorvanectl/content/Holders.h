// SPDX-License-Identifier: Apache-2.0
// Whether root may read, for whoever gets the content, what lies in somebody's directory.
//
// The owner of a directory can move into it, or link there, what belongs to others and is closed to him; an
// installation reads as root and gives what it read away. So each item is judged against all the owners of directories
// on the way to it: it has to belong to them, or be readable for everybody. Root and whoever runs the program are no
// such owners. Anybody may have put an item where everybody may write; into a sticky directory nobody moves what is
// another's, but a link can be made. Judged is what was opened, never a name. One thread.
#pragma once

#include "Failure.h"
#include "os/FileDescriptor.h"

#include <cstddef>
#include <optional>
#include <string>
#include <sys/stat.h>
#include <vector>

namespace zorvanectl::content {

class Holders {
public:
    /// A directory on the way to the source, the source itself included.
    void addToTheWay(const struct stat& directory);
    /// A directory of the source, `depth` levels below its top; those of as many levels or more are left by that.
    void enter(std::size_t depth, const struct stat& directory);

    /// Why an item of the source, `depth` levels below its top, may not be read; nullopt when it may. `item` is the
    /// open file or directory, or -1 where there is nothing to be read.
    [[nodiscard]] std::optional<std::string> whyRefused(std::size_t depth, const struct stat& status, int item) const;

private:
    struct Holder {
        uid_t owner = 0;
        mode_t mode = 0;
    };
    std::vector<Holder> way_;
    std::vector<Holder> levels_; // of the source, from the first below its top
};

/// Opens a file or directory for reading, and adds the directories on the way. A symbolic link of root's or the
/// caller's own is followed wherever it leads; anybody else's is refused. A file has to belong to root, to the caller,
/// or to the owner of the directory that holds it.
[[nodiscard]] Outcome<zor::platform::FileDescriptor> openForInstallation(const std::string& path, Holders& holders);

} // namespace zorvanectl::content
