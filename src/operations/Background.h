// SPDX-License-Identifier: Apache-2.0
// Work that nobody waits for: a queue, and the marks by which the daemon counts as busy while something is on it.
#pragma once

#include "platform/WorkQueue.h"

#include <functional>
#include <utility>

namespace zor {

struct Background {
    platform::ServiceTransactions& transactions;
    platform::WorkQueue& queue;
};

/// Runs `job` later on the queue; the daemon counts as busy until it has run. Any thread.
inline void ZORDispatchAsyncWithTransaction(const Background& background, std::function<void()> job) {
    background.queue.async([mark = background.transactions.hold(), job = std::move(job)] { job(); });
}

} // namespace zor
