// SPDX-License-Identifier: Apache-2.0
// How many bytes a container takes. What a live bundle takes is measured once and kept with its info, since its content
// does not change; everything else is measured each time. A transient bundle is being filled.
//
// A bundle that is being filled is measured too, but not kept: nothing of what was walked may have changed within
// usageSettledTime before the walk, or in it. What is not seen: a fill that pauses for longer than that, and one that
// begins during the walk in what was walked before, below the container's own directory.
//
// The walk holds no lock: a lookup waits for every identifier lock, so a large container would stop all clients for as
// long as it is walked. The container is looked up and opened under its lock, and walked on that descriptor; the result
// is kept only if the lock, taken again, finds the same container at the same place.
#include "base/BlockingScope.h"
#include "ipc/Keys.h"
#include "operations/StoreServices.h"
#include "operations/ZORClientConnection.h"

#include <cerrno>
#include <expected>

namespace zor {

namespace {

constexpr const char* function = "diskUsageForUserId";
const std::string staticDiskUsageKey(ipc::infoKeys::staticDiskUsage);

/// Any number counts, read as an unsigned one.
std::optional<std::uint64_t> numberIn(const plist::Value& value) {
    if (const auto number = value.asSigned())
        return static_cast<std::uint64_t>(*number);
    if (const double* real = value.asReal(); real && *real > -1 && *real < 0x1p64)
        return static_cast<std::uint64_t>(*real);
    return value.asUnsigned();
}

} // namespace

std::optional<std::uint64_t> ZORClientConnection::keptDiskUsage(const ContainerAddress& address) {
    const auto value = infoValueForKey(&staticDiskUsageKey, address, UseLocking::no);
    if (value)
        return numberIn(*value);
    if (!value.error().is(ErrorCode::infoKeyNotFound))
        services_.log.write(
            logLevelError, function, "Error looking up info value for userId: %u, identifier: %s, Class: %llu: %llu",
            address.userId, ZOR_SHOWN(address.identifier), static_cast<unsigned long long>(address.containerClass),
            static_cast<unsigned long long>(value.error().replyCode()));
    return std::nullopt;
}

void ZORClientConnection::keepDiskUsage(const ContainerAddress& address, const FileURL& measured, std::uint64_t bytes) {
    const IdentifierLock lock(services_.locks, address.uuid->string(), LockMode::writing);
    const auto record = services_.cache.containerForUser(address.userId, address.containerClass, &*address.identifier,
                                                         address.uuid->string());
    if (!record || !*record || (*record)->transient() || (*record)->url() != measured)
        return;
    const plist::Value value(bytes);
    const auto kept = setInfoValue(&value, &staticDiskUsageKey, address, UseLocking::no);
    if (!kept)
        services_.log.write(
            logLevelError, function, "Error setting info value for userId: %u, identifier: %s, Class: %llu: %llu",
            address.userId, ZOR_SHOWN(address.identifier), static_cast<unsigned long long>(address.containerClass),
            static_cast<unsigned long long>(kept.error().replyCode()));
}

Result<std::uint64_t> ZORClientConnection::diskUsage(const ContainerAddress& address) {
    TRY(checkAddress(function, address));
    bool isKept = false;
    FileURL container;
    fs::OpenResult directory = std::unexpected(ENOENT);
    {
        const IdentifierLock lock(services_.locks, address.uuid->string(), LockMode::writing);
        const auto record = TRY(knownContainer(function, address));
        isKept = isBundleClass(address.containerClass) && !record->transient();
        if (isKept)
            if (const auto kept = keptDiskUsage(address))
                return *kept;
        container = record->url();
        directory = services_.fileManager.resolver().openDirectory(container);
        // What another keeps in a directory that was renamed to the container's name is not told.
        if (directory && !services_.fileManager.judgeOwner(
                             directory->get(), container,
                             ZORGlobalConfiguration::ownerOfClassDirectory(address.containerClass, address.userId)))
            directory = std::unexpected(EPERM);
    }
    const auto begin = std::chrono::system_clock::now();
    const fs::Usage usage = [&] {
        const platform::BlockingScope blocking; // a large tree must not take one of the few threads from all clients
        return services_.fileManager.diskUsageOfDirectory(directory, container);
    }();
    const bool settled = usage.lastChange + services_.usageSettledTime <= begin;
    if (isKept && !usage.cutShort && settled)
        keepDiskUsage(address, container, usage.bytes);
    return usage.bytes;
}

ZORClientConnection::DiskUsageAnswer ZORClientConnection::diskUsageForUserId(const ContainerAddress& address) {
    const auto measured =
        services_.boundary.run({function, __LINE__}, [&]() -> Result<std::uint64_t> { return diskUsage(address); });
    if (measured)
        return {.bytes = *measured};
    return {.bytes = 0, .error = measured.error().replyCode()};
}

} // namespace zor
