// SPDX-License-Identifier: Apache-2.0
#include "ContainerDirectory.h"

#include "fs/Durability.h"
#include "fs/Names.h"
#include "zorvane/Text.h"

#include <cerrno>
#include <fcntl.h>

namespace zorvanectl::content {

using zor::platform::FileDescriptor;

namespace {

/// Below the place of its owner's containers a container lies in its class, "Data/Application", under its own name.
constexpr int levelsBelowPlace = 3;

std::string placeOf(const std::string& path) {
    std::size_t end = path.size();
    for (int level = 0; level < levelsBelowPlace && end != std::string::npos && end > 0; ++level)
        end = path.rfind('/', end - 1);
    return end == std::string::npos ? std::string() : path.substr(0, end);
}

std::unexpected<Failure> notOpened(const std::string& path, zor::Errno error) {
    const std::string cannot = "the container " + zorvane::printable(path) + " cannot be opened";
    if (error == EXDEV)
        return failed(cannot + ": somebody has mounted a file system on the way to it; unmount that ('findmnt' shows "
                               "where)");
    if (error == EHOSTDOWN)
        return failed(cannot + ": the file system that " + zorvane::printable(placeOf(path)) +
                      " lies on does not answer; unmount what is mounted there, or bring its server back");
    if (error == ELOOP)
        return failed(cannot + ": there is a symbolic link on the way to it; put the directory back in its place");
    return failed(cannot, error);
}

} // namespace

Outcome<FileDescriptor> openToldContainer(const std::string& path, MountFence::Kind kind) {
    const std::string place = placeOf(path);
    if (!path.starts_with('/') || place.empty())
        return notOpened(path, zor::Errno(EINVAL));
    const FileDescriptor root(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!root.valid())
        return notOpened(path, zor::Errno::last());
    auto container = MountFence(root.get(), place.substr(1), kind).open(path.c_str() + 1, O_RDONLY | O_DIRECTORY);
    if (!container)
        return notOpened(path, container.error());
    return std::move(*container);
}

Outcome<FileDescriptor> openNewContainer(zor::platform::Disk& disk, const std::string& path, MountFence::Kind kind) {
    auto container = openToldContainer(path, kind);
    if (container &&
        !zor::fs::readOwnedFile(disk, container->get(), zor::names::metadataFile, zor::fs::metadataFileBytesMax))
        return failed("somebody put something else in the place of the new container");
    return container;
}

} // namespace zorvanectl::content
