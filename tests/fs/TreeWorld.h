// SPDX-License-Identifier: Apache-2.0
// What the tests of the tree operations stand on: a world with a tree to work on and one beside it that must not
// change, and an owner of the tree who moves it about meanwhile.
#pragma once

#include "platform/FileDescriptor.h"
#include "platform/linux/LinuxDisk.h"
#include "support/FileTree.h"

#include <atomic>
#include <chrono>
#include <functional>
#include <string>
#include <thread>

namespace zor::fs::test {

/// Tests that repeat themselves take longer, and large trees are larger, with ZORVANE_TEST_LONG=1.
bool isLongRun();
std::chrono::seconds raceTime();

std::size_t openDescriptorCount();

/// Throw std::system_error when they fail; `path` may have directories in it.
platform::FileDescriptor openDirectory(int parent, const std::string& path);
void makeDirectory(int parent, const std::string& path, mode_t mode = 0755);
void makeFile(int parent, const std::string& path, const std::string& content = "x", mode_t mode = 0644);
void makeLink(int parent, const std::string& path, const std::string& target);
void makeFifo(int parent, const std::string& path);
bool exists(int parent, const std::string& path);
/// A chain of `depth` directories "d", the first in `parent`; each holds a file "f" as well.
void makeChain(int parent, std::size_t depth);
/// "a0", "a0/a1" and so on.
std::string chainPath(std::size_t depth);

/// tree/: a0/a1/…, each with a file, a link, a FIFO and a small directory; wide/: many of each. outside/: files of
/// another owner, and outside/parking/, which the vandal may move directories to.
class World {
public:
    static constexpr std::size_t chainDepth = 60;
    static constexpr std::size_t wideCount = 50;
    /// Content of every file outside, and the size of one of them in bytes.
    static constexpr const char* secret = "SECRET";
    static constexpr off_t outsideBytes = 8 * 1024 * 1024;

    explicit World(const std::string& parent = "/dev/shm");

    void makeTree();
    /// What changed outside the tree since the world was made; empty when nothing did.
    [[nodiscard]] std::string damage() const;
    [[nodiscard]] int fd() const { return root_.get(); }
    [[nodiscard]] std::string path() const { return confined_ ? "" : directory_.path(); }

    /// Runs `body` in a child for which this world is the whole file system. A walk that is wrong and leaves the tree
    /// would else take its mistake to the machine, as root. False: not permitted here. What `body` expects in vain is a
    /// failure.
    bool confined(const std::function<void()>& body);

    platform::LinuxDisk disk{platform::Syncs::off};

private:
    [[nodiscard]] std::string outside() const;

    support::TemporaryDirectory directory_;
    bool confined_ = false;
    platform::FileDescriptor root_;
    std::string before_;
};

/// From the end of its construction until it goes: moves directories of the tree out and back, puts links and FIFOs in
/// their place, adds names.
class Vandal {
public:
    explicit Vandal(const World& world);
    ~Vandal();
    Vandal(const Vandal&) = delete;
    Vandal& operator=(const Vandal&) = delete;

private:
    void run();
    void moveOutAndBack(unsigned random);
    void exchange(unsigned random);
    void replaceFile(unsigned random);

    const World& world_;
    std::atomic<bool> begun_{false};
    std::atomic<bool> stopped_{false};
    std::thread thread_;
};

} // namespace zor::fs::test
