// SPDX-License-Identifier: Apache-2.0
// The things that operations have in common: what each needs to serve a request, in whose name it acts, how a request
// names a container and which record stands for it, and work for later that nobody waits for.
#pragma once

#include "base/ContainerClass.h"
#include "base/Log.h"
#include "base/ZORError.h"
#include "base/ZORLocks.h"
#include "ipc/Identifiers.h"
#include "platform/Errno.h"
#include "platform/Process.h"
#include "store/ReplaceJournal.h"
#include "store/ZORContainerCache.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace zor {

// The services that every operation on recorded containers takes: it locks them, finds their records, says what went
// wrong, and turns an exception into an error. References to objects that outlive the operation.

struct RecordNeeds {
    const Log& log;
    ExceptionBoundary& boundary;
    ZORLocks& locks;
    ZORContainerCache& cache;
    WaitingReplaces& replaces;
};

// Work that nobody waits for: a queue, and the marks by which the daemon counts as busy while something is on it.

struct Background {
    platform::ServiceTransactions& transactions;
    platform::WorkQueue& queue;
};

/// Runs `job` later on the queue; the daemon counts as busy until it has run. Any thread.
inline void ZORDispatchAsyncWithTransaction(const Background& background, std::function<void()> job) {
    background.queue.async([mark = background.transactions.hold(), job = std::move(job)] { job(); });
}

// In whose name an operation runs: who sent the message, and what it may ask for beyond its own. A value of one thread.

struct Caller {
    std::optional<std::string> bundleIdentifier;
    std::uint32_t userId = 0;
    bool allowOtherIdLookup = false;
    std::optional<std::vector<std::string>> entitledWipeIdentifiers;
    /// The client may ask for its own identifier only, whatever its powers are.
    bool onlyOwnIdentifier = false;

    /// An owner of the root, as whom root and the daemon's own user are reported.
    [[nodiscard]] bool ownsRoot() const { return userId == 0; }

    /// The caller for whom the daemon itself acts: what a boot brings in line, what the kernel asks.
    static Caller daemonItself() {
        return {.bundleIdentifier = "com.veltra.zorvaned.internal", .userId = 0, .allowOtherIdLookup = true};
    }
};

// One container that is known by its UUID: how a request names it, and the record that stands for it.
//
// The lock of such a container is the identifier lock of its UUID's string. An absent UUID or identifier is an error.

struct ContainerAddress {
    std::uint32_t userId = 0;
    std::optional<UUID> uuid;
    std::optional<std::string> identifier;
    ContainerClass containerClass = ContainerClass::undefined;

    /// The container of an address that has been checked.
    [[nodiscard]] std::string lockName() const { return uuid->string(); }
};

/// Error 11, logged under `function`.
inline Result<void> checkAddress(const Log& log, const char* function, const ContainerAddress& address) {
    if (address.uuid && isValidClass(address.containerClass))
        return {};
    return Reporter(log, function)
        .error(ErrorCode::invalidObject, "Can't act on an invalid object: userId: %u, UUID: %s, Class: %ld",
               address.userId, address.uuid ? address.uuid->string().c_str() : "(null)",
               static_cast<long>(address.containerClass));
}
/// The cache's record of a checked address, whose lock is `held`. Error 21, logged under `function`, or the cache's;
/// WaitingReplaces::metOneUnderWay, for between its moves a replace has no live container, and has done with the info
/// of the one that is to be.
inline Result<std::shared_ptr<ZORMetadata>> knownContainer(const RecordNeeds& needs, const char* function,
                                                           const ContainerAddress& address,
                                                           const IdentifierLock& held) {
    const std::string uuid = address.uuid->string();
    ZOR_ASSERT(held.identifier() == uuid);
    auto record = TRY(needs.cache.containerForUser(address.userId, address.containerClass,
                                                   address.identifier ? &*address.identifier : nullptr, uuid));
    if (record || address.identifier)
        TRY(needs.replaces.refuseIfUnderWay(address.userId, address.containerClass,
                                            record ? record->identifier() : *address.identifier));
    if (record)
        return record;
    return Reporter(needs.log, function)
        .error(ErrorCode::notFound, "No Container with userId: %u UUID: %s, identifier: %s, Class: %ld", address.userId,
               uuid.c_str(), ZOR_SHOWN(address.identifier), static_cast<long>(address.containerClass));
}

} // namespace zor
