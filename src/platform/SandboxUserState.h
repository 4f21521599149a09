// SPDX-License-Identifier: Apache-2.0
// Tells the sandbox which directory is the container of (user, item type, identifier).
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace zor::platform {

/// What a mapping names; the numbers are the sandbox's own.
enum class SandboxItemType : std::uint64_t { dataContainer = 1, groupContainer = 2 };

class SandboxUserState {
public:
    virtual ~SandboxUserState() = default;
    /// Sets the mapping to `path`, or removes it when there is none (removing what is not there succeeds).
    /// 0, else an errno. Any thread; calls for one identifier are serialised by the caller's identifier locks.
    virtual int setMapping(std::uint32_t userId, SandboxItemType type, std::string_view identifier,
                           const std::optional<std::string>& path) = 0;
    /// Removes every mapping whose target is gone, of the users of whom that may be concluded: a home that is not there
    /// now comes back with its containers. `isGone` is asked of targets inside the system root: it knows where a look
    /// could wait for a user's file system. A launch calls it once. How many were removed.
    virtual unsigned removeDanglingMappings(const std::function<bool(std::uint32_t userId)>& mayConclude,
                                            const std::function<bool(const std::string& path)>& isGone) = 0;
};

} // namespace zor::platform
