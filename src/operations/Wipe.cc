// SPDX-License-Identifier: Apache-2.0
// Emptying a data container: a fresh one takes its path and its UUID.
//
// A stop before the replace leaves a transient container, which the next one of its identifier or the next boot
// discards; from there on it is the replace's own matter.
#include "operations/StoreServices.h"
#include "operations/ZORClientConnection.h"

#include <algorithm>

namespace zor {

namespace {
constexpr const char* function = "deleteDataContainerContentForUser";
}

Result<void> ZORClientConnection::checkWipe(std::uint32_t userId, const std::string* identifier,
                                            ContainerClass containerClass) {
    const auto refuse = [&](ErrorCode code, const std::string& message) -> Result<void> {
        services_.log.write(logLevelError, function, "%s", message.c_str());
        return ZORError({function, __LINE__}, ErrorDomain::zor, static_cast<int>(code), message);
    };
    const auto classNumber = static_cast<unsigned long long>(containerClass);
    if (!identifier)
        return refuse(ErrorCode::identifierMissing,
                      formatted("Can't wipe container with nil identifier: %s, userId: %u", "(null)", userId));
    if (!isPerUserClass(containerClass))
        return refuse(ErrorCode::invalidObject,
                      formatted("Can't wipe container non-data container of type: %llu, identifier: %s, userId: %u",
                                classNumber, ZOR_SHOWN(*identifier), userId));
    if (allowOtherIdLookup())
        return {};
    if (containerClass != ContainerClass::dataKolvexPlugin)
        return refuse(ErrorCode::invalidObject,
                      formatted("Can't wipe container with of type: %llu, identifier: %s, userId: %u", classNumber,
                                ZOR_SHOWN(*identifier), userId));
    const auto& entitled = client_.entitledWipeIdentifiers;
    if (!entitled || std::ranges::find(*entitled, *identifier) == entitled->end())
        return refuse(ErrorCode::notEntitled,
                      formatted("Not entitled to wipe container with identifier: %s", ZOR_SHOWN(*identifier)));
    return {};
}

Result<void> ZORClientConnection::deleteDataContainerContentForUser(std::uint32_t userId, const std::string* identifier,
                                                                    ContainerClass containerClass) {
    return services_.boundary.run({function, __LINE__}, [&]() -> Result<void> {
        TRY(checkWipe(userId, identifier, containerClass));
        const auto old = createOrLookupContainerForUser(userId, identifier, containerClass,
                                                        {.createIfNecessary = false, .transient = false});
        if (!old) {
            services_.log.write(logLevelError, function, "Failed to lookup existing container to wipe-identifier: %s",
                                ZOR_SHOWN(*identifier));
            return old.error();
        }
        const auto fresh =
            createOrLookupContainerForUser(userId, identifier, containerClass,
                                           {.createIfNecessary = true, .transient = true, .replacesAnother = true});
        if (!fresh) {
            services_.log.write(logLevelError, function, "Failed to create transient container for wipe-identifier: %s",
                                ZOR_SHOWN(*identifier));
            return fresh.error();
        }
        auto replaced = replaceContainer({.oldUuid = old->uuid,
                                          .newUuid = fresh->uuid,
                                          .userIdOld = userId,
                                          .userIdNew = userId,
                                          .identifierOld = *identifier,
                                          .identifierNew = *identifier,
                                          .classOld = containerClass,
                                          .classNew = containerClass,
                                          .preserveOldUuid = PreserveOldUUID::yes},
                                         StartDeletionThread::yes);
        if (!replaced)
            services_.log.write(logLevelError, function, "Failed replace operation during delete all content");
        return replaced;
    });
}

} // namespace zor
