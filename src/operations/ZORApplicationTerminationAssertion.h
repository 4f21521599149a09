// SPDX-License-Identifier: Apache-2.0
// Keeps an application from running while its files are half changed: holds one assertion of the platform's service
// from its making to `invalidate`.
//
// Its holder invalidates it before dropping it. One thread at a time.
#pragma once

#include "base/Log.h"
#include "platform/Device.h"

#include <cstdint>
#include <memory>
#include <string>

namespace zor {

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

} // namespace zor
