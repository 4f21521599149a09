// SPDX-License-Identifier: Apache-2.0
// Container classes inside the daemon: the numbers and names of the protocol, the sets that operations ask about, and
// the users whose containers a request may act on: the owner that each class demands, and what a client's own uid
// allows.
#pragma once

#include "base/Mutex.h"
#include "base/ZORError.h"
#include "ipc/Protocol.h"
#include "ipc/UserNumbers.h"
#include "platform/Device.h"

#include <atomic>
#include <cstdint>

namespace zor {

using ipc::ContainerClass;
using ipc::isBundleClass;
using ipc::isSystemClass;

[[nodiscard]] constexpr bool isValidClass(ContainerClass containerClass) {
    return ipc::isContainerClass(static_cast<std::uint64_t>(containerClass));
}

/// Classes whose containers lie in a mobile user's home. They are also the ones that carry a sandbox mapping.
[[nodiscard]] constexpr bool isPerUserClass(ContainerClass containerClass) {
    return isValidClass(containerClass) && !isBundleClass(containerClass) && !isSystemClass(containerClass);
}

/// The class's name, which is also its path below a base directory. Only for valid classes; NUL-terminated.
[[nodiscard]] constexpr const char* className(ContainerClass containerClass) {
    return ipc::containerClassNames[static_cast<std::size_t>(containerClass)].data();
}

using ipc::UserNumbers;

class UserIdentity {
public:
    UserIdentity(const Log& log, const platform::PasswordDatabase& passwords, const UserNumbers& numbers)
        : log_(log), passwords_(passwords), numbers_(numbers) {}

    /// The user that a request acts on, or error 38 (logged). `requested` is the low 32 bits of what the client sent.
    [[nodiscard]] Result<std::uint32_t> validateUserId(std::uint32_t requested, ContainerClass containerClass,
                                                       std::uint32_t clientUserId);
    /// The uid of the account "mobile", 0 when there is none. Looked up once, and again as long as it was not found: an
    /// account can be added. Callers that come while one looks wait for its answer.
    [[nodiscard]] std::uint32_t getCurrentMobileUserId();

private:
    const Log& log_;
    const platform::PasswordDatabase& passwords_;
    const UserNumbers numbers_;
    platform::Mutex lookup_; // held while the database is asked
    bool saidMissing_ ZOR_GUARDED_BY(lookup_) = false;
    static constexpr std::int64_t notLookedUp = -1;
    std::atomic<std::int64_t> mobileUserId_{notLookedUp};
};

} // namespace zor
