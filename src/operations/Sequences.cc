// SPDX-License-Identifier: Apache-2.0
#include "operations/Sequences.h"

#include <algorithm>
#include <unistd.h>

namespace zor {

namespace {
constexpr const char* function = "deleteDataContainerContentForUser";
}

Result<void> Wipe::checkWipe(const Caller& caller, std::uint32_t userId, const std::string* identifier,
                             ContainerClass containerClass) {
    const auto refuse = [&](ErrorCode code, const std::string& message) -> Result<void> {
        needs_.log.write(logLevelError, function, "%s", message.c_str());
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
    if (caller.allowOtherIdLookup)
        return {};
    if (containerClass != ContainerClass::dataKolvexPlugin)
        return refuse(ErrorCode::invalidObject,
                      formatted("Can't wipe container with of type: %llu, identifier: %s, userId: %u", classNumber,
                                ZOR_SHOWN(*identifier), userId));
    const auto& entitled = caller.entitledWipeIdentifiers;
    if (!entitled || std::ranges::find(*entitled, *identifier) == entitled->end())
        return refuse(ErrorCode::notEntitled,
                      formatted("Not entitled to wipe container with identifier: %s", ZOR_SHOWN(*identifier)));
    return {};
}

Result<void> Wipe::deleteDataContainerContentForUser(const Caller& caller, std::uint32_t userId,
                                                     const std::string* identifier, ContainerClass containerClass) {
    const Reporter report(needs_.log, function);
    return needs_.boundary.run({function, __LINE__}, [&]() -> Result<void> {
        TRY(checkWipe(caller, userId, identifier, containerClass));
        const auto old = needs_.creation.createOrLookupContainerForUser(
            caller, userId, identifier, containerClass, {.createIfNecessary = false, .transient = false});
        if (!old) {
            report.write(logLevelError, "Failed to lookup existing container to wipe-identifier: %s",
                         ZOR_SHOWN(*identifier));
            return old.error();
        }
        const auto fresh = needs_.creation.createOrLookupContainerForUser(
            caller, userId, identifier, containerClass,
            {.createIfNecessary = true, .transient = true, .replacesAnother = true});
        if (!fresh) {
            report.write(logLevelError, "Failed to create transient container for wipe-identifier: %s",
                         ZOR_SHOWN(*identifier));
            return fresh.error();
        }
        auto replaced = needs_.replace.replaceContainer({.oldUuid = old->uuid,
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
            report.write(logLevelError, "Failed replace operation during delete all content");
        return replaced;
    });
}

Result<void> RetryTest::retryTestForUser(const Caller& caller, std::uint32_t userId, std::uint64_t numCrashes) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<void> {
        const Reporter report(needs_.log, "retryTestForUser");
        static const std::string identifier = "com.veltra.retryTest";
        static const std::string counterKey = "CrashCounter";
        const auto found =
            needs_.creation.createOrLookupContainerForUser(caller, userId, &identifier, ContainerClass::dataApplication,
                                                           {.createIfNecessary = true, .transient = false});
        if (!found) {
            report.write(logLevelError, "Failed to create or lookup lookup existing container for retry test: %s",
                         identifier.c_str());
            return found.error();
        }
        const ContainerAddress address{.userId = userId,
                                       .uuid = found->uuid,
                                       .identifier = identifier,
                                       .containerClass = ContainerClass::dataApplication};
        std::uint64_t remaining = numCrashes;
        if (const auto stored = needs_.infoValues.infoValueForKey(&counterKey, address)) {
            const auto counter = static_cast<std::uint32_t>(stored->asUnsigned().value_or(0));
            // A 0 stays behind when the last staging failed: nothing is left to be counted down.
            remaining = counter == 0 ? 0 : counter - 1;
        }
        report.write(logLevelError, "Crashes Remaining in retry test: %llu",
                     static_cast<unsigned long long>(remaining));
        const plist::Value value(remaining);
        TRY(needs_.infoValues.setInfoValue(caller, &value, &counterKey, address));
        if (remaining != 0) {
            report.write(logLevelError, "Crashing");
            ::_exit(0);
        }
        auto staged = needs_.deletion.stageForDeleteContainersWithUsers(
            DeletionBatch::of(userId, found->uuid, identifier, ContainerClass::dataApplication));
        if (staged)
            report.write(logLevelError, "Returning Successfully");
        else
            report.write(logLevelError, "Failed to delete retry container at : %s", found->path.c_str());
        return staged;
    });
}

} // namespace zor
