// SPDX-License-Identifier: Apache-2.0
// The users of the device: the system's own database on "/", DIR/etc/passwd on any other root. Read anew each time; any
// thread.
#pragma once

#include "os/SystemRoot.h"
#include "platform/Device.h"

#include <functional>
#include <pwd.h>

namespace zor::platform {

class LinuxPasswordDatabase final : public PasswordDatabase {
public:
    explicit LinuxPasswordDatabase(const SystemRoot& root) : root_(root) {}
    [[nodiscard]] std::expected<PasswordEntry, int> entryForUserId(std::uint32_t uid) const override;
    [[nodiscard]] std::expected<PasswordEntry, int> entryForName(std::string_view name) const override;

private:
    [[nodiscard]] std::expected<PasswordEntry, int> findInFile(const std::function<bool(const passwd&)>& matches) const;
    [[nodiscard]] std::expected<PasswordEntry, int> entryOf(const passwd& found) const;

    const SystemRoot& root_;
};

} // namespace zor::platform
