// SPDX-License-Identifier: Apache-2.0
// For tests of clients: the daemon ends in the middle of a request as often as it is told, then the request succeeds.
// The count is kept in the info of a container of its own, so it survives each end.
#pragma once

#include "base/ZORError.h"
#include "operations/Basics.h"
#include "operations/Creation.h"
#include "operations/Deletion.h"
#include "operations/InfoValues.h"

#include <cstdint>

namespace zor {

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
