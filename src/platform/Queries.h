// SPDX-License-Identifier: Apache-2.0
// Small questions that the daemon asks of the device. All may be asked from any thread.
#pragma once

#include <cstdint>
#include <expected>
#include <string>
#include <string_view>

namespace zor::platform {

class InternalBuildQuery {
public:
    virtual ~InternalBuildQuery() = default;
    [[nodiscard]] virtual bool isInternalBuild() const = 0;
};

class SystemVersionQuery {
public:
    virtual ~SystemVersionQuery() = default;
    /// The operating system's build version; empty when unknown.
    [[nodiscard]] virtual std::string buildVersion() const = 0;
};

struct PasswordEntry {
    std::string name;
    std::uint32_t uid = 0;
    /// Absolute; on a root other than "/" it already begins with the root.
    std::string homeDirectory;
};

class PasswordDatabase {
public:
    virtual ~PasswordDatabase() = default;
    /// ENOENT where the database has no such entry, or one without an absolute home; any other errno where it could not
    /// be asked.
    [[nodiscard]] virtual std::expected<PasswordEntry, int> entryForUserId(std::uint32_t uid) const = 0;
    [[nodiscard]] virtual std::expected<PasswordEntry, int> entryForName(std::string_view name) const = 0;
};

} // namespace zor::platform
