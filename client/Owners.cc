// SPDX-License-Identifier: Apache-2.0
// Which users own containers on a root: what the daemon there has written beside its sockets.
#include "ipc/Protocol.h"
#include "ipc/UserNumbers.h"
#include "os/FileDescriptor.h"
#include "zorvane/Client.h"

#include <array>
#include <cerrno>
#include <fcntl.h>
#include <unistd.h>

namespace zorvane {

namespace ipc = zor::ipc;

namespace {

/// Four short lines.
constexpr std::size_t fileBytesMax = 512;

/// Empty where there is none: then the usual numbers hold.
std::string textBelow(std::string path) {
    path.append("/").append(ipc::runtimeDirectory).append("/").append(ipc::usersFile);
    const zor::platform::FileDescriptor file(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    std::array<char, fileBytesMax> bytes;
    const ssize_t count = file.valid() ? ::read(file.get(), bytes.data(), bytes.size()) : 0;
    return {bytes.data(), count > 0 ? static_cast<std::size_t>(count) : 0};
}

} // namespace

ContainerOwners containerOwners(const std::string& root) {
    const auto noAccount = [](auto) { return zor::Errno(ENOENT); };
    const auto read = ipc::readUserNumbers(textBelow(root), {.named = noAccount, .numbered = noAccount});
    const ipc::UserNumbers numbers = read ? read->numbers : ipc::UserNumbers();
    return {.installer = numbers.installer, .system = numbers.system, .first = numbers.first, .last = numbers.last};
}

std::uint32_t defaultUserOfClass(std::uint64_t number, const std::string& root) {
    const auto containerClass = static_cast<ipc::ContainerClass>(number);
    if (ipc::isBundleClass(containerClass))
        return containerOwners(root).installer;
    return ipc::isSystemClass(containerClass) ? containerOwners(root).system : currentMobileUser;
}

} // namespace zorvane
