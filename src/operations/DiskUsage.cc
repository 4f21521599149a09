// SPDX-License-Identifier: Apache-2.0
#include "operations/DiskUsage.h"

#include "base/Mutex.h"
#include "ipc/Protocol.h"

#include <cerrno>
#include <expected>

namespace zor {

namespace {

constexpr const char* measurementFunction = "diskUsageForUserId";
const std::string staticDiskUsageKey(ipc::infoKeys::staticDiskUsage);

/// Any number counts, read as an unsigned one.
std::optional<std::uint64_t> numberIn(const plist::Value& value) {
    if (const auto number = value.asSigned())
        return static_cast<std::uint64_t>(*number);
    if (const double* real = value.asReal(); real && *real > -1 && *real < 0x1p64)
        return static_cast<std::uint64_t>(*real);
    return value.asUnsigned();
}

/// The size that an earlier measurement left. The caller holds the lock of the record's container.
std::optional<std::uint64_t> keptDiskUsage(const ZORMetadata& record) {
    const plist::Value* const value = record.info() ? record.info()->find(staticDiskUsageKey) : nullptr;
    return value ? numberIn(*value) : std::nullopt;
}

} // namespace

void DiskUsage::keepDiskUsage(const Caller& caller, const ContainerAddress& address, const FileURL& measured,
                              std::uint64_t bytes) {
    const IdentifierWriteLock lock(needs_.locks, address.lockName(), Touches::nothing());
    const auto record = needs_.cache.containerForUser(address.userId, address.containerClass, &*address.identifier,
                                                      address.uuid->string());
    if (!record || !*record || (*record)->transient() || (*record)->url() != measured)
        return;
    const plist::Value value(bytes);
    const auto kept = needs_.infoValues.setInfoValue(caller, &value, &staticDiskUsageKey, address, lock);
    if (!kept && !WaitingReplaces::metOneUnderWay(kept.error()))
        needs_.log.write(logLevelError, measurementFunction,
                         "Error setting info value for userId: %u, identifier: %s, Class: %llu: %llu", address.userId,
                         ZOR_SHOWN(address.identifier), static_cast<unsigned long long>(address.containerClass),
                         static_cast<unsigned long long>(kept.error().replyCode()));
}

Result<std::uint64_t> DiskUsage::diskUsage(const Caller& caller, const ContainerAddress& address) {
    TRY(checkAddress(needs_.log, measurementFunction, address));
    bool isKept = false;
    FileURL container;
    fs::OpenResult directory = Errno(ENOENT);
    {
        const IdentifierWriteLock lock(needs_.locks, address.lockName(), Touches::nothing());
        const auto record = TRY(knownContainer(needs_, measurementFunction, address, lock));
        isKept = isBundleClass(address.containerClass) && !record->transient();
        if (isKept)
            if (const auto kept = keptDiskUsage(*record))
                return *kept;
        container = record->url();
        directory = needs_.fileManager.resolver().openDirectory(container);
        // The size of another's directory that was renamed to the container's name is not told.
        if (directory && !needs_.fileManager.judgeOwner(
                             directory->get(), container,
                             ZORGlobalConfiguration::ownerOfClassDirectory(address.containerClass, address.userId)))
            directory = Errno(EPERM);
    }
    const auto begin = std::chrono::system_clock::now();
    const fs::Usage usage = [&] {
        const platform::BlockingScope blocking(
            platform::Load::heavy); // a large tree must not take one of the few threads from all clients
        return needs_.fileManager.diskUsageOfDirectory(directory, container);
    }();
    const bool settled = usage.lastChange + settledTime <= begin;
    if (isKept && !usage.cutShort && settled)
        keepDiskUsage(caller, address, container, usage.bytes);
    return usage.bytes;
}

DiskUsageAnswer DiskUsage::diskUsageForUserId(const Caller& caller, const ContainerAddress& address) {
    const auto measured = needs_.boundary.run({measurementFunction, __LINE__}, [&] {
        return needs_.replaces.undisturbed([&] { return diskUsage(caller, address); });
    });
    if (measured)
        return {.bytes = *measured};
    return {.bytes = 0, .error = measured.error().replyCode()};
}

} // namespace zor
