// SPDX-License-Identifier: Apache-2.0
// A directory that was made where others may write: they can put another in its place before it is opened.
#pragma once

namespace zor::fs {

/// Whether the open directory can be the one that this process just made: its own, closed to others, and empty.
[[nodiscard]] bool isFreshDirectory(int directory);

} // namespace zor::fs
