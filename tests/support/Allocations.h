// SPDX-License-Identifier: Apache-2.0
// Memory that is watched, or that runs out. A test program that uses one of these has an operator new of its own; the
// thread and address sanitizers let nobody replace theirs: there nothing fails, and nothing is measured.
#pragma once

#include <cstddef>

namespace zor::support {

/// Whether allocations can be made to fail here.
[[nodiscard]] bool allocationsCanFail();

/// While it lives, this thread's allocations fail from the `failing`-th on, which counts from 0.
class FailingAllocations {
public:
    explicit FailingAllocations(std::size_t failing);
    ~FailingAllocations();
    /// Whether one has failed.
    [[nodiscard]] static bool anyFailed();
};

/// While it lives, no thread can allocate anything of this size or more.
class NothingLarge {
public:
    explicit NothingLarge(std::size_t bytes);
    ~NothingLarge();
};

/// Watches what this thread allocates from here on.
class MemoryWatch {
public:
    MemoryWatch();
    /// The most bytes that lived at one time since.
    [[nodiscard]] std::size_t peakBytes() const;
};

} // namespace zor::support
