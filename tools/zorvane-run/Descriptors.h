// SPDX-License-Identifier: Apache-2.0
// What is done with descriptors around an execution: closed, kept, passed over a socket.
#pragma once

#include "platform/FileDescriptor.h"

namespace zorvanerun {

/// Every descriptor from `first` on closes when a program is executed.
[[nodiscard]] bool closeOnExecFrom(int first);
[[nodiscard]] bool keepOnExec(int fd);

/// One message with one descriptor on a socket of whole messages.
[[nodiscard]] bool sendDescriptor(int socket, int fd);
/// The descriptor of the next message; invalid when there is no message with one. Does not wait.
[[nodiscard]] zor::platform::FileDescriptor receiveDescriptor(int socket);

} // namespace zorvanerun
