// SPDX-License-Identifier: Apache-2.0
// The items that wait for their deletion, on the daemon's death row and on those of other file systems. Reads alone;
// one thread.
#pragma once

#include "check/CheckedSystem.h"
#include "check/Look.h"

#include <cstdint>
#include <functional>

namespace zor::check {

/// Calls with each row that there is, open for reading, and what it is called.
void forEachDeathRow(Look& look, const std::function<void(int row, const FileURL& url)>& function);

struct DeathRow {
    std::size_t items = 0;
    std::uint64_t bytes = 0;
    /// Since the one that waits longest was moved there; 0 without items.
    std::uint64_t oldestSeconds = 0;
};
/// Measures each item, which takes as long as its tree is large.
[[nodiscard]] DeathRow lookAtDeathRow(CheckedSystem& system);

} // namespace zor::check
