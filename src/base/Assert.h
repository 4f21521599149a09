// SPDX-License-Identifier: Apache-2.0
// Conditions that only a mistake of the daemon's own can break, checked in every build: going on would cost more than a
// restart, which loses nothing that was acknowledged. Nothing that a client or a file says is judged so.
#pragma once

#include <cstdio>
#include <cstdlib>

namespace zor {

[[noreturn]] inline void assertionFailed(const char* condition, const char* file, int line) {
    std::fprintf(stderr, "%s:%d: does not hold: %s\n", file, line, condition);
    std::abort();
}

} // namespace zor

#define ZOR_ASSERT(condition)                                                                                          \
    ((condition) ? static_cast<void>(0) : ::zor::assertionFailed(#condition, __FILE_NAME__, __LINE__))
