// SPDX-License-Identifier: Apache-2.0
// The resources of a process that an operation could leak: descriptors and threads.
#pragma once

#include <filesystem>
#include <map>
#include <string>
#include <thread>
#include <unistd.h>

namespace zor::support {

class ProcessResources {
public:
    /// As they are now.
    ProcessResources() : descriptors_(openDescriptors()) {
        // The first thread that a process starts can bring one of the runtime's own with it (the thread sanitizer's).
        static const bool runtimeStarted = [] {
            std::thread([] {}).join();
            ::usleep(10'000); // until the one that was joined is no longer listed
            return true;
        }();
        threads_ = runtimeStarted ? countThreads() : 0;
    }
    /// The resources that have come since, in words; empty when there are none. Threads get a second to end.
    [[nodiscard]] std::string leakedSince() const {
        std::string leaked;
        for (const auto& [fd, target] : openDescriptors())
            if (!descriptors_.contains(fd))
                leaked += "descriptor " + std::to_string(fd) + " of " + target + "; ";
        for (int tries = 0; countThreads() > threads_ && tries < 2000; ++tries)
            ::usleep(500);
        return countThreads() > threads_ ? leaked + "threads; " : leaked;
    }

private:
    static std::map<int, std::string> openDescriptors() {
        std::map<int, std::string> found;
        std::error_code ignored;
        for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd"))
            found.emplace(std::stoi(entry.path().filename()), std::filesystem::read_symlink(entry, ignored));
        // The one that reads the directory was closed meanwhile.
        std::erase_if(found,
                      [](const auto& one) { return one.second == "/proc/" + std::to_string(::getpid()) + "/fd"; });
        return found;
    }
    static std::ptrdiff_t countThreads() {
        return std::distance(std::filesystem::directory_iterator("/proc/self/task"), {});
    }

    std::map<int, std::string> descriptors_;
    std::ptrdiff_t threads_ = 0;
};

} // namespace zor::support
