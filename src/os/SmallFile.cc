// SPDX-License-Identifier: Apache-2.0
#include "os/SmallFile.h"

#include <algorithm>
#include <cerrno>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::platform {

std::expected<std::string, int> readSmallFile(int fd, std::size_t bytesMax) {
    struct stat status{};
    if (::fstat(fd, &status) != 0)
        return std::unexpected(errno);
    if (!S_ISREG(status.st_mode))
        return std::unexpected(EINVAL);
    // The size is a hint only: files of procfs say 0, and others may grow meanwhile.
    constexpr std::size_t readBytesMin = 512;
    std::string bytes;
    std::size_t filled = 0;
    for (;;) {
        if (filled > bytesMax)
            return std::unexpected(EFBIG);
        if (filled == bytes.size()) {
            const std::size_t hinted = std::max(static_cast<std::size_t>(status.st_size) + 1, readBytesMin);
            bytes.resize(std::min(std::max(hinted, filled * 2), bytesMax + 1));
        }
        const ssize_t count = ::read(fd, bytes.data() + filled, bytes.size() - filled);
        if (count < 0 && errno == EINTR)
            continue;
        if (count < 0)
            return std::unexpected(errno);
        if (count == 0)
            break;
        filled += static_cast<std::size_t>(count);
    }
    bytes.resize(filled);
    return bytes;
}

} // namespace zor::platform
