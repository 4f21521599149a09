// SPDX-License-Identifier: Apache-2.0
// The configuration of a system root, and what it says of users: read once, when a daemon starts or a tool looks.
//
// A user who can write the file can give the installer's containers to anybody, so one that others than root and the
// daemon's user can write is refused. Any thread.
#pragma once

#include "ipc/UserNumbers.h"
#include "os/SystemRoot.h"
#include "platform/Device.h"

#include <cstdint>
#include <expected>
#include <string>

namespace zor::platform {

/// A user id as it stands, or that of a name in the root's user database; else in words what is wrong. Any thread.
[[nodiscard]] std::expected<std::uint32_t, std::string> userNumberOf(const SystemRoot& root, const std::string& text);

/// The numbers, those of ipc::UserNumbers where there is no file. Else one line that says what is wrong, in which file,
/// and what to do.
[[nodiscard]] std::expected<ipc::ConfiguredUsers, std::string> configuredUsers(const SystemRoot& root,
                                                                               const PasswordDatabase& passwords);

} // namespace zor::platform
