// SPDX-License-Identifier: Apache-2.0
#include "base/ContainerClass.h"

#include <utility>

namespace zor {

Result<std::uint32_t> UserIdentity::validateUserId(std::uint32_t requested, ContainerClass containerClass,
                                                   std::uint32_t clientUserId) {
    if (isBundleClass(containerClass) || isSystemClass(containerClass)) {
        if (numbers_.mayOwn(containerClass, requested))
            return requested;
    } else if (clientUserId <= numbers_.lastSystemClient()) {
        if (requested == ipc::currentMobileUser)
            return getCurrentMobileUserId();
        if (numbers_.mayOwn(containerClass, requested))
            return requested;
    } else if (requested == ipc::currentMobileUser || requested == clientUserId) {
        return clientUserId;
    }
    const std::string text = formatted("Invalid userId %u for class %llu from client %u", requested,
                                       static_cast<unsigned long long>(containerClass), clientUserId);
    log_.writeText(logLevelError, __func__, text);
    return ZORError(ZOR_HERE, ErrorDomain::zor, static_cast<int>(ErrorCode::valueNotAllowed), text);
}

std::uint32_t UserIdentity::getCurrentMobileUserId() {
    constexpr const char* function = "__getCurrentMobileUserId_block_invoke";
    if (const std::int64_t known = mobileUserId_; known != notLookedUp)
        return static_cast<std::uint32_t>(known);
    const platform::MutexLock held(lookup_);
    if (const std::int64_t known = mobileUserId_; known != notLookedUp)
        return static_cast<std::uint32_t>(known);
    const auto entry = passwords_.entryForName("mobile");
    if (entry)
        log_.write(logLevelError, function, "Current mobile user ID is %u", entry->uid);
    else if (!std::exchange(saidMissing_, true))
        log_.write(logLevelError, function, "Failed to get mobile uid. This is bad");
    const std::uint32_t userId = entry ? entry->uid : 0;
    if (entry)
        mobileUserId_ = userId;
    return userId;
}

} // namespace zor
