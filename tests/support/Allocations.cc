// SPDX-License-Identifier: Apache-2.0
#include "support/Allocations.h"

#include "support/Sanitized.h"

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <limits>
#include <malloc.h>
#include <new>

namespace {

constexpr std::size_t never = std::numeric_limits<std::size_t>::max();
std::atomic<std::size_t> bytesRefusedFrom{never};
thread_local std::size_t allocationsLeft = never;
thread_local bool failed = false;
thread_local std::ptrdiff_t liveBytes = 0;
thread_local std::ptrdiff_t peakOfLive = 0;

} // namespace

#ifndef ZOR_IS_SANITIZED

void* operator new(std::size_t size) {
    const bool refused = size >= bytesRefusedFrom.load(std::memory_order_relaxed) || allocationsLeft == 0;
    void* const memory = refused ? nullptr : std::malloc(size);
    if (memory == nullptr) {
        failed = true;
        throw std::bad_alloc();
    }
    if (allocationsLeft != never)
        --allocationsLeft;
    liveBytes += static_cast<std::ptrdiff_t>(malloc_usable_size(memory));
    peakOfLive = std::max(peakOfLive, liveBytes);
    return memory;
}

void operator delete(void* memory) noexcept {
    if (memory != nullptr)
        liveBytes -= static_cast<std::ptrdiff_t>(malloc_usable_size(memory));
    std::free(memory);
}

void operator delete(void* memory, std::size_t) noexcept {
    operator delete(memory);
}

#endif

namespace zor::support {

bool allocationsCanFail() {
#ifdef ZOR_IS_SANITIZED
    return false;
#else
    return true;
#endif
}

FailingAllocations::FailingAllocations(std::size_t failing) {
    failed = false;
    allocationsLeft = failing;
}

FailingAllocations::~FailingAllocations() {
    allocationsLeft = never;
}

bool FailingAllocations::anyFailed() {
    return failed;
}

NothingLarge::NothingLarge(std::size_t bytes) {
    bytesRefusedFrom = bytes;
}

NothingLarge::~NothingLarge() {
    bytesRefusedFrom = never;
}

MemoryWatch::MemoryWatch() {
    liveBytes = 0;
    peakOfLive = 0;
}

std::size_t MemoryWatch::peakBytes() const {
    return static_cast<std::size_t>(peakOfLive);
}

} // namespace zor::support
