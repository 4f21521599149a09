// SPDX-License-Identifier: Apache-2.0
#include "operations/RetryTest.h"

#include <unistd.h>

namespace zor {

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
