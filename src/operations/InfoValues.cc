// SPDX-License-Identifier: Apache-2.0
// Info values and the record of one container, by its UUID.
//
// A change is one atomic replacement of the metadata file: a stop leaves the old file or the new one.
#include "operations/StoreServices.h"
#include "operations/ZORClientConnection.h"
#include "plist/Value.h"

#include <cerrno>
#include <optional>

namespace zor {

namespace {

std::string lockName(const ZORClientConnection::ContainerAddress& address) {
    return address.uuid->string();
}

/// Whether it was the content that made the write fail, not the disk.
bool cannotBeHeld(const ZORError& error) {
    return error.underlying() && (error.underlying()->isPosix(EFBIG) || error.underlying()->isPosix(EINVAL));
}

} // namespace

Result<void> ZORClientConnection::checkAddress(const char* function, const ContainerAddress& address) {
    if (address.uuid && isValidClass(address.containerClass))
        return {};
    return makeError(services_.log, {function, __LINE__}, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                     "Can't act on an invalid object: userId: %u, UUID: %s, Class: %ld", address.userId,
                     address.uuid ? address.uuid->string().c_str() : "(null)",
                     static_cast<long>(address.containerClass));
}

Result<std::shared_ptr<ZORMetadata>> ZORClientConnection::knownContainer(const char* function,
                                                                         const ContainerAddress& address) {
    auto record = TRY(services_.cache.containerForUser(address.userId, address.containerClass,
                                                       address.identifier ? &*address.identifier : nullptr,
                                                       address.uuid->string()));
    if (record)
        return record;
    return makeError(services_.log, {function, __LINE__}, ErrorCode::notFound, nullptr, LogFlag::yes,
                     "No Container with userId: %u UUID: %s, identifier: %s, Class: %ld", address.userId,
                     address.uuid->string().c_str(), ZOR_SHOWN(address.identifier),
                     static_cast<long>(address.containerClass));
}

Result<void> ZORClientConnection::checkInfoShare(const ZORMetadata& record, const plist::Dictionary& info) {
    if (ownsRoot())
        return {};
    const std::size_t before = record.info() ? plist::heldBytes(*record.info()) : 0;
    const std::size_t bytes = plist::heldBytes(info);
    if (bytes <= before)
        return {};
    const std::size_t held = services_.cache.heldByUser(record.uid()).infoBytes;
    if (held + bytes - before <= services_.limits.infoBytesMaxPerUser)
        return {};
    const ZORError cause =
        posixError({"setInfoValue", __LINE__}, EDQUOT,
                   "the info values of user %u's containers take %llu bytes, and no more may be kept", record.uid(),
                   static_cast<unsigned long long>(held));
    return makeError(services_.log, {"setInfoValue", __LINE__}, ErrorCode::propertyListNotWritten, &cause, LogFlag::yes,
                     "Failed to write metadata dictionary to URL %s", record.url().c_str());
}

Result<void> ZORClientConnection::setInfoValue(const plist::Value* value, const std::string* key,
                                               const ContainerAddress& address, UseLocking useLocking) {
    return services_.boundary.run(ZOR_HERE, [&]() -> Result<void> {
        constexpr const char* function = "setInfoValue";
        TRY(checkAddress(function, address));
        if (!key)
            return makeError(services_.log, {function, __LINE__}, ErrorCode::valueNotAllowed, nullptr, LogFlag::yes,
                             "Can't set nil or non-VString key: %s", "(null)");
        std::optional<IdentifierLock> lock;
        if (useLocking == UseLocking::yes)
            lock.emplace(services_.locks, lockName(address), LockMode::writing);
        const auto record = TRY(knownContainer(function, address));
        plist::Dictionary info = record->info() ? *record->info() : plist::Dictionary();
        if (value)
            info.set(*key, *value);
        else
            info.erase(*key);
        TRY(checkInfoShare(*record, info));
        const ZORMetadata::Info before = record->info();
        record->setInfo(std::make_shared<const plist::Dictionary>(std::move(info)));
        if (auto written = record->writeMetadataToDiskWithError(services_.log, services_.fileManager); !written) {
            if (cannotBeHeld(written.error())) {
                record->setInfo(before);
                return written;
            }
            record->setInfoIsSaved(false);
            services_.someInfoIsNotSaved = true;
            return written;
        }
        record->setInfoIsSaved(true);
        const auto added =
            services_.cache.addContainerMetadata(record, address.userId, record->place(), record->transient());
        if (!added)
            return makeError(services_.log, {function, __LINE__}, ErrorCode::cacheAddFailed, &added.error(),
                             LogFlag::yes, "Failed to add to cache: %s, url: %s, transient: %d",
                             ZOR_SHOWN(record->identifier()), record->url().c_str(), record->transient());
        return {};
    });
}

Result<plist::Value> ZORClientConnection::infoValueForKey(const std::string* key, const ContainerAddress& address,
                                                          UseLocking useLocking) {
    return services_.boundary.run(ZOR_HERE, [&]() -> Result<plist::Value> {
        constexpr const char* function = "infoValueForKey";
        TRY(checkAddress(function, address));
        if (!key)
            return makeError(services_.log, {function, __LINE__}, ErrorCode::valueNotAllowed, nullptr, LogFlag::yes,
                             "Can't get nil or non-VString key: %s", "(null)");
        std::optional<IdentifierLock> lock;
        if (useLocking == UseLocking::yes)
            lock.emplace(services_.locks, lockName(address), LockMode::reading);
        const auto record = TRY(knownContainer(function, address));
        const plist::Value* value = record->info() ? record->info()->find(*key) : nullptr;
        if (!value)
            return makeError(services_.log, {function, __LINE__}, ErrorCode::infoKeyNotFound, nullptr, LogFlag::no,
                             "Didn't find info value for key: %s", ZOR_SHOWN(*key));
        return *value;
    });
}

Result<ZORClientConnection::ContainerMetadata> ZORClientConnection::metadataForUser(const ContainerAddress& address) {
    return services_.boundary.run(ZOR_HERE, [&]() -> Result<ContainerMetadata> {
        constexpr const char* function = "metadataForUser";
        TRY(checkAddress(function, address));
        const IdentifierLock lock(services_.locks, lockName(address), LockMode::reading);
        const auto record = TRY(knownContainer(function, address));
        return ContainerMetadata{
            .path = record->url().path(), .transient = record->transient(), .info = record->info()};
    });
}

} // namespace zor
