// SPDX-License-Identifier: Apache-2.0
// Replaces operator new for this test program, so that "bounded memory" is measured and not believed. ThreadSanitizer
// has an operator new of its own and lets nobody replace it: there nothing is measured, and no bound is missed.
#include "plist/Samples.h"

#include <algorithm>
#include <cstdlib>
#include <malloc.h>
#include <new>

namespace {

thread_local std::ptrdiff_t liveBytes = 0;
thread_local std::ptrdiff_t peakOfLive = 0;

} // namespace

#if defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define ZOR_OPERATOR_NEW_IS_TAKEN
#endif
#endif

#ifndef ZOR_OPERATOR_NEW_IS_TAKEN

void* operator new(std::size_t size) {
    void* memory = std::malloc(size);
    if (memory == nullptr)
        throw std::bad_alloc();
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

namespace zor::plist::test {

MemoryWatch::MemoryWatch() {
    liveBytes = 0;
    peakOfLive = 0;
}

std::size_t MemoryWatch::peakBytes() const {
    return static_cast<std::size_t>(peakOfLive);
}

} // namespace zor::plist::test
