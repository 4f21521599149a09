// SPDX-License-Identifier: Apache-2.0
#include "operations/InfoValues.h"

#include "plist/Value.h"

#include <cerrno>
#include <optional>

namespace zor {

namespace {

constexpr const char* setFunction = "setInfoValue";
constexpr const char* getFunction = "infoValueForKey";

/// Whether it was the content that made the write fail, not the disk.
bool cannotBeHeld(const ZORError& error) {
    return error.underlying() && (error.underlying()->isPosix(EFBIG) || error.underlying()->isPosix(EINVAL));
}

} // namespace

Result<void> InfoValues::checkInfoShare(const Caller& caller, const ZORMetadata& record,
                                        const plist::Dictionary& info) {
    if (caller.ownsRoot())
        return {};
    const std::size_t before = record.info() ? plist::heldBytes(*record.info()) : 0;
    const std::size_t bytes = plist::heldBytes(info);
    if (bytes <= before)
        return {};
    const std::size_t held = needs_.cache.heldByUser(record.uid()).infoBytes;
    if (held + bytes - before <= needs_.limits.infoBytesMaxPerUser)
        return {};
    const ZORError cause =
        posixError({setFunction, __LINE__}, Errno(EDQUOT),
                   "the info values of user %u's containers take %llu bytes, and no more may be kept", record.uid(),
                   static_cast<unsigned long long>(held));
    return Reporter(needs_.log, setFunction)
        .error(ErrorCode::propertyListNotWritten, &cause, "Failed to write metadata dictionary to URL %s",
               record.url().c_str());
}

Result<void> InfoValues::checkSet(const std::string* key, const ContainerAddress& address) {
    TRY(checkAddress(needs_.log, setFunction, address));
    if (key)
        return {};
    return Reporter(needs_.log, setFunction)
        .error(ErrorCode::valueNotAllowed, "Can't set nil or non-VString key: %s", "(null)");
}

Result<void> InfoValues::setInfoValue(const Caller& caller, const plist::Value* value, const std::string* key,
                                      const ContainerAddress& address) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<void> {
        TRY(checkSet(key, address));
        return needs_.replaces.undisturbed([&] {
            const IdentifierWriteLock lock(needs_.locks, address.lockName(), Touches::nothing());
            return set(caller, value, *key, address, lock);
        });
    });
}

Result<void> InfoValues::setInfoValue(const Caller& caller, const plist::Value* value, const std::string* key,
                                      const ContainerAddress& address, const IdentifierWriteLock& held) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<void> {
        TRY(checkSet(key, address));
        return set(caller, value, *key, address, held);
    });
}

Result<void> InfoValues::set(const Caller& caller, const plist::Value* value, const std::string& key,
                             const ContainerAddress& address, const IdentifierWriteLock& held) {
    const auto record = TRY(knownContainer(needs_, setFunction, address, held));
    plist::Dictionary info = record->info() ? *record->info() : plist::Dictionary();
    if (value)
        info.set(key, *value);
    else
        info.erase(key);
    TRY(checkInfoShare(caller, *record, info));
    const ZORMetadata::Info before = record->info();
    record->setInfo(std::make_shared<const plist::Dictionary>(std::move(info)));
    if (auto written = record->writeMetadataToDiskWithError(needs_.log, needs_.fileManager); !written) {
        if (cannotBeHeld(written.error())) {
            record->setInfo(before);
            return written;
        }
        record->setInfoIsSaved(false);
        someIsNotSaved_ = true;
        return written;
    }
    record->setInfoIsSaved(true);
    const auto added = needs_.cache.addContainerMetadata(record, address.userId, record->place(), record->transient());
    if (!added)
        return Reporter(needs_.log, setFunction)
            .error(ErrorCode::cacheAddFailed, &added.error(), "Failed to add to cache: %s, url: %s, transient: %d",
                   ZOR_SHOWN(record->identifier()), record->url().c_str(), record->transient());
    return {};
}

Result<void> InfoValues::checkGet(const std::string* key, const ContainerAddress& address) {
    TRY(checkAddress(needs_.log, getFunction, address));
    if (key)
        return {};
    return Reporter(needs_.log, getFunction)
        .error(ErrorCode::valueNotAllowed, "Can't get nil or non-VString key: %s", "(null)");
}

Result<plist::Value> InfoValues::infoValueForKey(const std::string* key, const ContainerAddress& address) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<plist::Value> {
        TRY(checkGet(key, address));
        return needs_.replaces.undisturbed([&] {
            const IdentifierLock lock(needs_.locks, address.lockName(), LockMode::reading);
            return get(*key, address, lock);
        });
    });
}

Result<plist::Value> InfoValues::infoValueForKey(const std::string* key, const ContainerAddress& address,
                                                 const IdentifierLock& held) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<plist::Value> {
        TRY(checkGet(key, address));
        return get(*key, address, held);
    });
}

Result<plist::Value> InfoValues::get(const std::string& key, const ContainerAddress& address,
                                     const IdentifierLock& held) {
    const auto record = TRY(knownContainer(needs_, getFunction, address, held));
    const plist::Value* value = record->info() ? record->info()->find(key) : nullptr;
    if (!value)
        return Reporter(needs_.log, getFunction)
            .unlogged(ErrorCode::infoKeyNotFound, "Didn't find info value for key: %s", ZOR_SHOWN(key));
    return *value;
}

Result<ContainerMetadata> InfoValues::metadataForUser(const ContainerAddress& address) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<ContainerMetadata> {
        constexpr const char* function = "metadataForUser";
        TRY(checkAddress(needs_.log, function, address));
        return needs_.replaces.undisturbed([&]() -> Result<ContainerMetadata> {
            const IdentifierLock lock(needs_.locks, address.lockName(), LockMode::reading);
            const auto record = TRY(knownContainer(needs_, function, address, lock));
            return ContainerMetadata{
                .path = record->url().path(), .transient = record->transient(), .info = record->info()};
        });
    });
}

} // namespace zor
