// SPDX-License-Identifier: Apache-2.0
#include "support/ProcessResources.h"

#include <filesystem>
#include <iterator>
#include <thread>
#include <unistd.h>

namespace zor::support {

namespace {

std::map<int, std::string> openDescriptors() {
    std::map<int, std::string> found;
    std::error_code ignored;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd"))
        found.emplace(std::stoi(entry.path().filename()), std::filesystem::read_symlink(entry, ignored));
    // The listing's own.
    std::erase_if(found, [](const auto& one) { return one.second == "/proc/" + std::to_string(::getpid()) + "/fd"; });
    return found;
}

std::size_t countThreads() {
    const std::filesystem::directory_iterator tasks("/proc/self/task");
    return static_cast<std::size_t>(std::distance(begin(tasks), end(tasks)));
}

} // namespace

ProcessResources::ProcessResources() : descriptors_(openDescriptors()) {
    // A sanitizer's runtime may have a thread of its own, which it starts with the first of ours.
    static const bool runtimeStarted = [] {
        std::thread([] {}).join();
        ::usleep(10'000); // until the one that was joined is no longer listed
        return true;
    }();
    threads_ = runtimeStarted ? countThreads() : 0;
}

std::string ProcessResources::leakedSince() const {
    std::string leaked;
    for (const auto& [fd, target] : openDescriptors()) {
        if (!descriptors_.contains(fd))
            leaked += "descriptor " + std::to_string(fd) + " of " + target + "; ";
    }
    // A joined thread may still be listed for a moment.
    std::size_t threads = countThreads();
    for (int tries = 0; threads > threads_ && tries < 2000; ++tries) {
        ::usleep(500);
        threads = countThreads();
    }
    if (threads > threads_)
        leaked += std::to_string(threads - threads_) + " threads; ";
    return leaked;
}

} // namespace zor::support
