// SPDX-License-Identifier: Apache-2.0
#include "os/SystemRoot.h"

#include "os/Names.h"
#include "os/Openat2.h"

#include <cerrno>
#include <cstdlib>
#include <fcntl.h>
#include <memory>
#include <sys/stat.h>

namespace zor::platform {

namespace {

constexpr mode_t runtimeMode = 0755;

/// Makes the directory unless it is there, and opens it.
std::expected<FileDescriptor, int> makeAndOpen(Disk& disk, int parent, const char* name) {
    const int made = disk.makeDirectory(parent, name, runtimeMode);
    if (made < 0 && made != -EEXIST)
        return std::unexpected(-made);
    auto opened = openBeneath(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (opened && made == 0) {
        // The process's umask does not decide who can reach the sockets.
        if (const int changed = disk.changeMode(opened->get(), runtimeMode); changed < 0)
            return std::unexpected(-changed);
    }
    return opened;
}

} // namespace

std::expected<SystemRoot, int> SystemRoot::open(const std::string& directory) {
    const std::unique_ptr<char, decltype(&std::free)> canonical(::realpath(directory.c_str(), nullptr), &std::free);
    if (!canonical)
        return std::unexpected(errno);
    SystemRoot root;
    root.canonicalPath_ = canonical.get();
    root.directory_.reset(::open(canonical.get(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!root.directory_.valid())
        return std::unexpected(errno);
    return root;
}

std::string SystemRoot::path(std::string_view systemPath) const {
    std::string result = isDeviceRoot() ? std::string() : canonicalPath_;
    if (systemPath.empty() || systemPath == "/")
        return isDeviceRoot() ? "/" : result;
    if (systemPath.front() != '/')
        result += '/';
    result += systemPath;
    return result;
}

int SystemRoot::makeRuntimeDirectory(Disk& disk) {
    auto parent = makeAndOpen(disk, directory_.get(), names::runParent);
    if (!parent)
        return parent.error();
    auto directory = makeAndOpen(disk, parent->get(), names::runtimeName);
    return directory ? adoptRuntimeDirectory(std::move(*directory)) : directory.error();
}

int SystemRoot::openRuntimeDirectory() {
    auto directory = openBeneath(directory_.get(), names::runtimeDirectory, O_RDONLY | O_DIRECTORY);
    return directory ? adoptRuntimeDirectory(std::move(*directory)) : directory.error();
}

int SystemRoot::adoptRuntimeDirectory(FileDescriptor directory) {
    struct stat status{};
    if (::fstat(directory.get(), &status) != 0)
        return errno;
    if ((status.st_uid != 0 && status.st_uid != ::geteuid()) || (status.st_mode & (S_IWGRP | S_IWOTH)) != 0)
        return EPERM;
    runtimeDirectory_ = std::move(directory);
    return 0;
}

} // namespace zor::platform
