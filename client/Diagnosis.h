// SPDX-License-Identifier: Apache-2.0
// Why a daemon ended a connection or does not answer: it hangs up without a word, so its status socket is asked, and
// the kernel. Each costs a second at most. Any thread.
#pragma once

#include "zorvane/Client.h"

#include <chrono>
#include <optional>
#include <sys/types.h>

namespace zorvane {

/// The daemon ended a connection that was made `age` ago instead of answering.
[[nodiscard]] Error whyEnded(const ConnectOptions& options, std::chrono::milliseconds age);
/// `daemon` is the process that listens; it did not answer within so many milliseconds.
[[nodiscard]] Error whySilent(pid_t daemon, std::uint32_t milliseconds);

} // namespace zorvane
