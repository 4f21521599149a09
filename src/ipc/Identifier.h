// SPDX-License-Identifier: Apache-2.0
// The rule for identifiers: of a container, of a program, of a group. Pure; any thread.
#pragma once

#include <cstddef>
#include <string_view>

namespace zor::ipc {

/// An identifier is kept in memory and repeated in lists, for each container that has it. Those in use have some dozen
/// bytes; names of files and domains stay below 256.
inline constexpr std::size_t identifierBytesMax = 1024;

/// At most identifierBytesMax bytes of UTF-8, and no NUL.
[[nodiscard]] bool isIdentifier(std::string_view text);

} // namespace zor::ipc
