// SPDX-License-Identifier: Apache-2.0
#include "fs/OwnedFile.h"

#include "os/Openat2.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::fs {

namespace {

/// EPERM for a file that somebody else may have written.
int judge(const struct stat& status, std::size_t bytesMax, std::optional<uid_t> formerOwner) {
    const bool trustedOwner = status.st_uid == 0 || status.st_uid == ::geteuid() || status.st_uid == formerOwner;
    if (!S_ISREG(status.st_mode) || status.st_nlink != 1 || !trustedOwner || (status.st_mode & (S_IWGRP | S_IWOTH)))
        return EPERM;
    return static_cast<std::size_t>(status.st_size) > bytesMax ? EFBIG : 0;
}

} // namespace

std::expected<plist::Data, int> readOwnedFile(int directory, const char* path, std::size_t bytesMax,
                                              std::optional<uid_t> formerOwner) {
    const auto file = platform::openBeneathOnMount(directory, path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
    if (!file)
        return std::unexpected(file.error());
    struct stat status{};
    if (::fstat(file->get(), &status) != 0)
        return std::unexpected(errno);
    if (const int refused = judge(status, bytesMax, formerOwner))
        return std::unexpected(refused);
    // One that grows meanwhile is read to its old size.
    plist::Data bytes(static_cast<std::size_t>(status.st_size));
    std::size_t length = 0;
    while (length < bytes.size()) {
        const ssize_t count = ::read(file->get(), bytes.data() + length, bytes.size() - length);
        if (count < 0 && errno == EINTR)
            continue;
        if (count < 0)
            return std::unexpected(errno);
        if (count == 0)
            break;
        length += static_cast<std::size_t>(count);
    }
    bytes.resize(length);
    return bytes;
}

} // namespace zor::fs
