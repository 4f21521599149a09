// SPDX-License-Identifier: Apache-2.0
// The part of this program that runs inside the sandbox: it becomes the user, gives up every power, and turns into the
// program that was asked for.
//
// It is executed through a descriptor, since it lies nowhere in the sandbox. Descriptors for its own use (the
// sandbox's lead outside) are closed by the execution; sockets that were passed stay. The caller's keys, umask and
// ignored signals end here; its priority, limits and the like go on to the program: a service manager sets them for it.
// A part of this that does not work out ends it: the program never runs with more than its user may.
#pragma once

#include <string>

namespace zorvanerun {

/// The first argument of the inner execution. The others: descriptor of the channel, user, network, number of
/// passed sockets, program, its arguments. The program starts in HOME.
inline constexpr const char* insideOption = "--inside";

/// Executes the program, or returns the exit code of the failure. On the channel goes one message with a pidfd of the
/// process, sent when signals have their usual effect again.
[[nodiscard]] int runInside(int argumentCount, char** arguments);

} // namespace zorvanerun
