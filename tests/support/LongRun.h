// SPDX-License-Identifier: Apache-2.0
// Whether tests take their long forms: longer races, larger trees, every crash scenario.
#pragma once

#include <cstdlib>

namespace zor::support {

inline bool isLongRun() {
    return std::getenv("ZORVANE_TEST_LONG") != nullptr;
}

/// How long a race is to last.
inline int raceSeconds() {
    return isLongRun() ? 30 : 2;
}

} // namespace zor::support
