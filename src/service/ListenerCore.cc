// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerCore.h"

namespace zor::platform {

std::shared_ptr<ListenerConnection> ListenerCore::unusedConnection() {
    const MutexLock lock(mutex);
    if (unused.empty()) {
        // So that its end needs no memory.
        unused.reserve(connections.size() + 1);
        return connections.emplace_back(std::make_shared<ListenerConnection>(*this));
    }
    ListenerConnection* connection = unused.back();
    unused.pop_back();
    return connection->shared_from_this();
}

void ListenerCore::recycle(ListenerConnection& connection) {
    const MutexLock lock(mutex);
    unused.push_back(&connection);
}

} // namespace zor::platform
