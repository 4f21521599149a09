// SPDX-License-Identifier: Apache-2.0
// The rules for what may come into a container, and under which name: the same for archives and directories.
//
// Files, directories, and symbolic links that stay inside. Refused are devices, FIFOs and sockets, set-user-ID and
// set-group-ID bits of files, names that lead out, and the name of the container's own metadata file. One item that is
// refused refuses the whole. Changed without a word are modes alone: sticky bits and the set-group-ID of directories do
// not come in, and a directory's owner may always use it. Left out are names that vanish while a directory is copied.
//
// A link stays inside when ".." stands in its target only at the beginning, and not more often than directories lie
// above the link. A ".." behind a name is refused, since that name may be a link itself. So each link leads from a real
// directory of the container to another place in it, and so does a chain of them.
//
// Nothing here touches the disk. Any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <expected>
#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace zorvanectl::content {

/// More items than that are no container's; an archive of a few kilobytes can hold as many empty files.
inline constexpr std::uint64_t itemsMax = 2'000'000;
/// With its NUL a name has to fit one system call.
inline constexpr std::size_t nameBytesMax = 4095;
inline constexpr std::size_t componentBytesMax = 255;

/// An archive's name without what means nothing ("./a//b/" is "a/b"), "" for the top itself; else why it is refused.
[[nodiscard]] std::expected<std::string, std::string> plainName(std::string_view name);

struct Item {
    /// Plain, as plainName gives it; not "".
    std::string_view name;
    /// Type and permissions.
    mode_t mode = 0;
    /// The target of a symbolic link.
    std::string_view linkTarget{};
};

/// Why an item may not come in; nullopt when it may.
[[nodiscard]] std::optional<std::string> whyRefused(const Item& item);

/// "NAME is refused: REASON", printable.
[[nodiscard]] std::string refusal(std::string_view name, std::string_view reason);

} // namespace zorvanectl::content
