// SPDX-License-Identifier: Apache-2.0
// Requests that are several operations in a row. Each of those takes its locks itself, and lets them go before the
// next.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "operations/Basics.h"
#include "operations/Creation.h"
#include "operations/Deletion.h"
#include "operations/InfoValues.h"
#include "operations/Replace.h"

#include <cstdint>
#include <string>

namespace zor {

// Emptying a data container: a fresh one takes its path and its UUID.
//
// A stop before the replace leaves a transient container, which the next one of its identifier or the next boot
// discards; from there on it is the replace's own matter. Any thread; the lookup, the creation and the replace take
// their locks themselves.

class Wipe {
public:
    struct Needs {
        const Log& log;
        ExceptionBoundary& boundary;
        Creation& creation;
        Replace& replace;
    };
    explicit Wipe(const Needs& needs) : needs_(needs) {}

    /// Replaces all content of a data container by that of a fresh one; path and UUID stay. Errors 11, 18, 55, and
    /// those of creation and replace.
    Result<void> deleteDataContainerContentForUser(const Caller& caller, std::uint32_t userId,
                                                   const std::string* identifier, ContainerClass containerClass);

private:
    Result<void> checkWipe(const Caller& caller, std::uint32_t userId, const std::string* identifier,
                           ContainerClass containerClass);

    const Needs needs_;
};

// For tests of clients: the daemon ends in the middle of a request as often as it is told, then the request succeeds.
// The count is kept in the info of a container of its own, so it survives each end.

class RetryTest {
public:
    struct Needs {
        const Log& log;
        ExceptionBoundary& boundary;
        Creation& creation;
        InfoValues& infoValues;
        Deletion& deletion;
    };
    explicit RetryTest(const Needs& needs) : needs_(needs) {}

    /// Ends the process until it has done so often enough. For internal builds.
    Result<void> retryTestForUser(const Caller& caller, std::uint32_t userId, std::uint64_t numCrashes);

private:
    const Needs needs_;
};

} // namespace zor
