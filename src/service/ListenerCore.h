// SPDX-License-Identifier: Apache-2.0
// The state that the connections of one listener share. It outlives them while they are open.
#pragma once

#include "base/Mutex.h"
#include "platform/Service.h"
#include "service/ListenerConnection.h"
#include "service/ListenerIncidents.h"
#include "service/ListenerLimits.h"
#include "service/ListenerPool.h"

#include <memory>
#include <utility>
#include <vector>

namespace zor::platform {

struct ListenerCore {
    ListenerCore(const ListenerLimits& theLimits, ListenerReport report)
        : limits(theLimits), charges(theLimits), incidents(std::move(report), theLimits.incidentLineEvery),
          pool(theLimits) {}

    [[nodiscard]] std::shared_ptr<ListenerConnection> unusedConnection() ZOR_EXCLUDES(mutex);
    /// The connection has ended and its object may be used for another.
    void recycle(ListenerConnection& connection) ZOR_EXCLUDES(mutex);

    const ListenerLimits limits;
    ServiceHandler handler;
    ListenerCharges charges;
    ListenerIncidents incidents;
    std::atomic<std::uint64_t> accepted{0};

    Mutex mutex;
    std::vector<std::shared_ptr<ListenerConnection>> connections ZOR_GUARDED_BY(mutex);
    std::vector<ListenerConnection*> unused ZOR_GUARDED_BY(mutex);

    /// Last: its threads use all of the above.
    ListenerPool pool;
};

} // namespace zor::platform
