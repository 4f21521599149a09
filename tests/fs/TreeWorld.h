// SPDX-License-Identifier: Apache-2.0
// The ground of the tests of the tree operations: a world with a tree to work on and one beside it that must not
// change, and an owner of the tree who moves it about meanwhile.
#pragma once

#include "fs/Trees.h"
#include "os/LinuxDisk.h"
#include "support/FaultDisk.h"
#include "support/FileTree.h"
#include "support/Files.h"
#include "support/LongRun.h"
#include "support/ProcessResources.h"

#include <atomic>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <random>

namespace zor::fs::test {

using platform::FileDescriptor;
using support::exists;
using support::isLongRun;
using support::makeDirectory;
using support::makeFifo;
using support::makeFile;
using support::makeItems;
using support::makeLink;
using support::openDirectory;
using support::TemporaryDirectory;

/// Calls `body` again and again for a while, until it is enough or fails.
inline void repeatForRace(const std::function<void()>& body, const std::function<bool()>& isEnough = nullptr) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(support::raceSeconds());
    while (std::chrono::steady_clock::now() < end && !testing::Test::HasFailure() && !(isEnough && isEnough()))
        body();
}
inline std::size_t openDescriptorCount() {
    // Not from /proc, which a confined test does not have.
    constexpr int descriptorsMax = 1024;
    std::size_t count = 0;
    for (int fd = 0; fd < descriptorsMax; ++fd)
        count += ::fcntl(fd, F_GETFD) >= 0 ? 1 : 0;
    return count;
}
inline struct stat statusOf(int parent, const std::string& path) {
    struct stat status{};
    support::checked(::fstatat(parent, path.c_str(), &status, AT_SYMLINK_NOFOLLOW), "stat " + path);
    return status;
}
inline std::uint64_t allocated(int parent, const std::string& path) {
    return static_cast<std::uint64_t>(statusOf(parent, path).st_blocks) * 512;
}

/// Runs `body` in a child with mounts of its own. False: not permitted here. A vain expectation of `body` is a failure.
bool inMountNamespace(const std::function<void()>& body);

/// "a0", "a0/a1" and so on.
inline std::string chainPath(std::size_t depth) {
    std::string path;
    for (std::size_t level = 0; level < depth; ++level)
        path += (level == 0 ? "a" : "/a") + std::to_string(level);
    return path;
}

/// tree/: a0/a1/…, each with a file, a link, a FIFO and a small directory; wide/: many of each. outside/: files of
/// another owner, and outside/parking/, which the vandal may move directories to.
class World {
public:
    static constexpr std::size_t chainDepth = 60;
    static constexpr std::size_t wideCount = 150;
    /// Content of every file outside, and the size of one of them in bytes.
    static constexpr const char* secret = "SECRET";
    static constexpr off_t outsideBytes = 8 * 1024 * 1024;

    World();

    void makeTree();
    /// The changes outside the tree since the world was made; empty when there are none.
    [[nodiscard]] std::string damage() const {
        const std::string now = outside();
        return now == before_ ? "" : "outside was\n" + before_ + "and is\n" + now;
    }
    [[nodiscard]] int fd() const { return root_.get(); }
    [[nodiscard]] std::string path() const { return confined_ ? "" : directory_.path(); }

    /// The same in a child for which this world is the whole file system. A walk that is wrong and leaves the tree
    /// would else take its mistake to the machine, as root.
    bool confined(const std::function<void()>& body);

    platform::LinuxDisk disk{platform::Syncs::off};

private:
    [[nodiscard]] std::string outside() const {
        return support::readTree(path() + "/outside", {"parking/moved"}).describe();
    }
    TemporaryDirectory directory_;
    bool confined_ = false;
    FileDescriptor root_;
    std::string before_;
};

/// From the end of its construction until it goes: moves directories of the tree out and back, puts links and FIFOs in
/// their place, adds names.
class Vandal {
public:
    explicit Vandal(const World& world) : world_(world) {
        thread_ = std::thread([this] {
            std::mt19937 random(static_cast<unsigned>(::getpid()));
            while (!stopped_) {
                for (int exchanges = 0; exchanges < 100 && !stopped_; ++exchanges)
                    exchange(random());
                begun_ = true;
                replaceFile(random());
                moveOutAndBack(random());
            }
        });
        while (!begun_)
            std::this_thread::yield();
    }
    ~Vandal() {
        stopped_ = true;
        thread_.join();
    }

private:
    void moveOutAndBack(unsigned random);
    void exchange(unsigned random);
    void replaceFile(unsigned random);

    const World& world_;
    std::atomic<bool> begun_{false};
    std::atomic<bool> stopped_{false};
    std::thread thread_;
};

} // namespace zor::fs::test
