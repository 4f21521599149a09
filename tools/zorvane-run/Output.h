// SPDX-License-Identifier: Apache-2.0
// How the program speaks: for people in words, with --json for programs. Results go to standard output, errors to
// standard error.
#pragma once

#include "Failure.h"
#include "Mounts.h"
#include "Options.h"

namespace zorvanerun {

/// Says what failed and what to do. The exit code for it.
[[nodiscard]] int sayFailure(const Options& options, const Failure& failure);
/// Whether all that was printed until now has reached standard output; says so where it has not.
[[nodiscard]] bool outputReached();
/// Shows what would be mounted, with which environment, for which program.
[[nodiscard]] int showPlan(const Options& options, const std::vector<Mount>& mounts, const ToldContainers& told);

} // namespace zorvanerun
