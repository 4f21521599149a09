// SPDX-License-Identifier: Apache-2.0
// Each user's part of the listener: connections and buffered bytes, counted for each user and in all.
//
// Users that the system does not know count as one (UserNumbers.h). So there are so few accounts that they stay for the
// listener's life. Every charge is given back by the object that took it; at the end everything is zero again, and the
// destructor stops the process if it is not. Any thread.
#pragma once

#include "base/Mutex.h"
#include "service/ListenerLimits.h"
#include "service/ListenerTurns.h"

#include <cstddef>
#include <map>
#include <sys/types.h>

namespace zor::platform {

class ListenerCharges {
public:
    explicit ListenerCharges(const ListenerLimits& limits) : limits_(limits) {}
    ~ListenerCharges();
    ListenerCharges(const ListenerCharges&) = delete;
    ListenerCharges& operator=(const ListenerCharges&) = delete;

    /// One user's share. Lives as long as this object.
    struct Account {
        Account(bool isOwners, unsigned threadsMax) : ownsRoot(isOwners), line(isOwners, threadsMax) {}

        const bool ownsRoot;
        /// The mutex does not guard it.
        ListenerLine line;
        std::size_t connections = 0;
        std::size_t inputBytes = 0;
        std::size_t outputBytes = 0;
    };

    /// Takes a connection. nullptr when the user, or the listener, has as many as it may.
    [[nodiscard]] Account* openConnection(uid_t uid, bool ownsRoot) ZOR_EXCLUDES(mutex_);
    void closeConnection(Account& account) ZOR_EXCLUDES(mutex_);

    /// Changes a charge from `before` to `after` bytes. False, and nothing changes, when that is too much; less is
    /// never too much.
    [[nodiscard]] bool changeInput(Account& account, std::size_t before, std::size_t after) ZOR_EXCLUDES(mutex_);
    [[nodiscard]] bool changeOutput(Account& account, std::size_t before, std::size_t after) ZOR_EXCLUDES(mutex_);

    struct Totals {
        std::size_t connections = 0;
        std::size_t inputBytes = 0;
        std::size_t outputBytes = 0;
    };
    [[nodiscard]] Totals totals() const ZOR_EXCLUDES(mutex_);

private:
    const ListenerLimits limits_;
    mutable Mutex mutex_;
    /// By UserNumbers::counted, but for owners of the root.
    std::map<uid_t, Account> accounts_ ZOR_GUARDED_BY(mutex_);
    Totals totals_ ZOR_GUARDED_BY(mutex_);
    /// The part of it that belongs to users who do not own the root.
    Totals ofOthers_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor::platform
