// SPDX-License-Identifier: Apache-2.0
// The services that every operation on recorded containers takes: it locks them, finds their records, says what went
// wrong, and turns an exception into an error. References to objects that outlive the operation.
#pragma once

#include "base/Log.h"
#include "base/ZORException.h"
#include "base/ZORLocks.h"
#include "store/ZORContainerCache.h"

namespace zor {

struct RecordNeeds {
    const Log& log;
    ExceptionBoundary& boundary;
    ZORLocks& locks;
    ZORContainerCache& cache;
};

} // namespace zor
