// SPDX-License-Identifier: Apache-2.0
// Keeps an application from being started while its files are changed.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zor::platform {

/// Why an application is kept from running. The numbers are those that an assertion's file holds.
enum class TerminationReason : std::uint8_t { installation = 0, cacheDeletion = 1, critical = 255 };

/// For people.
[[nodiscard]] constexpr std::string_view terminationReasonText(TerminationReason reason) {
    switch (reason) {
    case TerminationReason::installation:
        return "its files are being changed";
    case TerminationReason::cacheDeletion:
        return "its caches are being deleted";
    case TerminationReason::critical:
        break;
    }
    return "the system needs it to be still";
}

class TerminationAssertionService {
public:
    /// An assertion that was asked for. Its end gives it back.
    class Assertion {
    public:
        virtual ~Assertion() = default;
    };
    using AcquisitionHandler = std::function<void(const std::optional<std::string>& error)>;

    virtual ~TerminationAssertionService() = default;
    /// Asks for an assertion on an application. The handler is called once, on any thread and perhaps before this
    /// returns, with an error or none. nullptr: there is none to be had, and the handler may never be called. Any
    /// thread.
    virtual std::unique_ptr<Assertion> acquire(std::string_view bundleIdentifier, TerminationReason reason,
                                               AcquisitionHandler handler) = 0;
    /// Identifiers with an assertion, in ascending order.
    [[nodiscard]] virtual std::vector<std::string> held() const = 0;
};

} // namespace zor::platform
