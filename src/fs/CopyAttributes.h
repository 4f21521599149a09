// SPDX-License-Identifier: Apache-2.0
// Gives a copied file or directory what the source has besides its data: extended attributes, owner and group, mode,
// access control lists, times, in an order in which none undoes another. One thread.
#pragma once

#include "platform/Disk.h"

#include <cstdint>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <vector>

namespace zor::fs {

class CopyAttributes {
public:
    explicit CopyAttributes(platform::Disk& disk);

    /// Both are open files or directories; `status` is of `from`, `mode` what the copy gets. 0 or -errno.
    int copy(int from, int to, const struct stat& status, mode_t mode);
    /// Owner, group, mode and times alone. 0 or -errno.
    int giveBasic(int to, const struct stat& status, mode_t mode);
    /// A new directory takes over the default access control list of the one it is made in, and its content would in
    /// turn.
    int dropInheritedDefaultAcl(int directory);

private:
    /// The names of the attributes of `file`, each followed by a NUL. 0 or -errno.
    int list(int file);
    int copyAttribute(int from, int to, const char* name);
    int dropInheritedAcl(int from, int to, mode_t mode);
    [[nodiscard]] bool skips(std::string_view name) const;
    [[nodiscard]] bool mayLack(std::string_view name, int error) const;

    platform::Disk& disk_;
    const bool isRoot_;
    std::vector<char> names_;
    std::vector<std::uint8_t> value_;
};

} // namespace zor::fs
