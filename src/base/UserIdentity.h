// SPDX-License-Identifier: Apache-2.0
// The users whose containers a request may act on: the owner that each class demands, and what a client's own uid
// allows.
#pragma once

#include "base/ContainerClass.h"
#include "base/Mutex.h"
#include "base/ZORError.h"
#include "ipc/UserNumbers.h"
#include "platform/Device.h"

#include <atomic>
#include <cstdint>

namespace zor {

using ipc::UserNumbers;

class UserIdentity {
public:
    UserIdentity(const Log& log, const platform::PasswordDatabase& passwords, const UserNumbers& numbers)
        : log_(log), passwords_(passwords), numbers_(numbers) {}

    /// The user that a request acts on, or error 38 (logged). `requested` is the low 32 bits of what the client sent.
    [[nodiscard]] Result<std::uint32_t> validateUserId(std::uint32_t requested, ContainerClass containerClass,
                                                       std::uint32_t clientUserId);
    /// The uid of the account "mobile", 0 when there is none. Looked up once, and again as long as it was not found: an
    /// account can be added. Concurrent first callers wait for it.
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
