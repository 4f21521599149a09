// SPDX-License-Identifier: Apache-2.0
#include "support/ProcessResources.h"

#include <cstdlib>
#include <dirent.h>
#include <filesystem>
#include <iterator>
#include <memory>
#include <thread>
#include <unistd.h>

namespace zor::support {

namespace {

std::map<int, std::string> openDescriptors() {
    std::map<int, std::string> found;
    const std::unique_ptr<DIR, int (*)(DIR*)> stream(::opendir("/proc/self/fd"), ::closedir);
    while (const dirent* entry = ::readdir(stream.get())) {
        const int fd = std::atoi(entry->d_name);
        if (entry->d_name[0] == '.' || fd == ::dirfd(stream.get()))
            continue;
        char target[4096];
        const ssize_t length = ::readlinkat(::dirfd(stream.get()), entry->d_name, target, sizeof target);
        found.emplace(fd, std::string(target, length < 0 ? 0 : static_cast<std::size_t>(length)));
    }
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
