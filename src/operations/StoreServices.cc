// SPDX-License-Identifier: Apache-2.0
#include "operations/StoreServices.h"

namespace zor {

void ZORDispatchAsyncWithTransaction(platform::ServiceTransactions& transactions, platform::WorkQueue& queue,
                                     std::function<void()> job) {
    queue.async([mark = transactions.hold(), job = std::move(job)] { job(); });
}

} // namespace zor
