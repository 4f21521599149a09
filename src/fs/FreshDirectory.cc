// SPDX-License-Identifier: Apache-2.0
#include "fs/FreshDirectory.h"

#include "fs/BulkDirectoryRead.h"

#include <array>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::fs {

bool isFreshDirectory(int directory) {
    struct stat status{};
    if (::fstat(directory, &status) != 0 || status.st_uid != ::geteuid() || (status.st_mode & 077) != 0)
        return false;
    std::array<std::byte, 1024> buffer;
    BulkDirectoryRead entries(directory, buffer);
    return entries.seek(0) == 0 && entries.next() == nullptr && entries.error() == 0;
}

} // namespace zor::fs
