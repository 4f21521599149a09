// SPDX-License-Identifier: Apache-2.0
// Work on each of many numbered things that two threads can share.
#pragma once

#include <cstddef>
#include <functional>

namespace zor::fs {

/// Calls `work(begin, end)` for stretches that together are 0 to `count`, each once: on this thread and, where that
/// pays and there is one to be had, on a second one at the same time. An exception of either comes out here, after both
/// have ended; then not all need have been worked on.
void forEachStretch(std::size_t count, const std::function<void(std::size_t begin, std::size_t end)>& work);

} // namespace zor::fs
