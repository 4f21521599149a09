// SPDX-License-Identifier: Apache-2.0
#include "fs/Durability.h"

#include "base/Try.h"

#include <cstdio>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/sysmacros.h>
#include <unistd.h>

namespace zor::fs {

namespace {

// From the kernel's statfs numbers.
constexpr long ext4Magic = 0xEF53; // ext2 and ext3 share it
constexpr long xfsMagic = 0x58465342;

/// The options in force of a mounted ext4, one a line, as its driver tells them; empty when it tells none.
std::string ext4Options(dev_t device) {
    char link[64];
    std::snprintf(link, sizeof link, "/sys/dev/block/%u:%u", major(device), minor(device));
    char target[256];
    const ssize_t length = ::readlink(link, target, sizeof target);
    if (length <= 0 || static_cast<std::size_t>(length) == sizeof target)
        return {};
    const std::string_view whole(target, static_cast<std::size_t>(length));
    const std::string path = "/proc/fs/ext4/" + std::string(whole.substr(whole.rfind('/') + 1)) + "/options";
    std::string options = "\n";
    if (std::FILE* file = std::fopen(path.c_str(), "re")) {
        char buffer[4096];
        options.append(buffer, std::fread(buffer, 1, sizeof buffer, file));
        std::fclose(file);
    }
    return options;
}

/// Only what the driver says counts: without a journal it names no data mode, and without barriers the device's cache
/// is not flushed. ext2 and ext3 disks come out right too, since it is the same driver that speaks.
bool hasOrderedJournal(dev_t device) {
    const std::string options = ext4Options(device);
    const auto has = [&](const char* option) { return options.find(option) != std::string::npos; };
    return (has("\ndata=ordered\n") || has("\ndata=journal\n")) && has("\nbarrier\n") &&
           !has("\njournal_async_commit\n");
}

bool onOneFileSystem(int one, int other) {
    struct stat status{};
    struct stat otherStatus{};
    return ::fstat(one, &status) == 0 && ::fstat(other, &otherStatus) == 0 && status.st_dev == otherStatus.st_dev;
}

} // namespace

Ordering orderingOfFileSystem(int fd) {
    struct statfs fileSystem{};
    struct stat status{};
    if (::fstatfs(fd, &fileSystem) != 0 || ::fstat(fd, &status) != 0)
        return Ordering::none;
    if (fileSystem.f_type == xfsMagic)
        return Ordering::journal;
    if (fileSystem.f_type == ext4Magic && hasOrderedJournal(status.st_dev))
        return Ordering::journal;
    return Ordering::none;
}

Ordering Durability::ordering(int fd) const {
    struct stat status{};
    if (::fstat(fd, &status) != 0)
        return Ordering::none;
    const platform::MutexLock held(mutex_);
    const auto known = orderings_.find(status.st_dev);
    if (known != orderings_.end())
        return known->second;
    return orderings_.emplace(status.st_dev, probe_(fd)).first->second;
}

Errno Durability::beforeMove(int file) const {
    return ordering(file) == Ordering::journal ? disk_.orderData(file) : disk_.syncFileSystem(file);
}

Errno Durability::beforeRemoval(int directory) const {
    return ordering(directory) == Ordering::journal ? Errno() : disk_.syncFileSystem(directory);
}

bool Durability::keepsOrder(int changed, int next) const {
    // A journal keeps the order of its own file system alone.
    return onOneFileSystem(changed, next) && ordering(changed) == Ordering::journal;
}

Errno Durability::between(int changed, int next) const {
    return keepsOrder(changed, next) ? Errno() : afterMove(changed);
}

Errno Durability::afterMove(int directory) const {
    return ordering(directory) == Ordering::journal ? disk_.sync(directory) : disk_.syncFileSystem(directory);
}

Errno Durability::afterMoves(int directory, int other) const {
    if (!onOneFileSystem(directory, other))
        TRY(afterMove(other));
    return afterMove(directory);
}

} // namespace zor::fs
