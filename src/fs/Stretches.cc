// SPDX-License-Identifier: Apache-2.0
#include "fs/Stretches.h"

#include <algorithm>
#include <atomic>
#include <exception>
#include <system_error>
#include <thread>

namespace zor::fs {

namespace {

/// Below this many a second thread costs more than it brings.
constexpr std::size_t countForTwoThreads = 256;
/// The number that one thread takes at a time.
constexpr std::size_t stretchCount = 32;

} // namespace

void forEachStretch(std::size_t count, const std::function<void(std::size_t begin, std::size_t end)>& work) {
    std::atomic<std::size_t> next{0};
    const auto share = [&](std::exception_ptr& thrown) {
        try {
            for (std::size_t begin; (begin = next.fetch_add(stretchCount)) < count;)
                work(begin, std::min(begin + stretchCount, count));
        } catch (...) {
            thrown = std::current_exception();
        }
    };
    std::exception_ptr otherThrown;
    std::thread other;
    if (count >= countForTwoThreads) {
        try {
            other = std::thread([&] { share(otherThrown); });
        } catch (const std::system_error&) {
            other = std::thread(); // none to be had: this one works alone
        }
    }
    std::exception_ptr ownThrown;
    share(ownThrown);
    if (other.joinable())
        other.join();
    if (ownThrown || otherThrown)
        std::rethrow_exception(ownThrown ? ownThrown : otherThrown);
}

} // namespace zor::fs
