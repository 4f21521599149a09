// SPDX-License-Identifier: Apache-2.0
// Descriptors around an execution: judged, closed, kept, passed over a socket.
#pragma once

#include "Options.h"
#include "os/FileDescriptor.h"

#include <string>

namespace zorvanerun {

/// Why one of the first three descriptors would lead a program out of its sandbox; empty when none does. A directory
/// leads to all around it, and a socket of the host's network that is not bound to one peer leads there.
[[nodiscard]] std::string whyStandardDescriptorRefused(Network network);

/// The first of those that a service manager passes.
inline constexpr int firstPassed = 3;
/// Why a passed descriptor would lead there, or is of a kind that is not passed on; nullptr when neither. Pipes with a
/// name and Unix sockets with one peer or a name to be connected to lead nowhere. Any other socket can be connected
/// anew: one that listens on the host's network, too.
[[nodiscard]] const char* whyPassedRefused(int fd, Network network);

/// Every descriptor from `first` on closes when a program is executed.
[[nodiscard]] bool closeOnExecFrom(int first);
[[nodiscard]] bool keepOnExec(int fd);

/// One message with one descriptor on a socket of whole messages.
[[nodiscard]] bool sendDescriptor(int socket, int fd);
/// The descriptor of the next message; invalid when there is no message with one. Does not wait.
[[nodiscard]] zor::platform::FileDescriptor receiveDescriptor(int socket);

} // namespace zorvanerun
