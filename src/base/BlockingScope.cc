// SPDX-License-Identifier: Apache-2.0
#include "base/BlockingScope.h"

namespace zor::platform {

namespace {
thread_local BlockingObserver* threadObserver = nullptr;
}

void BlockingObserver::setForThisThread(BlockingObserver* observer) {
    threadObserver = observer;
}

BlockingObserver* BlockingObserver::ofThisThread() {
    return threadObserver;
}

} // namespace zor::platform
