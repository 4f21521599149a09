// SPDX-License-Identifier: Apache-2.0
// Whether the daemon keeps a program from being started, because its files are being changed.
#pragma once

#include "Failure.h"
#include "Options.h"
#include "Root.h"

#include <cstdint>

namespace zorvanerun {

enum class Freedom : std::uint8_t { found, waitedFor };
/// Says that no assertion is held on the identifier. One that is held is an error, or is waited for.
[[nodiscard]] Result<Freedom> awaitFreedom(const Root& root, const Options& options);

} // namespace zorvanerun
