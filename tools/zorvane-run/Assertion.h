// SPDX-License-Identifier: Apache-2.0
// Whether the daemon keeps a program from being started, because its files are being changed.
#pragma once

#include "Failure.h"
#include "Options.h"
#include "Root.h"

namespace zorvanerun {

/// Nothing when no assertion is held on the identifier. One that is held is an error, or is waited for.
[[nodiscard]] Result<void> checkAssertion(const Root& root, const Options& options);

} // namespace zorvanerun
