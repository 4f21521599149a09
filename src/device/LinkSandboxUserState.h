// SPDX-License-Identifier: Apache-2.0
// Sandbox mappings as links below the runtime directory: reading them, and the role that keeps them.
#pragma once

#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Device.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <atomic>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>

namespace zor::platform {

// Reading sandbox mappings as they lie on the disk; who sets them is LinkSandboxUserState. Changes nothing. Any thread.

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

// Sandbox mappings as symbolic links: run/zorvane/sandbox/<uid>/<item type>/<identifier, percent-encoded> points to the
// container. The builder of a sandbox reads them.
//
// A mapping is replaced by rename: a reader sees the old or the new one. A failure in the middle leaves a hidden name,
// which the next launch removes. The directory is root's and ends with the boot, so nothing is synced.

class LinkSandboxUserState final : public SandboxUserState {
public:
    LinkSandboxUserState(const SystemRoot& root, Disk& disk) : root_(root), disk_(disk) {}
    /// ENAMETOOLONG when the encoded identifier is no file name any more, EINVAL when it is empty.
    Errno setMapping(std::uint32_t userId, SandboxItemType type, std::string_view identifier,
                     const std::optional<std::string>& path) override;
    unsigned removeDanglingMappings(const std::function<bool(std::uint32_t userId)>& mayConclude,
                                    const std::function<bool(const std::string& path)>& isGone) override;

private:
    enum class Missing { fail, make };
    [[nodiscard]] ErrnoOr<FileDescriptor> openDirectory(int parent, const char* name, Missing missing);
    [[nodiscard]] ErrnoOr<FileDescriptor> directoryOf(std::uint32_t userId, SandboxItemType type, Missing missing);

    const SystemRoot& root_;
    Disk& disk_;
    std::atomic<unsigned> temporaryNames_{0};
};

} // namespace zor::platform
