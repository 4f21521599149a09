// SPDX-License-Identifier: Apache-2.0
// The places where clients find the daemon. Paths are relative to the system root, which is / on a device.
#pragma once

#include <string_view>

namespace zor::ipc {

/// The service's name; also the name of its socket.
inline constexpr std::string_view serviceName = "com.veltra.zorvaned";
inline constexpr std::string_view upcallServiceName = "com.veltra.zorvaned.upcall";
inline constexpr std::string_view statusSocketName = "zorvaned.status";
/// Holds the sockets.
inline constexpr std::string_view runtimeDirectory = "run/zorvane";
/// In it: a locked file for each program that must not be started now, named by its percent-encoded identifier.
inline constexpr std::string_view assertionDirectory = "assertions";
/// In it: the numbers of the users that own containers, as the daemon serves them.
inline constexpr std::string_view usersFile = "users";
/// In it: whether the device is locked.
inline constexpr std::string_view lockStateFile = "lockstate";

} // namespace zor::ipc
