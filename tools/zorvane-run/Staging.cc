// SPDX-License-Identifier: Apache-2.0
#include "Staging.h"

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>

namespace zorvanerun {

using zor::platform::FileDescriptor;

namespace {

/// Made for things that are mounted for a while; the sandbox shows nothing of it.
constexpr const char* stagingDirectory = "/mnt";

/// For each place; it counts as the program's memory. An inode, which `size` does not count, takes a kilobyte of the
/// kernel's: one for each page is more than files of any content need.
constexpr const char* memoryOptions = "mode=1777,size=64m,nr_inodes=16384";

} // namespace

std::string stagedPath(std::size_t index) {
    return std::string(stagingDirectory) + "/" + std::to_string(index);
}

std::string stagedMemoryPath(std::size_t index) {
    return std::string(stagingDirectory) + "/memory" + std::to_string(index);
}

std::string stagedSocketPath() {
    return std::string(stagingDirectory) + "/socket";
}

const char* stage(const std::vector<Mount>& mounts) {
    // Copies can be made only of what is mounted in the own namespace: first they, then the new one.
    std::vector<FileDescriptor> trees;
    for (const Mount& mount : mounts) {
        FileDescriptor& tree = trees.emplace_back();
        if (!mount.descriptor.valid())
            continue;
        tree.reset(::open_tree(mount.descriptor.get(), "",
                               AT_EMPTY_PATH | AT_RECURSIVE | OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC));
        if (!tree.valid())
            return "open_tree";
    }
    if (::unshare(CLONE_NEWNS) != 0)
        return "unshare";
    // Mounts that are made here stay here.
    if (::mount(nullptr, "/", nullptr, MS_REC | MS_SLAVE, nullptr) != 0)
        return "mount of / as a slave";
    if (::mount("tmpfs", stagingDirectory, "tmpfs", MS_NOSUID | MS_NODEV | MS_NOEXEC, "mode=0700") != 0)
        return "mount of a tmpfs on /mnt";
    for (std::size_t i = 0; i < trees.size(); ++i) {
        if (!trees[i].valid())
            continue;
        const std::string place = stagedPath(i);
        if (::mkdir(place.c_str(), 0700) != 0)
            return "mkdir";
        if (::move_mount(trees[i].get(), "", AT_FDCWD, place.c_str(), MOVE_MOUNT_F_EMPTY_PATH) != 0)
            return "move_mount";
    }
    for (std::size_t i = 0; i < memoryPlaces.size(); ++i) {
        const std::string place = stagedMemoryPath(i);
        if (::mkdir(place.c_str(), 0700) != 0 ||
            ::mount("tmpfs", place.c_str(), "tmpfs", MS_NOSUID | MS_NODEV, memoryOptions) != 0)
            return "mount of a tmpfs for what is shared in memory";
    }
    return nullptr;
}

} // namespace zorvanerun
