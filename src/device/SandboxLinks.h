// SPDX-License-Identifier: Apache-2.0
// Reading sandbox mappings as they lie on the disk; who sets them is LinkSandboxUserState. Changes nothing. Any thread.
#pragma once

#include "os/SystemRoot.h"
#include "platform/Disk.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

namespace zor::platform {

struct SandboxDirectory {
    /// A real descriptor, open during the call only.
    int descriptor = -1;
    /// Names of directories: numbers, unless somebody else made them.
    std::string user;
    std::string itemType;
    /// nullopt where the name is no number.
    [[nodiscard]] std::optional<std::uint32_t> userId() const;
};
/// Calls `found` for each directory of mappings. Nothing when there are none; what is no directory is passed over.
void forEachSandboxDirectory(const SystemRoot& root, const std::function<void(const SandboxDirectory&)>& found);

/// Whether a name is what a stop in the middle of a replacement left.
[[nodiscard]] inline bool isSandboxLeftover(const std::string& name) {
    return name.starts_with('.');
}
/// Whether the link leads to nothing, as `isGone` says of a path inside the root, or out of the root.
[[nodiscard]] bool isDanglingSandboxLink(const SystemRoot& root, int directory, const char* name,
                                         const std::function<bool(const std::string& path)>& isGone);

} // namespace zor::platform
