// SPDX-License-Identifier: Apache-2.0
// A system root of a test's own, and short ways to put files into it.
#pragma once

#include "os/LinuxDisk.h"
#include "os/SystemRoot.h"
#include "support/FileTree.h"

#include <chrono>
#include <fcntl.h>
#include <fstream>
#include <functional>
#include <gtest/gtest.h>
#include <iterator>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <thread>
#include <vector>

namespace zor::platform {

/// Waits for something that another thread or the kernel brings about.
inline bool eventually(const std::function<bool()>& condition,
                       std::chrono::milliseconds limit = std::chrono::seconds(10)) {
    const auto end = std::chrono::steady_clock::now() + limit;
    while (!condition()) {
        if (std::chrono::steady_clock::now() > end)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
}

/// Does the job in so many threads at once, each of which gets its number, and waits for them.
inline void inThreads(unsigned count, const std::function<void(unsigned)>& job) {
    std::vector<std::jthread> threads;
    for (unsigned i = 0; i < count; ++i)
        threads.emplace_back(job, i);
}

class TestRoot {
public:
    explicit TestRoot(const std::string& parent = "/tmp") : directory_(parent) {
        ::chmod(directory_.path().c_str(), 0755);
        root_ = std::make_unique<SystemRoot>(SystemRoot::open(directory_.path()).value());
        EXPECT_EQ(root_->makeRuntimeDirectory(disk_), 0);
    }

    [[nodiscard]] const SystemRoot& root() const { return *root_; }
    [[nodiscard]] Disk& disk() { return disk_; }
    [[nodiscard]] std::string path(std::string_view relative) const {
        return directory_.path() + "/" + std::string(relative);
    }

    /// Makes the directories of a path, 0755 each.
    void makeDirectories(std::string_view relative) const {
        for (std::size_t end = relative.find('/');; end = relative.find('/', end + 1)) {
            const std::string directory = path(relative.substr(0, end));
            if (::mkdir(directory.c_str(), 0755) == 0)
                ::chmod(directory.c_str(), 0755);
            if (end == std::string_view::npos)
                return;
        }
    }
    void write(std::string_view relative, std::string_view text, mode_t mode = 0644) const {
        if (relative.find('/') != std::string_view::npos)
            makeDirectories(relative.substr(0, relative.rfind('/')));
        std::ofstream(path(relative), std::ios::trunc) << text;
        ::chmod(path(relative).c_str(), mode);
    }
    /// As whoever writes the files of a running system does it.
    void replace(std::string_view relative, std::string_view text, mode_t mode = 0644) const {
        const std::string temporary = std::string(relative) + "~";
        write(temporary, text, mode);
        EXPECT_EQ(::rename(path(temporary).c_str(), path(relative).c_str()), 0);
    }
    [[nodiscard]] std::string read(std::string_view relative) const {
        std::ifstream file(path(relative));
        return {std::istreambuf_iterator<char>(file), {}};
    }

private:
    support::TemporaryDirectory directory_;
    LinuxDisk disk_{Syncs::off};
    std::unique_ptr<SystemRoot> root_;
};

} // namespace zor::platform
