// SPDX-License-Identifier: Apache-2.0
// Sandbox mappings as symbolic links: run/zorvane/sandbox/<uid>/<item type>/<identifier, percent-encoded> points to the
// container. Whoever builds a sandbox reads them.
//
// A mapping is replaced by rename: a reader sees the old or the new one. A failure in the middle leaves a hidden name,
// which the next launch removes. The directory is root's and ends with the boot, so nothing is synced.
#pragma once

#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Disk.h"
#include "platform/SandboxUserState.h"

#include <atomic>
#include <expected>

namespace zor::platform {

class LinkSandboxUserState final : public SandboxUserState {
public:
    LinkSandboxUserState(const SystemRoot& root, Disk& disk) : root_(root), disk_(disk) {}
    /// ENAMETOOLONG when the encoded identifier is no file name any more, EINVAL when it is empty.
    int setMapping(std::uint32_t userId, SandboxItemType type, std::string_view identifier,
                   const std::optional<std::string>& path) override;
    unsigned removeDanglingMappings(const std::function<bool(std::uint32_t userId)>& mayConclude,
                                    const std::function<bool(const std::string& path)>& isGone) override;

private:
    enum class Missing { fail, make };
    [[nodiscard]] std::expected<FileDescriptor, int> openDirectory(int parent, const char* name, Missing missing);
    [[nodiscard]] std::expected<FileDescriptor, int> directoryOf(std::uint32_t userId, SandboxItemType type,
                                                                 Missing missing);

    const SystemRoot& root_;
    Disk& disk_;
    std::atomic<unsigned> temporaryNames_{0};
};

} // namespace zor::platform
