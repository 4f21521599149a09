// SPDX-License-Identifier: Apache-2.0
// Changes the data-protection class of a data container: judges the request, has the change made, records it with the
// container's info, and tells the client when it is done, which may be after the next unlock.
//
// From the first retry to its end a change holds a termination assertion on the application: nobody may run on files
// that are half changed. Any thread.
#pragma once

#include "base/ContainerClass.h"
#include "base/Log.h"
#include "base/Mutex.h"
#include "base/ZORError.h"
#include "ipc/Identifiers.h"
#include "operations/Basics.h"
#include "operations/InfoValues.h"
#include "operations/ZORDataProtectionChangeOperation.h"
#include "platform/Device.h"
#include "store/ZORContainerCache.h"

#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace zor {

// Keeps an application from running while its files are half changed: holds one assertion of the platform's service
// from its making to `invalidate`.
//
// Its holder invalidates it before dropping it. One thread at a time.

class ZORApplicationTerminationAssertion {
public:
    /// Waits until the service has granted the assertion or refused it; nullptr, logged, when there is none. `reason`
    /// is a number of platform::TerminationReason; with any other the process ends.
    [[nodiscard]] static std::unique_ptr<ZORApplicationTerminationAssertion>
    initWithBundleIdentifier(const Log& log, platform::TerminationAssertionService& service,
                             const std::string& bundleIdentifier, std::uint8_t reason);
    ~ZORApplicationTerminationAssertion();
    ZORApplicationTerminationAssertion(const ZORApplicationTerminationAssertion&) = delete;
    ZORApplicationTerminationAssertion& operator=(const ZORApplicationTerminationAssertion&) = delete;

    /// Gives the assertion back; once more does nothing.
    void invalidate() { termAssertion_.reset(); }

private:
    using Handle = std::unique_ptr<platform::TerminationAssertionService::Assertion>;
    explicit ZORApplicationTerminationAssertion(Handle handle) : termAssertion_(std::move(handle)) {}

    Handle termAssertion_;
};

class ZORDataProtectionManager {
public:
    struct Needs : RecordNeeds {
        platform::TerminationAssertionService& assertions;
        const StoreLimits& limits;
        InfoValues& infoValues;
        /// The services that each change needs.
        ZORDataProtectionChangeOperation::Needs change;
    };
    struct Request {
        std::uint32_t userId = 0;
        std::optional<std::string> identifier;
        ContainerClass containerClass = ContainerClass::undefined;
        std::int32_t dataProtectionClass = 0;
        bool isSecondOrThirdPartyApp = false;
        bool retryIfLocked = false;
        /// Asked for by an owner of the root, whom no bound keeps out.
        bool byOwner = false;
    };
    using Completion = std::function<void(ErrorCode)>;

    explicit ZORDataProtectionManager(const Needs& needs) : needs_(needs) {}
    ZORDataProtectionManager(const ZORDataProtectionManager&) = delete;
    ZORDataProtectionManager& operator=(const ZORDataProtectionManager&) = delete;

    /// The completion is called exactly once: before this returns, or later on the lock-state queue. Codes: success;
    /// 10, 11, 21, 38, 40, 61, or an errno.
    void setDataProtectionOnDataContainerForUser(const Request& request, const Completion& completion);

    /// A change that has begun and not ended.
    struct Pending {
        UUID uuid;
        std::uint32_t userId = 0;
        std::string identifier;
        ContainerClass containerClass = ContainerClass::undefined;
        std::int32_t dataProtectionClass = 0;
    };
    [[nodiscard]] std::vector<Pending> pending() ZOR_EXCLUDES(mutex_);
    [[nodiscard]] const ZORDataProtectionChangeOperation::Needs& needsOfAChange() const { return needs_.change; }

private:
    struct Change;

    /// The operation to be performed; nullptr when the container has the class already. Errors 11, 21, 38.
    Result<std::shared_ptr<ZORDataProtectionChangeOperation>> prepare(const Request& request,
                                                                      const Completion& completion);
    Result<std::shared_ptr<const ZORMetadata>> containerOf(const Request& request);
    Result<std::shared_ptr<const ZORMetadata>> copyOfRecord(const Request& request);
    Result<void> checkClass(const Request& request);
    /// Error 61 when too many wait already.
    Result<void> checkBound(const Request& request) ZOR_EXCLUDES(mutex_);
    void finish(Change& change, bool wasLocked, const std::optional<ZORError>& error);
    void record(const Change& change, const IdentifierWriteLock& held);

    const Needs needs_;
    platform::Mutex mutex_;
    std::list<Pending> pending_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor
